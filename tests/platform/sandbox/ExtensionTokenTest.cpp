// Extension tokens: round trips, any altered byte refused, other keys and
// forged signatures refused, malformed and truncated tokens refused with
// EINVAL, the form-only check where the key cannot be read, handles and
// their release, and the key file (mode 0600, one key under a race).

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "platform/sandbox/Extensions.h"
#include "platform/sandbox/SandboxKey.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace sandbox {
namespace {

using tn::test::TempDirectory;

SandboxKey keyOf(uint8_t fill) {
  SandboxKey key;
  key.fill(fill);
  return key;
}

std::string fileBytes(const std::string& path) {
  std::ifstream in(path, std::ifstream::binary);
  return std::string(std::istreambuf_iterator<char>(in), {});
}

class ExtensionTokenTest : public ::testing::Test {
 protected:
  void SetUp() override { ::setenv("TENON_ROOT", root_.path().c_str(), 1); }
  void TearDown() override { ::unsetenv("TENON_ROOT"); }

  std::string keyPath() const { return root_ / "var/lib/tenon/sandbox.key"; }

  TempDirectory root_;
};

TEST_F(ExtensionTokenTest, TokensCarryClassAndSubjectThroughAnyBytes) {
  const std::string subject = "/opt/My App;v=2/%41/\xc3\xa9";
  const std::string token = makeExtensionToken(ExtensionKind::File, "com.example.read", subject, keyOf(1));
  EXPECT_EQ(token.find(' '), std::string::npos);
  tn::Result<ExtensionToken> parsed = parseExtensionToken(token);
  ASSERT_TRUE(parsed) << parsed.error().description();
  EXPECT_EQ(parsed->kind, ExtensionKind::File);
  EXPECT_EQ(parsed->extensionClass, "com.example.read");
  EXPECT_EQ(parsed->subject, subject);
  EXPECT_TRUE(hasValidSignature(*parsed, keyOf(1)));
  EXPECT_FALSE(hasValidSignature(*parsed, keyOf(2)));

  const std::string service = makeExtensionToken(ExtensionKind::Service, "c", "com.example.svc", keyOf(1));
  EXPECT_EQ(parseExtensionToken(service)->kind, ExtensionKind::Service);
}

TEST_F(ExtensionTokenTest, EveryAlteredByteIsRefused) {
  tn::Result<std::string> token = issueFileExtension(kReadOnlyFileExtensionClass, root_.path(), kCanonicalPath);
  ASSERT_TRUE(token) << token.error().description();
  tn::Result<int64_t> handle = consumeExtension(*token);
  ASSERT_TRUE(handle);
  EXPECT_NE(*handle, -1);
  for (size_t i = 0; i < token->size(); ++i) {
    std::string altered = *token;
    altered[i] = static_cast<char>(altered[i] ^ 0x01);
    tn::Result<int64_t> refused = consumeExtension(altered);
    ASSERT_FALSE(refused) << "byte " << i << ": " << altered;
    EXPECT_TRUE(refused.error().code() == EINVAL || refused.error().code() == EPERM) << refused.error().description();
  }
  // Truncated anywhere.
  for (size_t length = 0; length < token->size(); ++length) {
    EXPECT_FALSE(consumeExtension(token->substr(0, length))) << length;
  }
  EXPECT_FALSE(consumeExtension(*token + "0"));
}

TEST_F(ExtensionTokenTest, TokensOfAnotherKeyOrForgedAreRefused) {
  ASSERT_TRUE(loadOrCreateSandboxKey());
  const std::string foreign = makeExtensionToken(ExtensionKind::File, "c", "/etc", keyOf(7));
  tn::Result<int64_t> refused = consumeExtension(foreign);
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code(), EPERM);

  const std::string forged = "tnx1;file;c;/etc;" + std::string(64, '0');
  EXPECT_EQ(consumeExtension(forged).error().code(), EPERM);

}

TEST_F(ExtensionTokenTest, WhereTheKeyIsUnreadableOnlyTheFormIsChecked) {
  ASSERT_TRUE(loadOrCreateSandboxKey());
  const std::string foreign = makeExtensionToken(ExtensionKind::File, "c", "/etc", keyOf(7));
  const pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    // Lose the right to read the key: as root by becoming nobody, otherwise
    // by taking the owner's read permission away.
    const bool unreadable = ::geteuid() == 0 ? ::setuid(65534) == 0 : ::chmod(keyPath().c_str(), 0) == 0;
    if (!unreadable || ::access(keyPath().c_str(), R_OK) == 0) ::_exit(2);
    tn::Result<int64_t> formOnly = consumeExtension(foreign);
    tn::Result<int64_t> malformed = consumeExtension(foreign.substr(0, foreign.size() - 1));
    const bool expected = formOnly && !malformed && malformed.error().code() == EINVAL;
    ::_exit(expected ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0) << "2: the key stayed readable; 1: the token was judged wrongly";
}

TEST_F(ExtensionTokenTest, WithoutAKeyNothingIsConsumed) {
  const std::string token = makeExtensionToken(ExtensionKind::Service, "c", "svc", keyOf(3));
  tn::Result<int64_t> refused = consumeExtension(token);
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code(), ENOKEY);
  EXPECT_FALSE(::access(keyPath().c_str(), F_OK) == 0);  // consuming never creates the key
}

TEST_F(ExtensionTokenTest, MalformedTokensAreRefusedWithEINVAL) {
  ASSERT_TRUE(loadOrCreateSandboxKey());
  const std::string signature(64, 'a');
  for (const std::string& bad :
       {std::string(), std::string("tnx1"), "tnx2;file;c;/p;" + signature, "tnx1;pipe;c;/p;" + signature,
        "tnx1;file;c;relative;" + signature, "tnx1;file;;/p;" + signature, "tnx1;file;c;;" + signature,
        "tnx1;file;c;/p%;" + signature, "tnx1;file;c;/p%4;" + signature, "tnx1;file;c;/p%G1;" + signature,
        "tnx1;file;c;/p%00;" + signature, "tnx1;file;c;/p;" + std::string(64, 'A'), std::string("tnx1;file;c;/p;abc"),
        "tnx1;file;c;/p;" + signature + ";x", "tnx1;file;c;/" + std::string(kMaxExtensionTokenSize, 'a') + ";" + signature}) {
    tn::Result<int64_t> refused = consumeExtension(bad);
    ASSERT_FALSE(refused) << bad;
    EXPECT_EQ(refused.error().code(), EINVAL) << bad;
  }
}

TEST_F(ExtensionTokenTest, HandlesAreReleasedOnceAndUnknownOnesFail) {
  tn::Result<std::string> token = issueServiceExtension("com.ostrel.tenon.plugin-service", "com.example.p", 0);
  ASSERT_TRUE(token);
  const int64_t first = *consumeExtension(*token);
  const int64_t second = *consumeExtension(*token);
  EXPECT_NE(first, second);
  EXPECT_TRUE(holdsServiceExtension("com.example.p"));
  EXPECT_TRUE(releaseExtension(first));
  EXPECT_TRUE(holdsServiceExtension("com.example.p"));
  EXPECT_TRUE(releaseExtension(second));
  EXPECT_FALSE(holdsServiceExtension("com.example.p"));
  tn::Result<void> again = releaseExtension(second);
  ASSERT_FALSE(again);
  EXPECT_EQ(again.error().code(), EBADF);
  EXPECT_EQ(releaseExtension(-1).error().code(), EBADF);

  tn::Result<std::string> file = issueFileExtension("c", root_.path(), kCanonicalPath);
  const int64_t handle = *consumeExtension(*file);
  EXPECT_TRUE(holdsFileExtension(root_ / "inner/file"));
  EXPECT_FALSE(holdsFileExtension(root_.path() + "-sibling"));
  EXPECT_TRUE(releaseExtension(handle));
}

TEST_F(ExtensionTokenTest, IssuingRefusesBadArguments) {
  EXPECT_EQ(issueFileExtension("c", "relative", 0).error().code(), EINVAL);
  EXPECT_EQ(issueFileExtension("", "/p", 0).error().code(), EINVAL);
  EXPECT_EQ(issueFileExtension("c", std::string("/p\0q", 4), 0).error().code(), EINVAL);
  EXPECT_EQ(issueServiceExtension("c", "svc", 1).error().code(), EINVAL);
  EXPECT_EQ(issueFileExtension("c", root_ / "absent", kCanonicalPath).error().code(), ENOENT);
  // Without kCanonicalPath the path is taken as given.
  tn::Result<std::string> asGiven = issueFileExtension("c", root_ / "absent/../x", 0);
  ASSERT_TRUE(asGiven);
  EXPECT_EQ(parseExtensionToken(*asGiven)->subject, root_ / "absent/../x");
}

TEST_F(ExtensionTokenTest, TheKeyFileIsCreatedOnceWithMode0600) {
  tn::Result<SandboxKey> key = loadOrCreateSandboxKey();
  ASSERT_TRUE(key);
  struct stat status {};
  ASSERT_EQ(::stat(keyPath().c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0600u);
  EXPECT_EQ(status.st_size, 32);
  EXPECT_EQ(*readSandboxKey(), *key);
  EXPECT_EQ(*loadOrCreateSandboxKey(), *key);

  // The issuer keeps its key: a file replaced under it is not seen by it
  // (no file-system work per token), while a consumer reads the new one.
  const std::string replacement = std::string(32, 'k');
  const std::string aside = keyPath() + ".new";
  tn::test::writeFile(aside, replacement, 0600);
  ASSERT_EQ(::rename(aside.c_str(), keyPath().c_str()), 0);
  EXPECT_EQ(*loadOrCreateSandboxKey(), *key);
  EXPECT_EQ(*readSandboxKey(), keyOf('k'));

  // A key file of the wrong size is refused and left alone.
  const std::string otherRoot = root_ / "other";
  tn::test::writeFile(otherRoot + "/var/lib/tenon/sandbox.key", "short", 0600);
  ::setenv("TENON_ROOT", otherRoot.c_str(), 1);
  tn::Result<SandboxKey> refused = loadOrCreateSandboxKey();
  ASSERT_FALSE(refused);
  EXPECT_EQ(refused.error().code(), EINVAL);
  EXPECT_EQ(fileBytes(otherRoot + "/var/lib/tenon/sandbox.key"), "short");
}

TEST_F(ExtensionTokenTest, ProcessesCreatingTheKeyAtOnceAgreeOnOne) {
  constexpr int kProcesses = 6;
  const std::string tokensDirectory = root_ / "tokens";
  tn::test::makeDirectory(tokensDirectory);
  std::vector<pid_t> children;
  for (int i = 0; i < kProcesses; ++i) {
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
      tn::Result<std::string> token = issueServiceExtension("c", "svc", 0);
      std::ofstream(tokensDirectory + "/" + std::to_string(i)) << (token ? *token : "");
      ::_exit(token ? 0 : 1);
    }
    children.push_back(child);
  }
  for (const pid_t child : children) {
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0);
  }
  // Every token verifies with the one key left on disk.
  for (int i = 0; i < kProcesses; ++i) {
    const std::string token = fileBytes(tokensDirectory + "/" + std::to_string(i));
    tn::Result<int64_t> handle = consumeExtension(token);
    EXPECT_TRUE(handle) << i << ": " << (handle ? "" : handle.error().description());
  }
  // No temporary file is left behind.
  size_t entries = 0;
  for ([[maybe_unused]] const auto& entry : std::filesystem::directory_iterator(root_ / "var/lib/tenon")) ++entries;
  EXPECT_EQ(entries, 1u);
}

}  // namespace
}  // namespace sandbox
