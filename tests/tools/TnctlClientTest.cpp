// tnctl's daemon subcommands and the Python example client, run as users run
// them: the real binaries against the real tenond on a private root, and,
// for the replies the daemon does not give yet, against a fake daemon in
// this process.

#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <string>
#include <vector>

#include <fmt/format.h>

#include "libtenon/client/TNDaemonClient.h"
#include "platform/value/Document.h"
#include "platform/value/TypedEncoding.h"
#include "tests/libtenon/client/FakeDaemon.h"
#include "tests/platform/bundle/BundleTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/Subprocess.h"

namespace tn {
namespace {

const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");
const std::string kPython = "/usr/bin/python3";
const std::string kPythonClient = std::string(TENON_SOURCE_DIR "/examples/python/tenon_client.py");

size_t lineCount(const std::string& text) { return static_cast<size_t>(std::count(text.begin(), text.end(), '\n')); }

bool pythonHasCbor() { return test::runProcess({kPython, "-c", "import cbor2"}).exitStatus == 0; }

class TnctlClient : public ::testing::Test {
 protected:
  void SetUp() override {
    ASSERT_TRUE(daemon_.accepting()) << daemon_.log();
    // Also in this process's own environment, which subprocesses inherit
    // ahead of runProcess's extra entries: a TENON_ROOT of the caller's
    // must not win over the daemon's.
    ::setenv("TENON_ROOT", daemon_.root().c_str(), 1);
  }
  void TearDown() override { ::unsetenv("TENON_ROOT"); }

  // tnctl with `arguments`, talking to the test's daemon.
  test::ProcessResult tnctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), kTnctl);
    arguments.insert(arguments.end(), {"--service", daemon_.service()});
    return test::runProcess(arguments, daemon_.environment());
  }

  test::DaemonProcess daemon_{test::tenondBinaryPath()};
};

TEST_F(TnctlClient, TheDaemonsEnvelopeErrorsReachTheUserAsOneLineAndStatusOne) {
  const auto version = tnctl({"request", R"({"request":"match","version":1})"});
  EXPECT_EQ(version.exitStatus, 1);
  EXPECT_EQ(version.err, "tnctl: error 7: unsupported protocol version 1 (current 3)\n");

  // A raw request goes out as given: without a version it is version 0,
  // and tnctl says that the key is missing.
  const auto unversioned = tnctl({"request", R"({"request":"match"})"});
  EXPECT_EQ(unversioned.err, "tnctl: error 7: unsupported protocol version 0 (current 3)\n"
                             "tnctl: the request has no \"version\" key (the current protocol version is 3)\n");

  const auto untyped = tnctl({"request", R"({"version":3})"});
  EXPECT_EQ(untyped.err, "tnctl: error 4: invalid request format (missing type)\n");

  // The operations build well-formed requests that the daemon understands
  // (the ones it does not serve yet say so).
  for (std::vector<std::string> operation : std::vector<std::vector<std::string>>{
           {"match"},
           {"match", "--rules", R"({"XTExtensionPoint":"com.example.filter"})", "--flags", "all-versions"},
       }) {
    const auto result = tnctl(operation);
    EXPECT_EQ(result.exitStatus, 0) << result.err;
    EXPECT_EQ(result.out, "no plug-ins offered\n");
  }
  const auto unknownType = tnctl({"request", R"({"version":3,"request":"unlock"})"});
  EXPECT_EQ(unknownType.exitStatus, 1);
  EXPECT_EQ(unknownType.err, "tnctl: error 4: unrecognized request\n");
  EXPECT_EQ(unknownType.out, "");
  EXPECT_EQ(tnctl({"find", "--uuid", "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"}).err,
            "tnctl: error 15: Cannot locate PlugIn\n");
  const auto added = tnctl({"add", "/opt/A.tnx"});
  EXPECT_EQ(added.err, "tnctl: error 9: invalid plugin path: /opt/A.tnx\n");
  // None of it disturbed the daemon: it still stops cleanly.
  EXPECT_EQ(daemon_.terminate(), 0) << daemon_.log();
}

TEST_F(TnctlClient, AddOfABundleTheRegistrarRefusesSaysWhy) {
  const std::string bundle = daemon_.root() + "/plugins/Flat.tnx";
  test::makeBundle(bundle, R"({"BNBundleIdentifier": "com.example.flat", "XTExtension": "com.example.share"})");
  const auto added = tnctl({"add", bundle});
  EXPECT_EQ(added.exitStatus, 1);
  EXPECT_EQ(added.out, "");
  EXPECT_NE(added.err.find("tnctl: error 2: unable to register plug-in at "), std::string::npos) << added.err;
  EXPECT_NE(added.err.find("\ntnctl: " + bundle + ": \"XTExtension\" in Info.manifest has the wrong type: a "
                           "string where a dictionary is needed\n"),
            std::string::npos)
      << added.err;
}

TEST_F(TnctlClient, JsonOutputIsTheReplyAsADocument) {
  const auto result = tnctl({"--json", "find", "--uuid", "E621E1F8-C36C-495A-93FC-0C247A3E6E5F"});
  EXPECT_EQ(result.exitStatus, 1);
  auto reply = readDocument(result.out, "stdout", DocumentEncoding::Json);
  ASSERT_TRUE(reply) << reply.error().localizedDescription() << "\n" << result.out;
  EXPECT_EQ((*reply)["errorcode"], Value(15));
  EXPECT_EQ((*reply)["error"], Value("Cannot locate PlugIn"));
  EXPECT_EQ(lineCount(result.err), 1u) << result.err;
}

TEST_F(TnctlClient, BadArgumentsAreRefusedBeforeAnythingIsSent) {
  const auto flags = tnctl({"bulk", "--flags", "0xZZ"});
  EXPECT_EQ(flags.exitStatus, 1);
  EXPECT_EQ(flags.err, "tnctl: invalid flags: 0xZZ\n");

  const auto uuid = tnctl({"ready", "not-a-uuid=/opt/A.tnx"});
  EXPECT_EQ(uuid.exitStatus, 1);
  EXPECT_EQ(uuid.err, "tnctl: invalid UUID: not-a-uuid\n");

  const auto rules = tnctl({"match", "--rules", "[1]"});
  EXPECT_EQ(rules.exitStatus, 1);
  EXPECT_EQ(rules.err, "tnctl: --rules must be a dictionary\n");

  EXPECT_NE(tnctl({"find"}).exitStatus, 0) << "find needs --uuid or --url";

  const auto unknown = tnctl({"match", "--rulez", "{}"});
  EXPECT_EQ(unknown.exitStatus, 2);
  EXPECT_EQ(unknown.err.rfind("tnctl: unknown option \"--rulez\" for tnctl match", 0), 0u) << unknown.err;
}

TEST(TnctlUnreachable, AMissingDaemonGivesOneClearLine) {
  const auto result = test::runProcess({kTnctl, "match", "--service", "com.ostrel.tenon.test.nobody"},
                                       {"TENON_ROOT=/nonexistent-tenon-root"});
  EXPECT_EQ(result.exitStatus, 1);
  EXPECT_EQ(result.out, "");
  // Named by its socket (TnctlUsageTest has the likely causes).
  EXPECT_EQ(result.err.rfind("tnctl: cannot reach tenond: ", 0), 0u) << result.err;
  EXPECT_NE(result.err.find("/nonexistent-tenon-root/run/tenon/relay/com.ostrel.tenon.test.nobody"), std::string::npos)
      << result.err;
  EXPECT_EQ(lineCount(result.err), 1u) << result.err;
}

// How tnctl shows the replies the real daemon cannot give yet, and what it
// sends for its arguments: a fake daemon in this process answers it.
class TnctlReplies : public ::testing::Test {
 protected:
  // Plug-in b carries the user's election, a none.
  static Value form(const char* identifier, const char* version, const char* uuid) {
    Dictionary form{{"identifier", Value(identifier)},
                    {"version", Value(version)},
                    {"uuid", Value(uuid)},
                    {"lastmodified", Value(int64_t{1700000000})}};
    if (std::string(identifier) == "com.example.b") form.set("annotations", Value(Dictionary{{"election", 1}}));
    return Value(std::move(form));
  }

  static Value answer(const Value& request) {
    const std::string type = *request["request"].string();
    if (type == "match") {
      return Value(Dictionary{{"matches", TNDaemonClient::convertToRelay(
                                              Value(Array{form("com.example.a", "1.0", kUuidA),
                                                          form("com.example.b", "2.1", kUuidB)}),
                                              3)}});
    }
    if (type == "find") return Value(Dictionary{{"matches", TNDaemonClient::convertToRelay(form("com.example.a", "1.0", kUuidA), 3)}});
    if (type == "lock") return Value(Dictionary{{"uuids", Value(*UUID::parse(kUuidB))}});
    if (type == "access") return Value(Dictionary{{"extensions", Value(Array{Value("token-1"), Value("token-2")})}});
    if (type == "remove") {
      return Value(Dictionary{{"conflicts", Value(Array{Value(Dictionary{{"pid", Value(uint64_t{42})}})})},
                              {"errorcode", Value(uint64_t{14})},
                              {"error", Value("plug-ins are busy")}});
    }
    if (type == "bulk") return Value(Dictionary{{"error", Value("no code")}});
    return Value(Dictionary());
  }

  test::ProcessResult tnctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), kTnctl);
    arguments.insert(arguments.end(), {"--service", "fake"});
    return test::runProcess(arguments);  // TENON_ROOT is inherited from this process
  }

  static constexpr const char* kUuidA = "E621E1F8-C36C-495A-93FC-0C247A3E6E5F";
  static constexpr const char* kUuidB = "0F3C6D2E-8E51-4D5F-9A0B-3C2D1E0F4A5B";
  test::TempRoot root_;
  test::FakeDaemon daemon_{"fake", answer};
};

TEST_F(TnctlReplies, ReadableOutputListsFormsTokensAndTheHoldToken) {
  const auto match = tnctl({"match"});
  EXPECT_EQ(match.exitStatus, 0) << match.err;
  const std::string row = "{:<40} {:<8} {:<8} {:<36} {}\n";
  EXPECT_EQ(match.out, fmt::format(fmt::runtime(row), "IDENTIFIER", "VERSION", "ELECTION", "UUID", "LOCATION") +
                           fmt::format(fmt::runtime(row), "com.example.a", "1.0", "-", kUuidA, "-") +
                           fmt::format(fmt::runtime(row), "com.example.b", "2.1", "1", kUuidB, "-"));

  EXPECT_EQ(tnctl({"find", "--uuid", kUuidA}).out, std::string("com.example.a 1.0 ") + kUuidA + " no election\n");
  EXPECT_EQ(tnctl({"hold", "/opt/App"}).out, std::string(kUuidB) + "\n");
  EXPECT_EQ(tnctl({"access", std::string(kUuidA) + "=/opt/A.tnx"}).out, "token-1\ntoken-2\n");

  const auto ok = tnctl({"add", "/opt/A.tnx"});
  EXPECT_EQ(ok.exitStatus, 0) << ok.err;
  EXPECT_EQ(ok.out, "ok\n");
  EXPECT_EQ(ok.err, "");
}

TEST_F(TnctlReplies, JsonOutputCarriesTheDecodedForms) {
  const auto result = tnctl({"--json", "match"});
  ASSERT_EQ(result.exitStatus, 0) << result.err;
  auto reply = readDocument(result.out, "stdout", DocumentEncoding::Json);
  ASSERT_TRUE(reply) << result.out;
  ASSERT_TRUE(reply->dictionary()->get("matches").isArray()) << result.out;
  EXPECT_EQ((*reply)["matches"].array()->at(1)["identifier"], Value("com.example.b"));
  EXPECT_EQ((*reply)["matches"].array()->at(0)["lastmodified"], Value(1700000000));
}

TEST_F(TnctlReplies, FailuresShowWhatCameWithThem) {
  const auto busy = tnctl({"remove", "/opt/A.tnx"});
  EXPECT_EQ(busy.exitStatus, 1);
  EXPECT_EQ(busy.out, "conflicts: [{pid: 42}]\n");
  EXPECT_EQ(busy.err, "tnctl: error 14: plug-ins are busy\n");

  const auto violation = tnctl({"bulk"});
  EXPECT_EQ(violation.exitStatus, 1);
  EXPECT_EQ(violation.err, "tnctl: tenond reported error without a code: no code\n");
}

TEST_F(TnctlReplies, ArgumentsBecomeTheRequestsKeys) {
  const std::string cwd = std::filesystem::current_path().string();
  ASSERT_EQ(tnctl({"ready", std::string(kUuidA) + "=relative/A.tnx", "--env", "{}", "--flags", "0x10"}).exitStatus, 0);
  ASSERT_EQ(tnctl({"annotate", "--uuid", kUuidA, "--uuid", kUuidB, "--annotations", R"({"election":0})"}).exitStatus, 0);
  const auto requests = daemon_.waitForRequests(2);

  const Value& ready = requests.at(0);
  EXPECT_EQ(ready["uuids"], Value(Array{Value(*UUID::parse(kUuidA))}));
  EXPECT_EQ(ready["paths"], Value(Array{Value(cwd + "/relative/A.tnx")}));
  EXPECT_EQ(ready["environment"], Value(Dictionary()));
  EXPECT_EQ(ready["flags"], Value(uint64_t{16}));

  const Value& annotate = requests.at(1);
  EXPECT_EQ(annotate["uuids"], Value(Array{Value(*UUID::parse(kUuidA)), Value(*UUID::parse(kUuidB))}));
  EXPECT_FALSE(annotate.dictionary()->contains("paths")) << "no plug-in named by path";
  EXPECT_EQ(annotate["annotations"], Value(Dictionary{{"election", Value(0)}}));
}

// A plug-in named by path goes with the nil UUID, which names none, so that
// the daemon looks it up by its path; one named by UUID with an empty path.
TEST_F(TnctlReplies, AnnotatePairsPathsWithTheNilUuid) {
  const auto annotated = tnctl({"annotate", "--uuid", kUuidA, "--path", "/opt/A.app/Support/PlugIns/P.tnx",
                                "--election", "1", "--extension", R"({"k": [1]})"});
  ASSERT_EQ(annotated.exitStatus, 0) << annotated.err;
  EXPECT_EQ(annotated.out, "annotated 2 plug-ins: {election: 1, extension: {k: [1]}}\n");
  const std::vector<Value> requests = daemon_.waitForRequests(1);
  ASSERT_EQ(requests.size(), 1u);
  const Value& annotate = requests.at(0);
  EXPECT_EQ(annotate["uuids"], Value(Array{Value(*UUID::parse(kUuidA)), Value(UUID())}));
  EXPECT_EQ(annotate["paths"], Value(Array{Value(""), Value("/opt/A.app/Support/PlugIns/P.tnx")}));
  EXPECT_EQ(annotate["annotations"],
            Value(Dictionary{{"election", Value(1)}, {"extension", Value(Dictionary{{"k", Value(Array{Value(1)})}})}}));
}

class PythonClient : public TnctlClient {
 protected:
  void SetUp() override {
    ASSERT_TRUE(pythonHasCbor()) << kPython << " has no cbor2 (scripts/setup installs python3-cbor2)";
    TnctlClient::SetUp();
  }
};

TEST_F(PythonClient, GetsTheSameVersionErrorFromTheRealDaemon) {
  const auto result = test::runProcess(
      {kPython, kPythonClient, R"({"request":"match","version":1})", "--service", daemon_.service()},
      daemon_.environment());
  EXPECT_EQ(result.exitStatus, 1) << result.err;
  EXPECT_EQ(result.err, "tenon_client: error 7: unsupported protocol version 1 (current 3)\n");
  auto reply = readDocument(result.out, "stdout", DocumentEncoding::Json);
  ASSERT_TRUE(reply) << result.out;
  EXPECT_EQ((*reply)["errorcode"], Value(7));
}

// The Python client decodes plug-in forms as the daemon encodes them: the
// private integer tag, UUIDs, dates and data inside a byte string. (The
// daemon returns no forms yet, so the encoding is made here.)
TEST(PythonTypedEncoding, DecodesFormsAsTheDaemonEncodesThem) {
  ASSERT_TRUE(pythonHasCbor()) << kPython << " has no cbor2 (scripts/setup installs python3-cbor2)";
  const Value form(Dictionary{
      {"identifier", Value("com.example.filter")},
      {"lastmodified", Value(int64_t{1700000000})},
      {"hubProtocolVersion", Value(uint64_t{2})},
      {"offset", Value(int64_t{-3})},
      {"token", Value(*UUID::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F"))},
      {"created", Value(Date{1363896240.5})},
      {"hash", Value(Bytes{0xde, 0xad})},
  });
  const Value encoded = encodeTyped(form);
  std::string hex;
  for (uint8_t byte : *encoded.data()) hex += fmt::format("{:02x}", byte);
  const std::string script =
      "import sys; sys.path.insert(0, sys.argv[1]); import tenon_client as t; "
      "form = t.decode_typed(bytes.fromhex(sys.argv[2])); "
      "print(t.to_json({'values': form, 'kinds': {k: type(v).__name__ for k, v in form.items()}}))";
  const auto result = test::runProcess(
      {kPython, "-c", script, std::string(TENON_SOURCE_DIR "/examples/python"), hex});
  ASSERT_EQ(result.exitStatus, 0) << result.err;
  auto output = readDocument(result.out, "stdout", DocumentEncoding::Json);
  ASSERT_TRUE(output) << result.out;
  // Python's own kinds: integers (signed or not) as int, the UUID tag as
  // uuid.UUID, dates as datetime, data as bytes.
  const Value& kinds = (*output)["kinds"];
  EXPECT_EQ(kinds["lastmodified"], Value("int"));
  EXPECT_EQ(kinds["hubProtocolVersion"], Value("int"));
  EXPECT_EQ(kinds["offset"], Value("int"));
  EXPECT_EQ(kinds["token"], Value("UUID"));
  EXPECT_EQ(kinds["created"], Value("datetime"));
  EXPECT_EQ(kinds["hash"], Value("bytes"));
  const Value* decoded = &(*output)["values"];
  EXPECT_EQ((*decoded)["identifier"], Value("com.example.filter"));
  EXPECT_EQ((*decoded)["lastmodified"], Value(1700000000));
  EXPECT_EQ((*decoded)["hubProtocolVersion"], Value(2));
  EXPECT_EQ((*decoded)["offset"], Value(-3));
  EXPECT_EQ((*decoded)["token"], Value("E621E1F8-C36C-495A-93FC-0C247A3E6E5F"));
  EXPECT_EQ((*decoded)["created"], Value("2013-03-21T20:04:00.500000Z"));
  EXPECT_EQ((*decoded)["hash"], Value("3q0="));
}

}  // namespace
}  // namespace tn
