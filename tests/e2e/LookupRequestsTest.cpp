// "find" end to end: the real tenond builds the plug-in's record from the
// registrar, answers its form with the annotation and sandbox tokens, and a
// plug-in with the auto-elect entitlement gets its election written to the
// annotation file when its record is first built.

#include <gtest/gtest.h>

#include <filesystem>

#include "platform/relay/Frame.h"
#include "platform/value/Document.h"
#include "platform/value/TypedEncoding.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/FrameSocket.h"
#include "tests/support/Subprocess.h"
#include "tests/support/TrustedInstall.h"

namespace tn::test {
namespace {

const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");

class Lookup : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
    const std::string applications = daemon_.root() + "/opt/tenon/applications";
    // The plug-in's auto-elect entitlement counts only with trusted modes,
    // which neither the checkout's nor the daemon's directories (made with
    // the umask's modes) may have.
    installTree(std::string(TENON_SOURCE_DIR "/examples/applications/Messenger"), daemon_.root(), "Messenger");
    trustDirectoriesBetween(daemon_.root(), applications + "/Messenger");
    std::filesystem::rename(daemon_.root() + "/Messenger", applications + "/Messenger");
    plugIn_ = applications + "/Messenger/Support/PlugIns/ShareToChat";
    for (int i = 0; i < 500 && registered().empty(); ++i) std::this_thread::sleep_for(std::chrono::milliseconds(20));
    ASSERT_FALSE(registered().empty()) << daemon_.log();
  }

  // The plug-in's UUID as the registrar lists it, or "" before it is there.
  std::string registered() {
    const auto shown = tnctl({"--json", "registry", "show", plugIn_});
    if (shown.exitStatus != 0) return "";
    const auto document = readDocument(shown.out, "registry show", DocumentEncoding::Json);
    if (!document.ok()) return "";
    const std::string* uuid = (*document)["uuid"].string();
    return uuid ? *uuid : "";
  }

  ProcessResult tnctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), kTnctl);
    arguments.insert(arguments.end(), {"--service", daemon_.service()});
    return runProcess(arguments, daemon_.environment());
  }

  Value findJson(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), {"--json", "find"});
    const auto found = tnctl(arguments);
    EXPECT_EQ(found.exitStatus, 0) << found.err;
    auto document = readDocument(found.out, "find", DocumentEncoding::Json);
    EXPECT_TRUE(document.ok()) << found.out;
    return document.ok() ? (*document)["matches"] : Value();
  }

  DaemonProcess daemon_{tenondBinaryPath()};
  std::string plugIn_;
};

TEST_F(Lookup, AFormCarriesTheAnnotationAndTheTokensAndAutoElectionIsStored) {
  const Value form = findJson({"--url", "file://" + plugIn_});
  EXPECT_EQ(form["identifier"], Value("com.example.messenger.share"));
  EXPECT_EQ(form["uuid"], Value(registered()));
  EXPECT_EQ(form["annotations"]["election"], Value(1)) << "elected automatically when first built";
  EXPECT_TRUE(form["service-extension"].string());
  const Value file = *readDocumentFile(daemon_.root() + "/var/db/Tenon-Annotations");
  EXPECT_EQ(file["version"], Value(16));
  EXPECT_EQ(file["data"]["com.example.messenger.share"]["election"], Value(1));

  // By UUID, the same plug-in.
  EXPECT_EQ(findJson({"--uuid", registered()})["path"], Value(plugIn_));
}

TEST_F(Lookup, UnknownPlugInsAndAPathThatNamesNothingAreNotFound) {
  const auto unknown = tnctl({"find", "--uuid", "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"});
  EXPECT_EQ(unknown.exitStatus, 1);
  EXPECT_EQ(unknown.err, "tnctl: error 15: Cannot locate PlugIn\n");
  EXPECT_EQ(tnctl({"find", "--url", "file:///nowhere/X.bundle"}).err, "tnctl: error 15: Cannot locate PlugIn\n");
  // Both given: the path decides, even when the UUID names a plug-in.
  const std::string both = R"({"request":"find","version":3,"uuids":")" + registered() + R"(","paths":"file:///nowhere"})";
  EXPECT_EQ(tnctl({"request", both}).err, "tnctl: error 15: Cannot locate PlugIn\n");
  EXPECT_NE(daemon_.log().find("plugin not found"), std::string::npos);
}

// A reply's "replyTo".
uint64_t replyTo(const Bytes& frame) { return relay::loadBigEndian64(frame.data() + relay::kFrameLengthSize + 8); }

TEST_F(Lookup, RepliesLeaveInTheOrderOfTheirRequests) {
  // Three hundred plug-ins more: a discovery of all of them answers a third
  // of a megabyte, which is encoded and written on the connection's queue,
  // while a lookup's reply, made after it, is ready much sooner.
  const auto generated = runProcess(
      {std::string(TENON_SOURCE_DIR "/bench/generate-registry-fixture"), daemon_.root(), "1", "300"}, {});
  ASSERT_EQ(generated.exitStatus, 0) << generated.err;
  FrameSocket socket(daemon_.socketPath());
  const Value match(Dictionary{{"request", "match"}, {"version", 3}});
  std::size_t offered = 0;
  for (int i = 0; i < 500 && offered < 300; ++i) {
    const Result<Value> forms = decodeTyped(socket.request(match)["matches"]);
    offered = forms.ok() && forms->isArray() ? forms->array()->size() : 0;
    if (offered < 300) std::this_thread::sleep_for(std::chrono::milliseconds(20));
  }
  ASSERT_GE(offered, 300u) << daemon_.log();

  const Value find(Dictionary{{"request", "find"}, {"version", 3}, {"uuids", Value(*UUID::parse(registered()))}});
  ASSERT_TRUE(socket.send(match));
  for (int i = 0; i < 3; ++i) ASSERT_TRUE(socket.send(find));
  std::vector<uint64_t> order;
  for (int i = 0; i < 4; ++i) {
    Bytes frame;
    ASSERT_TRUE(socket.receive(frame));
    order.push_back(replyTo(frame));
    if (i == 0) {
      EXPECT_GT(frame.size(), 16u * 1024) << "the discovery's reply is one the connection's queue writes";
    }
  }
  ASSERT_EQ(order.size(), 4u);
  for (std::size_t i = 1; i < order.size(); ++i) EXPECT_EQ(order[i], order[i - 1] + 1) << "reply " << i;
}

}  // namespace
}  // namespace tn::test
