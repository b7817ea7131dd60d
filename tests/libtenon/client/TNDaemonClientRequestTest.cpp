// What each client operation puts on the wire: exactly the keys of its
// request type, as a fake daemon receives them over a real socket.

#include <gtest/gtest.h>

#include <functional>
#include <string>

#include "libtenon/client/TNDaemonClient.h"
#include "platform/log/CaptureSink.h"
#include "tests/libtenon/client/FakeDaemon.h"

namespace tn {
namespace {

using test::FakeDaemon;

const UUID kA = *UUID::parse("E621E1F8-C36C-495A-93FC-0C247A3E6E5F");
const UUID kB = *UUID::parse("0F3C6D2E-8E51-4D5F-9A0B-3C2D1E0F4A5B");
const UUID kC = *UUID::parse("7A1B2C3D-4E5F-4A6B-8C7D-9E0F1A2B3C4D");

const PlugInsByPath kThreePlugIns = {{"/opt/A.tnx", kA}, {"/opt/B.tnx", kB}, {"/opt/C.tnx", kC}};

Value envelope(const char* type, Dictionary keys) {
  Dictionary request{{"request", Value(type)}, {"version", Value(uint64_t{3})}};
  for (auto& [key, value] : keys) request.set(key, value);
  return Value(std::move(request));
}

Value strings(std::initializer_list<const char*> items) {
  Array array;
  for (const char* item : items) array.emplace_back(item);
  return Value(std::move(array));
}

class ClientRequests : public ::testing::Test {
 protected:
  // Runs one operation and returns the request the daemon received.
  Value sent(const std::function<void(TNDaemonClient&, TNDaemonClient::ReplyBlock)>& operation) {
    FakeDaemon daemon("requests");
    TNDaemonClient client("requests");
    operation(client, [](relay::Reply) {});
    return daemon.waitForRequests(1).at(0);
  }

  void expectSent(const Value& expected,
                  const std::function<void(TNDaemonClient&, TNDaemonClient::ReplyBlock)>& operation) {
    const Value received = sent(operation);
    EXPECT_TRUE(Value::identical(received, expected)) << "sent " << received << "\nexpected " << expected;
  }

  test::TempRoot root_;
  log::ScopedCaptureSink log_;  // the lookups log at default level
};

TEST_F(ClientRequests, PathOperationsSendPathsAndFlags) {
  const std::vector<std::string> paths{"/opt/A.tnx", "/opt/B.tnx"};
  expectSent(envelope("add", {{"paths", strings({"/opt/A.tnx", "/opt/B.tnx"})}}),
             [&](auto& c, auto r) { c.addPlugIns(paths, r); });
  expectSent(envelope("remove", {{"paths", strings({"/opt/A.tnx", "/opt/B.tnx"})}}),
             [&](auto& c, auto r) { c.removePlugIns(paths, r); });
  expectSent(envelope("bulk", {{"flags", Value(uint64_t{5})}}), [](auto& c, auto r) { c.bulkPlugins(5, r); });
  expectSent(envelope("lock", {{"paths", strings({"/opt/A.tnx", "/opt/B.tnx"})}, {"flags", Value(uint64_t{4})}}),
             [&](auto& c, auto r) { c.holdPlugins(paths, 4, r); });
  expectSent(envelope("add", {{"paths", Value(Array())}}), [](auto& c, auto r) { c.addPlugIns({}, r); });
}

TEST_F(ClientRequests, ReadyAndAccessSendParallelUuidsAndPaths) {
  const Value uuids(Array{Value(kA), Value(kB), Value(kC)});
  const Value paths = strings({"/opt/A.tnx", "/opt/B.tnx", "/opt/C.tnx"});
  expectSent(envelope("ready", {{"flags", Value(uint64_t{2})}, {"uuids", uuids}, {"paths", paths}}),
             [](auto& c, auto r) { c.readyPlugIns(kThreePlugIns, 2, std::nullopt, r); });
  expectSent(envelope("access", {{"flags", Value(uint64_t{0})}, {"uuids", uuids}, {"paths", paths}}),
             [](auto& c, auto r) { c.accessPlugIns(kThreePlugIns, 0, r); });
}

TEST_F(ClientRequests, ReadySendsEnvironmentOnlyWhenGivenEvenIfEmpty) {
  const Value without = sent([](auto& c, auto r) { c.readyPlugIns({{"/opt/A.tnx", kA}}, 0, std::nullopt, r); });
  EXPECT_FALSE(without.dictionary()->contains("environment")) << without;

  const Value empty = sent([](auto& c, auto r) { c.readyPlugIns({{"/opt/A.tnx", kA}}, 0, Dictionary(), r); });
  EXPECT_TRUE(Value::identical(empty["environment"], Value(Dictionary()))) << empty;

  const Dictionary environment{{"TNTEST_SDK", Value("/sdk")}};
  const Value given = sent([&](auto& c, auto r) { c.readyPlugIns({{"/opt/A.tnx", kA}}, 0, environment, r); });
  EXPECT_TRUE(Value::identical(given["environment"], Value(environment))) << given;
}

TEST_F(ClientRequests, FindSendsOneUuidOrOneAbsoluteUrlStringNotArrays) {
  expectSent(envelope("find", {{"uuids", Value(kA)}}), [](auto& c, auto r) { c.findPlugInByUUID(kA, r); });
  const URL url = URL::fileURLWithPath("/opt/My App/A.tnx");
  expectSent(envelope("find", {{"paths", Value("file:///opt/My%20App/A.tnx")}}),
             [&](auto& c, auto r) { c.findPlugInByPathURL(url, r); });
}

TEST_F(ClientRequests, MatchSendsRulesAndFlags) {
  const Dictionary rules{{"XTExtensionPoint", Value("com.example.filter")},
                         {"XTUserElection", Value(uint64_t{1})}};
  expectSent(envelope("match", {{"rules", Value(rules)}, {"flags", Value(uint64_t{0x201})}}),
             [&](auto& c, auto r) { c.matchPlugIns(rules, 0x201, r); });
  expectSent(envelope("match", {{"rules", Value(Dictionary())}, {"flags", Value(uint64_t{0})}}),
             [](auto& c, auto r) { c.matchPlugIns({}, 0, r); });
}

TEST_F(ClientRequests, AnnotationsGoOutAsGiven) {
  const Dictionary change{{"election", Value(uint64_t{1})}};
  expectSent(envelope("annotate", {{"uuids", Value(Array{Value(kA), Value(kB)})}, {"annotations", Value(change)}}),
             [&](auto& c, auto r) { c.setPluginAnnotations({kA, kB}, change, r); });

  const Dictionary bulk{{kA.string(), Value(Dictionary{{"color", Value("red")}})}};
  expectSent(envelope("bulk-annotate", {{"annotations", Value(bulk)}}),
             [&](auto& c, auto r) { c.bulkSetPluginAnnotations(bulk, r); });
}

TEST_F(ClientRequests, ReleaseSendsTheTokenInAnArray) {
  expectSent(envelope("lock", {{"uuids", Value(Array{Value(kC)})}}), [](auto& c, auto r) { c.releaseHold(kC, r); });
}

TEST_F(ClientRequests, EveryRequestCarriesTheClientsProtocolVersion) {
  const Value request = sent([](auto& c, auto r) {
    c.setProtocolVersion(2);
    c.bulkPlugins(0, r);
  });
  EXPECT_TRUE(Value::identical(request["version"], Value(uint64_t{2}))) << request;
}

// The building blocks on their own, without a connection.
TEST(ClientBuildingBlocks, SetPlugInsBuildsEqualLengthArraysInEntryOrder) {
  Dictionary request;
  TNDaemonClient::set(request, kThreePlugIns);
  const Array& uuids = *request.get("uuids").array();
  const Array& paths = *request.get("paths").array();
  ASSERT_EQ(uuids.size(), 3u);
  ASSERT_EQ(paths.size(), 3u);
  for (size_t i = 0; i < kThreePlugIns.size(); ++i) {
    EXPECT_EQ(uuids[i].uuid(), kThreePlugIns[i].second) << i;
    EXPECT_EQ(*paths[i].string(), kThreePlugIns[i].first) << i;
  }

  TNDaemonClient::set(request, PlugInsByPath{});
  EXPECT_TRUE(Value::identical(request.get("uuids"), Value(Array())));
  EXPECT_TRUE(Value::identical(request.get("paths"), Value(Array())));
}

TEST(ClientBuildingBlocks, SetUuidsKeepsOrderAndMakesAnEmptyArrayForNone) {
  Dictionary request;
  TNDaemonClient::set(request, std::vector<UUID>{kC, kA});
  EXPECT_TRUE(Value::identical(request.get("uuids"), Value(Array{Value(kC), Value(kA)})));
  TNDaemonClient::set(request, std::vector<UUID>{});
  EXPECT_TRUE(Value::identical(request.get("uuids"), Value(Array())));
}

}  // namespace
}  // namespace tn
