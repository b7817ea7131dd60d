// CaptureSink: a sink that keeps every record, for tests to assert on.
//
//   ScopedCaptureSink capture;              // installed until end of scope
//   TN_LOG_INFO(tn::log::ops(), "hello {}", 1);
//   EXPECT_TRUE(capture->contains("ops", Level::Info, "hello 1"));

#pragma once

#include <chrono>
#include <cstddef>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/log/Sink.h"

namespace tn::log {

// An owned copy of a Record.
struct CapturedRecord {
  std::string subsystem;
  std::string category;
  Level level = Level::Default;
  std::string text;
  std::chrono::system_clock::time_point timestamp;
  pid_t thread = 0;
};

class CaptureSink : public Sink {
 public:
  // Keeps a copy of the record. Thread-safe.
  void write(const Record& record) override;

  // A copy of everything captured so far, in arrival order.
  std::vector<CapturedRecord> records() const;

  // Every captured record as "category level text", in arrival order.
  std::vector<std::string> lines() const;

  // Number of captured records of `category` and `level` whose text contains
  // `substring` (an empty substring matches every text).
  std::size_t count(std::string_view category, Level level, std::string_view substring) const;

  // True when count(category, level, substring) > 0.
  bool contains(std::string_view category, Level level, std::string_view substring) const;

  // Forgets everything captured so far.
  void clear();

 private:
  mutable std::mutex mutex_;
  std::vector<CapturedRecord> records_;
};

// Installs a fresh CaptureSink as the process's sink for its lifetime and
// puts the previous sink back when destroyed. Scopes must nest (destroy in
// reverse order of construction).
class ScopedCaptureSink {
 public:
  ScopedCaptureSink();
  ~ScopedCaptureSink();
  ScopedCaptureSink(const ScopedCaptureSink&) = delete;
  ScopedCaptureSink& operator=(const ScopedCaptureSink&) = delete;

  CaptureSink& sink() const { return *sink_; }
  CaptureSink* operator->() const { return sink_.get(); }

 private:
  std::shared_ptr<CaptureSink> sink_;
  std::shared_ptr<Sink> previous_;
};

}  // namespace tn::log
