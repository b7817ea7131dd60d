// tnctl consent, as an administrator runs it: the real binary on a private
// platform root.

#include <gtest/gtest.h>

#include "platform/value/Document.h"
#include "tests/support/Subprocess.h"
#include "tests/support/TempDirectory.h"

namespace tn {
namespace {

const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");

TEST(TnctlConsent, GrantRevokeAndListWithJson) {
  test::TempDirectory root;
  const std::vector<std::string> environment = {"TENON_ROOT=" + root.path()};
  auto run = [&](std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {kTnctl, "consent"});
    return test::runProcess(arguments, environment);
  };
  ASSERT_EQ(run({"grant", "com.example.photos", "com.ostrel.privy.camera"}).exitStatus, 0);
  ASSERT_EQ(run({"grant", "com.example.photos", "com.ostrel.privy.location"}).exitStatus, 0);
  ASSERT_EQ(run({"revoke", "com.example.photos", "com.ostrel.privy.location"}).exitStatus, 0);
  ASSERT_EQ(run({"grant", "com.example.notes", "com.ostrel.privy.contacts"}).exitStatus, 0);

  const auto plain = run({"list", "com.example.photos"});
  ASSERT_EQ(plain.exitStatus, 0) << plain.err;
  EXPECT_EQ(plain.out,
            "com.example.photos com.ostrel.privy.camera granted\n"
            "com.example.photos com.ostrel.privy.location refused\n");

  const auto json = run({"list", "--json"});
  ASSERT_EQ(json.exitStatus, 0) << json.err;
  const Result<Value> listed = readDocument(json.out, "stdout");
  ASSERT_TRUE(listed.ok());
  EXPECT_EQ((*listed)["com.example.notes"],
            Value(Array{Value(Dictionary{{"service", Value("com.ostrel.privy.contacts")}, {"granted", Value(true)}})}));
  EXPECT_EQ((*listed)["com.example.photos"].array()->size(), 2u);

  const auto bad = run({"grant", "com.example.photos", "no spaces"});
  EXPECT_EQ(bad.exitStatus, 1);
  EXPECT_EQ(bad.err, "tnctl: application and service identifiers are 1 to 255 letters, digits and -._\n");

  // For scripts a change and a refusal are each one document.
  const auto changed = run({"--json", "grant", "com.example.notes", "com.ostrel.privy.camera"});
  EXPECT_EQ(changed.exitStatus, 0) << changed.err;
  const Result<Value> changedDocument = readDocument(changed.out, "stdout");
  ASSERT_TRUE(changedDocument.ok()) << changed.out;
  EXPECT_EQ((*changedDocument)["ok"], Value(true));
  const auto refused = run({"--json", "grant", "com.example.photos", "no spaces"});
  EXPECT_EQ(refused.exitStatus, 1);
  const Result<Value> refusedDocument = readDocument(refused.out, "stdout");
  ASSERT_TRUE(refusedDocument.ok()) << refused.out;
  EXPECT_EQ((*refusedDocument)["ok"], Value(false));
}

}  // namespace
}  // namespace tn
