#include "platform/log/CaptureSink.h"

#include <fmt/format.h>

#include "platform/log/Output.h"

namespace tn::log {

void CaptureSink::write(const Record& record) {
  CapturedRecord copy{std::string(record.subsystem), std::string(record.category),
                      record.level,                  std::string(record.text),
                      record.timestamp,              record.thread};
  std::lock_guard lock(mutex_);
  records_.push_back(std::move(copy));
}

std::vector<CapturedRecord> CaptureSink::records() const {
  std::lock_guard lock(mutex_);
  return records_;
}

std::vector<std::string> CaptureSink::lines() const {
  std::lock_guard lock(mutex_);
  std::vector<std::string> lines;
  lines.reserve(records_.size());
  for (const CapturedRecord& record : records_) {
    lines.push_back(fmt::format("{} {} {}", record.category, levelName(record.level), record.text));
  }
  return lines;
}

std::size_t CaptureSink::count(std::string_view category, Level level,
                               std::string_view substring) const {
  std::lock_guard lock(mutex_);
  std::size_t matches = 0;
  for (const CapturedRecord& record : records_) {
    if (record.category == category && record.level == level &&
        record.text.find(substring) != std::string::npos) {
      ++matches;
    }
  }
  return matches;
}

bool CaptureSink::contains(std::string_view category, Level level,
                           std::string_view substring) const {
  return count(category, level, substring) > 0;
}

void CaptureSink::clear() {
  std::lock_guard lock(mutex_);
  records_.clear();
}

ScopedCaptureSink::ScopedCaptureSink()
    : sink_(std::make_shared<CaptureSink>()), previous_(setSink(sink_)) {}

ScopedCaptureSink::~ScopedCaptureSink() { setSink(std::move(previous_)); }

}  // namespace tn::log
