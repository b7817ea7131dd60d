// "annotate" and "bulk-annotate" end to end: the real tenond with three
// installed data plug-ins, a relay client sending the requests as any
// client would, and what the daemon leaves behind: its replies, the
// annotation file, its log lines and the change notifications. Also the
// walk over `uuids` (with its path fallback) as these requests see it, and
// tnctl's annotate, bulk-annotate and find.

#include <gtest/gtest.h>

#include <cctype>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>

#include "platform/notify/Post.h"
#include "tests/e2e/AnnotationTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/RelayPeer.h"

namespace tn::test {
namespace {

constexpr const char* kChange = "com.ostrel.tenon.annotation-change";

class Annotation : public NotesDaemonTest {
 protected:
  Annotation() : NotesDaemonTest({"One", "Two", "Three"}) {}

  Value send(Dictionary body) { return peer_->request(std::move(body)); }
  static uint64_t notifications() { return *notify::postCount(kChange); }
  std::string file() const { return daemon_.root() + "/var/db/Tenon-Annotations"; }
  // The stored annotation of plug-in One, Two or Three; null when none.
  Value stored(const std::string& name) const { return storedAnnotations(file())["com.example.notes." + name]; }

  // How many lines of the daemon's log hold `text`, once the count stops
  // growing short of `expected` (a bounded poll: the lines may trail the
  // reply by a moment).
  size_t logged(const std::string& text, size_t expected) const {
    size_t count = 0;
    for (int attempt = 0; attempt < 100; ++attempt) {
      count = 0;
      const std::string log = daemon_.log();
      for (size_t at = log.find(text); at != std::string::npos; at = log.find(text, at + 1)) ++count;
      if (count >= expected) break;
      std::this_thread::sleep_for(std::chrono::milliseconds(20));
    }
    return count;
  }

  ProcessResult tnctl(std::vector<std::string> arguments) {
    arguments.insert(arguments.begin(), kTnctl);
    arguments.insert(arguments.end(), {"--service", daemon_.service()});
    return runProcess(arguments, daemon_.environment());
  }
};

void expectFailure(const Value& reply, uint64_t code, const std::string& message) {
  EXPECT_EQ(reply["errorcode"], Value(code)) << reply;
  EXPECT_EQ(reply["error"], Value(message)) << reply;
}

void expectSuccess(const Value& reply) { EXPECT_EQ(reply, Value(Dictionary{})) << reply; }

TEST_F(Annotation, AnElectionForTwoPlugInsIsStoredLoggedAndAnnouncedOnce) {
  const uint64_t before = notifications();
  expectSuccess(send(annotateRequest({{"election", 0}}, {uuids_[0], uuids_[1]})));
  EXPECT_EQ(stored("One"), Value(Dictionary{{"election", 0}}));
  EXPECT_EQ(stored("Two"), Value(Dictionary{{"election", 0}}));
  EXPECT_TRUE(stored("Three").isNull());
  EXPECT_EQ(notifications(), before + 1);
  EXPECT_EQ(logged("ops.debug: client " + std::to_string(getpid()) + " plug-in com.example.notes.", 2), 2u);
  EXPECT_EQ(logged("annotation change: {election: 0}", 2), 2u);
  EXPECT_EQ(logged("ops.info: client " + std::to_string(getpid()) + " plug-in com.example.notes.One(" +
                       uuids_[0].string() + ") election := 0",
                   1),
            1u);
  EXPECT_EQ(logged(") election := 0", 2), 2u);

  // A later change merges: the election stays, the extension joins it.
  expectSuccess(send(annotateRequest({{"extension", Value(Dictionary{{"k", "v"}})}}, {uuids_[0]})));
  EXPECT_EQ(stored("One"), Value(Dictionary{{"election", 0}, {"extension", Value(Dictionary{{"k", "v"}})}}));
  EXPECT_EQ(logged(") election := ", 3), 2u) << "no election line for a change without one";
}

TEST_F(Annotation, AChangeWithNothingToStoreAnswersAtOnceWithoutReadingUuids) {
  const uint64_t before = notifications();
  expectSuccess(send({{"request", "annotate"}, {"version", 3u}, {"annotations", Value(Dictionary{{"color", "red"}})}}));
  // Not even a malformed `uuids` is looked at.
  Dictionary withJunk = annotateRequest({{"color", "red"}}, {});
  withJunk.set("uuids", "junk");
  expectSuccess(send(withJunk));
  EXPECT_EQ(notifications(), before);
  EXPECT_FALSE(std::filesystem::exists(file())) << "nothing stored";
}

TEST_F(Annotation, AMalformedChangeIsRefusedBeforeAnyStore) {
  const uint64_t before = notifications();
  expectFailure(send(annotateRequest({{"election", "1"}}, {uuids_[0]})), 4,
                "invalid request format (annotation election)");
  expectFailure(send(annotateRequest({{"election", 1}, {"extension", Value(Array{Value(1)})}}, {uuids_[0]})), 4,
                "invalid request format (annotation extension)");
  // Both wrong: the election is checked first.
  expectFailure(send(annotateRequest({{"election", "1"}, {"extension", 2}}, {uuids_[0]})), 4,
                "invalid request format (annotation election)");
  expectFailure(send({{"request", "annotate"}, {"version", 3u}, {"uuids", uuidArray({uuids_[0]})}}), 4,
                "invalid request format (bad annotations dictionary)");
  expectFailure(send({{"request", "annotate"}, {"version", 3u}, {"annotations", Value(Array{})}}), 4,
                "invalid request format (bad annotations dictionary)");
  EXPECT_FALSE(std::filesystem::exists(file()));
  EXPECT_EQ(notifications(), before);
}

// What a client may make the daemon keep is bounded: an extension the file
// could not carry, or too large, is malformed.
TEST_F(Annotation, AnExtensionTooLargeOrTooDeepIsRefusedBeforeAnyStore) {
  const Value large(Dictionary{{"blob", Value(std::string(70 * 1024, 'x'))}});
  expectFailure(send(annotateRequest({{"extension", large}}, {uuids_[0]})), 4,
                "invalid request format (annotation extension)");
  Value deep(Dictionary{});
  for (int level = 0; level < 40; ++level) deep = Value(Dictionary{{"d", deep}});
  expectFailure(send(annotateRequest({{"extension", deep}}, {uuids_[0]})), 4,
                "invalid request format (annotation extension)");
  const Value bulk = send(bulkAnnotateRequest({{uuids_[0].string(), large}}));
  EXPECT_EQ(bulk["errorcode"], Value(18u)) << bulk;
  EXPECT_TRUE(stored("One").isNull());

  // Within bounds, the same shapes are stored.
  const Value fits(Dictionary{{"blob", Value(std::string(32 * 1024, 'x'))}});
  expectSuccess(send(annotateRequest({{"extension", fits}}, {uuids_[0]})));
  EXPECT_EQ(stored("One")["extension"], fits);
}

TEST_F(Annotation, AWalkStoppedByAnUnknownUuidKeepsWhatItStoredButAnnouncesNothing) {
  const uint64_t before = notifications();
  const UUID unknown = UUID::random();
  expectFailure(send(annotateRequest({{"election", 1}}, {uuids_[0], unknown, uuids_[2]})), 4,
                "no such plugin (uuid not found)");
  EXPECT_EQ(stored("One"), Value(Dictionary{{"election", 1}})) << "on disk before the reply";
  EXPECT_TRUE(stored("Three").isNull()) << "the walk stopped at the unknown UUID";
  EXPECT_EQ(notifications(), before);
}

TEST_F(Annotation, AnEmptyUuidListWithARealChangeSucceedsAndAnnounces) {
  const uint64_t before = notifications();
  expectSuccess(send(annotateRequest({{"election", 1}}, {})));
  EXPECT_EQ(notifications(), before + 1);
  EXPECT_FALSE(std::filesystem::exists(file()));
}

TEST_F(Annotation, BadUuidListsFailWithTheirOwnMessages) {
  Dictionary missing{{"request", "annotate"}, {"version", 3u}, {"annotations", Value(Dictionary{{"election", 1}})}};
  expectFailure(send(missing), 4, "invalid request format (uuid)");
  Dictionary notArray = missing;
  notArray.set("uuids", Value(uuids_[0]));
  expectFailure(send(notArray), 4, "invalid request format (uuid)");
  Dictionary badElement = missing;
  badElement.set("uuids", Value(Array{Value(uuids_[0]), Value(uuids_[1].string())}));
  expectFailure(send(badElement), 4, "invalid request (bad uuid array)");
  EXPECT_EQ(stored("One"), Value(Dictionary{{"election", 1}})) << "the element before the bad one was handed over";
  EXPECT_TRUE(stored("Two").isNull());
}

TEST_F(Annotation, AnUnknownUuidFallsBackToItsParallelPath) {
  const UUID unknown = UUID::random();
  Dictionary request = annotateRequest({{"election", 1}}, {uuids_[0], unknown});
  request.set("paths", stringArray({"/not/used", paths_[1]}));
  expectSuccess(send(request));
  EXPECT_EQ(stored("One"), Value(Dictionary{{"election", 1}})) << "a known UUID ignores its path";
  EXPECT_EQ(stored("Two"), Value(Dictionary{{"election", 1}})) << "resolved through its path";
  EXPECT_EQ(logged("traffic.info: Failed to find plugin by " + unknown.string(), 1), 1u);
  EXPECT_EQ(logged("traffic.info: Looking for plugin " + unknown.string() + " by path " + paths_[1], 1), 1u);
}

TEST_F(Annotation, PathsAreIgnoredUnlessTheyAreAnArrayOfTheSameLength) {
  const UUID unknown = UUID::random();
  Dictionary shorter = annotateRequest({{"election", 1}}, {uuids_[0], uuids_[1], unknown});
  shorter.set("paths", stringArray({paths_[0], paths_[1]}));
  expectFailure(send(shorter), 4, "no such plugin (uuid not found)");
  EXPECT_EQ(logged("traffic.default: Paths present but has different count than UUIDs (ignoring)", 1), 1u);

  Dictionary notArray = annotateRequest({{"election", 1}}, {unknown});
  notArray.set("paths", paths_[2]);
  expectFailure(send(notArray), 4, "no such plugin (uuid not found)");
  EXPECT_EQ(logged("traffic.default: Paths present but not an array (ignoring values)", 1), 1u);

  // A path that is no string, names nothing, or is relative resolves nothing.
  for (const Value& path : {Value(7), Value("/nowhere/X"), Value("opt/tenon/applications/Notes/Support/PlugIns/Three")}) {
    Dictionary request = annotateRequest({{"election", 1}}, {unknown});
    request.set("paths", Value(Array{path}));
    expectFailure(send(request), 4, "no such plugin (uuid not found)");
  }
  EXPECT_TRUE(stored("Three").isNull());
}

TEST_F(Annotation, BulkAnnotateReplacesTheExtensionAndKeepsTheElection) {
  expectSuccess(send(annotateRequest({{"election", 1}, {"extension", Value(Dictionary{{"old", 1}})}}, {uuids_[0]})));
  const uint64_t before = notifications();
  // UUID strings in either letter case.
  std::string lower = uuids_[0].string();
  for (char& c : lower) c = static_cast<char>(std::tolower(static_cast<unsigned char>(c)));
  expectSuccess(send(bulkAnnotateRequest({{lower, Value(Dictionary{{"new", 2}})},
                                          {uuids_[1].string(), Value(Dictionary{{"two", 2}})}})));
  EXPECT_EQ(stored("One"), Value(Dictionary{{"election", 1}, {"extension", Value(Dictionary{{"new", 2}})}}));
  EXPECT_EQ(stored("Two"), Value(Dictionary{{"extension", Value(Dictionary{{"two", 2}})}}));
  EXPECT_EQ(notifications(), before + 1);
  EXPECT_EQ(logged("ops.debug: bulk change requested for 2 plug-ins", 1), 1u);
  EXPECT_EQ(logged("ops.debug: client " + std::to_string(getpid()) + " bulk plug-in com.example.notes.Two(" +
                       uuids_[1].string() + ") annotation change: {two: 2}",
                   1),
            1u);

  expectSuccess(send(bulkAnnotateRequest({})));
  EXPECT_EQ(notifications(), before + 2) << "an empty bulk request still announces";
}

TEST_F(Annotation, BulkAnnotateStopsAtTheFirstBadEntryKeepingEarlierOnes) {
  const uint64_t before = notifications();
  expectFailure(send(bulkAnnotateRequest({{uuids_[0].string(), Value(Dictionary{{"a", 1}})},
                                          {"not-a-uuid", Value(Dictionary{})},
                                          {uuids_[2].string(), Value(Dictionary{{"c", 3}})}})),
                18, "invalid plug-in UUID value");
  EXPECT_EQ(stored("One"), Value(Dictionary{{"extension", Value(Dictionary{{"a", 1}})}})) << "on disk before the reply";
  EXPECT_TRUE(stored("Three").isNull());
  expectFailure(send(bulkAnnotateRequest({{UUID::random().string(), Value(Dictionary{})}})), 2,
                "no plug-in with the requested uuid");
  expectFailure(send(bulkAnnotateRequest({{uuids_[1].string(), Value(Array{})}})), 18,
                "annotations values must be dictionaries");
  // The value is checked before the key.
  expectFailure(send(bulkAnnotateRequest({{"not-a-uuid", 5}})), 18, "annotations values must be dictionaries");
  expectFailure(send({{"request", "bulk-annotate"}, {"version", 3u}, {"annotations", "x"}}), 4,
                "invalid request format (bad annotations dictionary)");
  EXPECT_TRUE(stored("Two").isNull());
  EXPECT_EQ(notifications(), before);
}

TEST_F(Annotation, TnctlAnnotatesByUuidAndByPathAndFindShowsTheElection) {
  const ProcessResult annotated =
      tnctl({"annotate", "--uuid", uuids_[0].string(), "--path", paths_[1], "--election", "1", "--extension",
             R"({"k": "v"})"});
  EXPECT_EQ(annotated.exitStatus, 0) << annotated.err;
  EXPECT_EQ(annotated.out, "annotated 2 plug-ins: {election: 1, extension: {k: \"v\"}}\n");
  EXPECT_EQ(stored("Two"), Value(Dictionary{{"election", 1}, {"extension", Value(Dictionary{{"k", "v"}})}}));

  const ProcessResult found = tnctl({"find", "--uuid", uuids_[1].string()});
  EXPECT_EQ(found.exitStatus, 0) << found.err;
  EXPECT_NE(found.out.find(uuids_[1].string() + " election 1\n"), std::string::npos) << found.out;
  EXPECT_NE(tnctl({"find", "--uuid", uuids_[2].string()}).out.find(" no election\n"), std::string::npos);

  const ProcessResult missing = tnctl({"annotate", "--path", "/nowhere/X.tnx", "--election", "0"});
  EXPECT_EQ(missing.exitStatus, 1);
  EXPECT_EQ(missing.err, "tnctl: error 4: no such plugin (uuid not found)\n");
  EXPECT_EQ(tnctl({"annotate", "--uuid", uuids_[0].string()}).err,
            "tnctl: nothing to change: give --election, --extension or --annotations\n");
  EXPECT_EQ(tnctl({"annotate", "--uuid", uuids_[0].string(), "--election", "yes"}).exitStatus, 1);
}

TEST_F(Annotation, TnctlBulkAnnotatesFromAnXmlFileAndSaysSoInJson) {
  const std::string document = daemon_.root() + "/bulk.xml";
  std::ofstream(document) << R"(<?xml version="1.0" encoding="UTF-8"?>
<tenon-document version="1"><map>
  <item key=")" << uuids_[2].string() << R"("><map><item key="size"><int>3</int></item></map></item>
</map></tenon-document>
)";
  const ProcessResult readable = tnctl({"bulk-annotate", "@" + document});
  EXPECT_EQ(readable.exitStatus, 0) << readable.err;
  EXPECT_EQ(readable.out, "set the extension of 1 plug-in\n");
  EXPECT_EQ(stored("Three"), Value(Dictionary{{"extension", Value(Dictionary{{"size", 3}})}}));

  const ProcessResult json = tnctl({"--json", "bulk-annotate", R"({")" + uuids_[0].string() + R"(": {"a": true}})"});
  EXPECT_EQ(json.exitStatus, 0) << json.err;
  EXPECT_EQ(*readDocument(json.out, "reply", DocumentEncoding::Json), Value(Dictionary{}));
  const ProcessResult refused = tnctl({"bulk-annotate", R"({"nope": {}})"});
  EXPECT_EQ(refused.err, "tnctl: error 18: invalid plug-in UUID value\n");
}

}  // namespace
}  // namespace tn::test
