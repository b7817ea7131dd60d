// Forced termination against a supervisor the test answers for: the version
// each removal names, the completion only after every answer (whatever its
// status), on the call's own "killer-waiter" queue, and a supervisor that
// never answers holding up only its own call.

#include <gtest/gtest.h>

#include <algorithm>
#include <mutex>
#include <thread>
#include <vector>

#include "platform/dispatch/Semaphore.h"
#include "platform/log/CaptureSink.h"
#include "platform/log/Log.h"
#include "tenond/server/PlugInTermination.h"

namespace tnd {
namespace {

using tn::log::Level;

// A record of a bundle with `version` as its BNBundleVersion (none: null).
registrar::PlugInPtr record(const std::string& identifier, const char* version) {
  registrar::PlugInRecord::Fields fields;
  fields.uuid = tn::UUID::random();
  fields.bundlePath = "/opt/plugins/" + identifier;
  fields.bundleIdentifier = identifier;
  fields.identifier = identifier;
  tn::Dictionary info{{"BNBundleIdentifier", identifier}};
  if (version != nullptr) {
    fields.bundleVersion = std::string(version);
    info.set("BNBundleVersion", version);
  }
  fields.infoDictionary = tn::Value(std::move(info));
  return std::make_shared<registrar::PlugInRecord>(std::move(fields));
}

// Keeps every removal asked for; the test answers them.
class Supervisor {
 public:
  struct Removal {
    std::string identifier;
    std::string version;
    std::shared_ptr<tn::dispatch::SerialQueue> queue;
    std::function<void(int)> reply;
  };

  PlugInTermination::ServiceRemover remover() {
    return [this](const std::string& identifier, const std::string& version,
                  std::shared_ptr<tn::dispatch::SerialQueue> queue, std::function<void(int)> reply) {
      const std::lock_guard lock(mutex_);
      removals_.push_back({identifier, version, std::move(queue), std::move(reply)});
    };
  }
  std::vector<Removal> removals() {
    const std::lock_guard lock(mutex_);
    return removals_;
  }
  void answer(size_t i, int status) {
    const Removal removal = removals()[i];
    removal.queue->async([removal, status] { removal.reply(status); });
  }

 private:
  std::mutex mutex_;
  std::vector<Removal> removals_;
};

class Termination : public ::testing::Test {
 protected:
  void SetUp() override { tn::log::configure("debug"); }
};

// A completion that records the queue it ran on and can be waited for.
struct Completion {
  tn::dispatch::Semaphore ran;
  std::string queue;
  std::function<void()> block() {
    return [this] {
      queue = tn::dispatch::SerialQueue::current()->label();
      ran.signal();
    };
  }
};

TEST_F(Termination, CompletesOnItsWaiterAfterEveryAnswerWhateverItsStatus) {
  tn::log::ScopedCaptureSink capture;
  Supervisor supervisor;
  Completion completion;
  const registrar::PlugInList records{record("com.example.a", "2.0"), record("com.example.b", nullptr),
                                      record("com.example.c", "1.1")};
  PlugInTermination::start(records, supervisor.remover(), completion.block());

  const std::vector<Supervisor::Removal> removals = supervisor.removals();
  ASSERT_EQ(removals.size(), 3u);
  EXPECT_EQ(removals[0].version, "2.0");
  EXPECT_EQ(removals[1].version, "1") << "no BNBundleVersion: the supervisor's default";
  EXPECT_EQ(removals[1].identifier, "com.example.b");
  EXPECT_EQ(removals[0].queue->label(), "killer");

  // Answered out of order, one missing: once the waiter has taken both
  // answers it awaits the third, and has not completed.
  supervisor.answer(2, 5);
  supervisor.answer(0, 0);
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(20);
  while (!capture->contains("ops", Level::Debug, "awaiting termination reply #2") &&
         std::chrono::steady_clock::now() < deadline) {
    std::this_thread::yield();
  }
  ASSERT_TRUE(capture->contains("ops", Level::Debug, "awaiting termination reply #2"));
  EXPECT_FALSE(completion.ran.waitFor(std::chrono::milliseconds(0)));
  supervisor.answer(1, 3);
  ASSERT_TRUE(completion.ran.waitFor(std::chrono::seconds(20)));
  EXPECT_EQ(completion.queue, "killer-waiter");

  const std::string a = records[0]->uuid().string(), b = records[1]->uuid().string(),
                    c = records[2]->uuid().string();
  EXPECT_TRUE(capture->contains("ops", Level::Info, "one or more plug-ins have been terminated for uuid=" + a));
  EXPECT_TRUE(capture->contains("ops", Level::Debug, "warden reported no plug-ins on record for uuid=" + b));
  EXPECT_TRUE(capture->contains("ops", Level::Error,
                                "warden error attempting to terminate plug-ins: error=5 for uuid=" + c));
  EXPECT_TRUE(capture->contains("ops", Level::Debug, "requesting termination for com.example.b((null)) warden:1 " + b));
  // Each reply announced before the reply is sent.
  const std::vector<std::string> lines = capture->lines();
  const auto at = [&](const std::string& text) {
    return std::find_if(lines.begin(), lines.end(), [&](const std::string& line) {
      return line.find(text) != std::string::npos;
    }) - lines.begin();
  };
  EXPECT_LT(at("waiting for 3 termination replies"), at("awaiting termination reply #0"));
  EXPECT_LT(at("awaiting termination reply #2"), at("sending termination reply"));
  EXPECT_LT(at("sending termination reply"), static_cast<long>(lines.size()));
}

TEST_F(Termination, WithNothingToTerminateCompletesAtOnce) {
  Supervisor supervisor;
  Completion completion;
  PlugInTermination::start({}, supervisor.remover(), completion.block());
  ASSERT_TRUE(completion.ran.waitFor(std::chrono::seconds(20)));
  EXPECT_TRUE(supervisor.removals().empty());
}

TEST_F(Termination, ASupervisorThatNeverAnswersHoldsUpOnlyItsOwnCall) {
  Supervisor silent;
  Completion stuck;
  PlugInTermination::start({record("com.example.stuck", "1")}, silent.remover(), stuck.block());
  Supervisor prompt;
  Completion answered;
  PlugInTermination::start({record("com.example.fine", "1")}, prompt.remover(), answered.block());
  prompt.answer(0, 0);
  ASSERT_TRUE(answered.ran.waitFor(std::chrono::seconds(20)));
  EXPECT_FALSE(stuck.ran.waitFor(std::chrono::milliseconds(0)));
}

}  // namespace
}  // namespace tnd
