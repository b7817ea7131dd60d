// tnctl as scripts and people meet it before any daemon answers: usage
// errors, its version, a daemon that cannot be reached, and --json for every
// one of these outcomes.

#include <gtest/gtest.h>

#include <algorithm>
#include <string>
#include <vector>

#include "platform/value/Document.h"
#include "tests/support/Subprocess.h"

namespace tn {
namespace {

const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");

test::ProcessResult tnctl(std::vector<std::string> arguments, std::vector<std::string> environment = {}) {
  arguments.insert(arguments.begin(), kTnctl);
  return test::runProcess(arguments, environment);
}

size_t lineCount(const std::string& text) { return static_cast<size_t>(std::count(text.begin(), text.end(), '\n')); }

Value jsonOutcome(const test::ProcessResult& result) {
  Result<Value> document = readDocument(result.out, "stdout", DocumentEncoding::Json);
  EXPECT_TRUE(document) << result.out;
  return document ? *document : Value();
}

TEST(TnctlUsage, ErrorsNameWhatWasWrongOnOneTnctlLineAndExitTwo) {
  const struct {
    std::vector<std::string> arguments;
    std::string expected;  // the start of the one line
  } cases[] = {
      {{"frobnicate"}, "tnctl: unknown subcommand \"frobnicate\"; see tnctl --help"},
      {{"match", "--bogus"}, "tnctl: unknown option \"--bogus\" for tnctl match; see tnctl match --help"},
      {{"registry", "lsit"}, "tnctl: unknown subcommand \"lsit\" for tnctl registry; see tnctl registry --help"},
      {{"lint"}, "tnctl: tnctl lint: BUNDLE is required; see tnctl lint --help"},
      {{}, "tnctl: a subcommand is required; see tnctl --help"},
      {{"document", "x.xml", "--to", "yaml"}, "tnctl: tnctl document: --to: "},
  };
  for (const auto& usage : cases) {
    const test::ProcessResult result = tnctl(usage.arguments);
    EXPECT_EQ(result.exitStatus, 2) << result.err;
    EXPECT_EQ(result.out, "");
    EXPECT_EQ(result.err.rfind(usage.expected, 0), 0u) << result.err;
    EXPECT_EQ(lineCount(result.err), 1u) << result.err;
  }
}

TEST(TnctlUsage, UnderJsonAUsageErrorIsOneDocumentToo) {
  const test::ProcessResult result = tnctl({"match", "--bogus", "--json"});
  EXPECT_EQ(result.exitStatus, 2);
  const Value outcome = jsonOutcome(result);
  EXPECT_EQ(outcome["ok"], Value(false));
  EXPECT_EQ(outcome["usage"], Value(true));
  EXPECT_EQ(outcome["error"], Value("unknown option \"--bogus\" for tnctl match; see tnctl match --help"));
}

TEST(TnctlUsage, VersionIsTheProjectsAndHelpIsNoError) {
  const test::ProcessResult version = tnctl({"--version"});
  EXPECT_EQ(version.exitStatus, 0);
  EXPECT_EQ(version.out, "tnctl " TENON_VERSION "\n");

  const test::ProcessResult help = tnctl({"--help"});
  EXPECT_EQ(help.exitStatus, 0);
  EXPECT_NE(help.out.find("lint"), std::string::npos);
}

TEST(TnctlUnreachable, AMissingDaemonIsNamedByItsSocketWithTheLikelyCauses) {
  const std::string socket = "/nonexistent-tenon-root/run/tenon/relay/com.ostrel.tenon.test.nobody";
  const std::vector<std::string> environment{"TENON_ROOT=/nonexistent-tenon-root"};
  const test::ProcessResult readable = tnctl({"match", "--service", "com.ostrel.tenon.test.nobody"}, environment);
  EXPECT_EQ(readable.exitStatus, 1);
  EXPECT_EQ(readable.out, "");
  EXPECT_EQ(readable.err.rfind("tnctl: cannot reach tenond: ", 0), 0u) << readable.err;
  const size_t named = readable.err.find(socket);
  EXPECT_NE(named, std::string::npos) << readable.err;
  EXPECT_EQ(readable.err.find(socket, named + 1), std::string::npos) << "the socket is named once: " << readable.err;
  EXPECT_NE(readable.err.find("is tenond running, and is TENON_ROOT set to the root it serves (it is "
                              "\"/nonexistent-tenon-root\")?"),
            std::string::npos)
      << readable.err;
  EXPECT_EQ(lineCount(readable.err), 1u) << readable.err;

  const test::ProcessResult json = tnctl({"--json", "match", "--service", "com.ostrel.tenon.test.nobody"}, environment);
  EXPECT_EQ(json.exitStatus, 1);
  const Value outcome = jsonOutcome(json);
  EXPECT_EQ(outcome["ok"], Value(false));
  EXPECT_EQ(outcome["socket"], Value(socket));
  EXPECT_EQ(outcome["service"], Value("com.ostrel.tenon.test.nobody"));
  EXPECT_NE(outcome["error"].string()->find("is tenond running"), std::string::npos);
}

TEST(TnctlJson, DocumentWritesJsonUnlessToSaysOtherwise) {
  const std::string file = TENON_SOURCE_DIR "/examples/documents/annotations.xml";
  const test::ProcessResult json = tnctl({"--json", "document", file});
  EXPECT_EQ(json.exitStatus, 0) << json.err;
  EXPECT_TRUE(readDocument(json.out, "stdout", DocumentEncoding::Json)) << json.out;
  const test::ProcessResult xml = tnctl({"--json", "document", file, "--to", "xml"});
  EXPECT_EQ(xml.out.rfind("<?xml", 0), 0u) << xml.out;
}

TEST(TnctlJson, FailuresOfLocalCommandsAreOneDocument) {
  const test::ProcessResult result = tnctl({"--json", "document", "/nonexistent/file.xml"});
  EXPECT_EQ(result.exitStatus, 1);
  const Value outcome = jsonOutcome(result);
  EXPECT_EQ(outcome["ok"], Value(false));
  EXPECT_NE(outcome["error"].string()->find("/nonexistent/file.xml"), std::string::npos) << result.out;
}

}  // namespace
}  // namespace tn
