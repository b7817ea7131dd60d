#include "tenond/server/PlugInTermination.h"

#include "platform/log/Log.h"
#include "platform/warden/Warden.h"

namespace tnd {

// The count of answers, on "killer-waiter" only.
class PlugInTermination::Waiter {
 public:
  Waiter(size_t expected, std::function<void()> completion)
      : expected_(expected), completion_(std::move(completion)) {}

  void begin() {
    TN_LOG_DEBUG(tn::log::ops(), "waiting for {} termination replies", expected_);
    started_ = true;
    advance();
  }

  void answerArrived() {
    ++answered_;
    if (started_) advance();
  }

 private:
  // Takes every answer that has come, announcing each reply before it is
  // taken, and completes after the last.
  void advance() {
    while (completion_) {
      if (next_ == expected_) {
        TN_LOG_DEBUG(tn::log::ops(), "sending termination reply");
        std::function<void()> completion = std::move(completion_);
        completion_ = nullptr;
        completion();
        return;
      }
      if (!announced_) {
        TN_LOG_DEBUG(tn::log::ops(), "awaiting termination reply #{}", next_);
        announced_ = true;
      }
      if (answered_ <= next_) return;
      ++next_;
      announced_ = false;
    }
  }

  const size_t expected_;
  std::function<void()> completion_;
  bool started_ = false;
  size_t answered_ = 0;
  size_t next_ = 0;  // the reply awaited now
  bool announced_ = false;
};

std::string PlugInTermination::supervisorVersion(const registrar::PlugInRecord& record) {
  const tn::Value& version = record.infoDictionary()["BNBundleVersion"];
  if (const std::string* text = version.string()) return *text;
  return "1";
}

std::string PlugInTermination::describe(const registrar::PlugInList& records) {
  std::string text = "[";
  for (const registrar::PlugInPtr& record : records) {
    if (text.size() > 1) text += ", ";
    text += record->identifier() + "(" + record->uuid().string() + ")";
  }
  return text + "]";
}

void PlugInTermination::start(const registrar::PlugInList& records, const ServiceRemover& remover,
                              std::function<void()> completion) {
  const auto killer = tn::dispatch::SerialQueue::create("killer");
  const auto waiterQueue = tn::dispatch::SerialQueue::create("killer-waiter");
  const auto waiter = std::make_shared<Waiter>(records.size(), std::move(completion));
  // Queued before any request goes out, so that the waiter has started
  // when the first answer is counted.
  waiterQueue->async([waiter] { waiter->begin(); });
  for (const registrar::PlugInPtr& record : records) {
    const std::string identifier = record->bundleIdentifier().value_or(record->identifier());
    const std::string version = supervisorVersion(*record);
    const std::string token = record->uuid().string();
    TN_LOG_DEBUG(tn::log::ops(), "requesting termination for {}({}) warden:{} {}", identifier,
                 record->bundleVersion().value_or("(null)"), version, token);
    remover(identifier, version, killer, [waiter, waiterQueue, token](int status) {
      if (status == warden::kNoInstancesRunning) {
        TN_LOG_DEBUG(tn::log::ops(), "warden reported no plug-ins on record for uuid={}", token);
      } else if (status != warden::kTerminated) {
        TN_LOG_ERROR(tn::log::ops(), "warden error attempting to terminate plug-ins: error={} for uuid={}", status,
                     token);
      } else {
        TN_LOG_INFO(tn::log::ops(), "one or more plug-ins have been terminated for uuid={}", token);
      }
      waiterQueue->async([waiter] { waiter->answerArrived(); });
    });
  }
}

}  // namespace tnd
