#include "platform/log/CategorySlot.h"

#include "platform/log/LogMacros.h"

namespace tn::log {

CategorySlot::CategorySlot(std::string name, Maker maker)
    : name_(std::move(name)), maker_(std::move(maker)) {}

Log& CategorySlot::get() {
  // Fast path after the first call: one acquire load, no lock.
  if (Log* log = log_.load(std::memory_order_acquire)) return *log;
  std::call_once(once_, [this] { make(); });
  return *log_.load(std::memory_order_acquire);
}

void CategorySlot::make() {
  owned_ = maker_(name_.c_str());
  Log* log = owned_.get();
  if (log == nullptr) {
    TN_LOG_ERROR(defaultLog(), "unable to create tracelog for category {}", name_);
    log = &defaultLog();
  }
  log_.store(log, std::memory_order_release);
}

}  // namespace tn::log
