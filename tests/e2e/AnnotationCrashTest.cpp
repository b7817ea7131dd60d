// The annotation file survives a daemon killed at any moment: a client
// streams "annotate" requests while the daemon is killed with SIGKILL at
// random moments and started again on the same file, many times. After
// every restart the file parses and holds every change whose reply the
// client had received, and no temporary file of an interrupted save is left.

#include <gtest/gtest.h>

#include <signal.h>

#include <atomic>
#include <cstdlib>
#include <filesystem>
#include <random>
#include <thread>

#include "tests/e2e/AnnotationTestSupport.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/RelayPeer.h"
#include "tests/support/TempDirectory.h"

namespace tn::test {
namespace {

constexpr int kRestarts = 25;

// The election of plug-in `name` in the file, or -1 when none is stored.
int64_t storedElection(const Value& data, const std::string& name) {
  return data["com.example.notes." + name]["election"].int64().value_or(-1);
}

size_t temporaryFilesIn(const std::string& directory) {
  size_t count = 0;
  for (const auto& entry : std::filesystem::directory_iterator(directory)) {
    if (entry.path().filename().string().find(".tenon-tmp.") != std::string::npos) ++count;
  }
  return count;
}

// Sends elections 1, 2, 3, ... for the two plug-ins in turn (each request
// names one of them by its path, so the UUIDs of this daemon's registrar
// need not be known) until the connection breaks. Records, per plug-in, the
// last election whose success reply arrived.
void streamUntilKilled(const std::string& service, const std::vector<std::string>& paths, int64_t& next,
                       int64_t (&acknowledged)[2]) {
  RelayPeer peer(service);
  if (!peer.connected()) return;
  for (;; ++next) {
    const int which = static_cast<int>(next % 2);
    Dictionary request = annotateRequest({{"election", next}, {"extension", Value(Dictionary{{"n", next}})}},
                                         {UUID()});
    request.set("paths", stringArray({paths[which]}));
    const Value reply = peer.request(std::move(request), std::chrono::seconds(5));
    if (reply.isNull()) return;  // the daemon is gone
    ASSERT_EQ(reply, Value(Dictionary{})) << reply;
    acknowledged[which] = next;
  }
}

TEST(AnnotationCrash, EveryAnsweredChangeSurvivesASigkillAtAnyMoment) {
  TempDirectory shared;
  const std::string file = shared / "Tenon-Annotations";
  std::mt19937 random(std::random_device{}());
  std::uniform_int_distribution<int> delayMs(1, 120);
  int64_t next = 1;
  int64_t acknowledged[2] = {-1, -1};
  int killedMidStream = 0;

  for (int round = 0; round < kRestarts; ++round) {
    std::vector<std::string> paths;
    DaemonProcess daemon(tenondBinaryPath(), {"-d", file},
                         [&](const std::string& root) { paths = installNotes(root, {"One", "Two"}); });
    ASSERT_TRUE(daemon.accepting()) << daemon.log();
    ::setenv("TENON_ROOT", daemon.root().c_str(), 1);  // where the relay finds the service
    // What the previous daemons answered is in the file this one loaded.
    if (round > 0 && !std::filesystem::exists(file)) {
      // A daemon killed before it answered any change has written nothing.
      EXPECT_EQ(acknowledged[0], -1) << "round " << round << ": an answered change was never stored";
      EXPECT_EQ(acknowledged[1], -1) << "round " << round << ": an answered change was never stored";
    } else if (round > 0) {
      const Result<Value> document = readDocumentFile(file);
      ASSERT_TRUE(document.ok()) << "round " << round << ": " << document.error().description();
      EXPECT_EQ(temporaryFilesIn(shared.path()), 0u) << "round " << round;
      const Value& data = (*document)["data"];
      EXPECT_GE(storedElection(data, "One"), acknowledged[0]) << "round " << round;
      EXPECT_GE(storedElection(data, "Two"), acknowledged[1]) << "round " << round;
      EXPECT_LT(storedElection(data, "One"), next + 1) << "nothing stored that was never sent";
    }
    ASSERT_FALSE(registeredUUID(daemon.root(), paths[1]).isNil()) << daemon.log();

    std::atomic<bool> streaming{true};
    std::thread client([&] {
      streamUntilKilled(daemon.service(), paths, next, acknowledged);
      streaming = false;
    });
    std::this_thread::sleep_for(std::chrono::milliseconds(delayMs(random)));
    if (streaming) ++killedMidStream;
    ::kill(daemon.pid(), SIGKILL);
    client.join();
  }
  ::unsetenv("TENON_ROOT");
  EXPECT_GT(acknowledged[0] + acknowledged[1], 0) << "the client never got an answer";
  EXPECT_GT(killedMidStream, kRestarts / 2) << "the kills should land while requests are in flight";
}

}  // namespace
}  // namespace tn::test
