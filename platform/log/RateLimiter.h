// RateLimiter: keeps one client from flooding the log with one line.
//
// Lines are counted per (context, site): the context is the client whose
// work is running (LogContext.h), the site the call site's format string
// literal. Each pair may write a burst of kBurst lines, then kRatePerSecond
// lines a second (a token bucket). A line beyond that is counted instead of
// written; the next line of the pair that is written is preceded by the
// summary "… N similar lines suppressed", and endContext() writes the
// summaries a context still owes. Lines outside any context (context 0) are
// never limited.
//
// Memory is bounded: at most kMaxSitesPerContext buckets per context (the
// first kMaxSitesPerContext - 1 sites get their own, the sites beyond share
// one overflow bucket) and at most
// kMaxContexts contexts (the one used least recently is dropped, its
// summaries handed back first).
//
// The class takes the time as an argument so that tests can drive it; the
// log layer's one instance uses the steady clock. Thread-safe.

#pragma once

#include <chrono>
#include <cstddef>
#include <cstdint>
#include <list>
#include <mutex>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/log/Level.h"

namespace tn::log {

class Log;

class RateLimiter {
 public:
  using Clock = std::chrono::steady_clock;
  static constexpr double kBurst = 20;
  static constexpr double kRatePerSecond = 10;
  static constexpr std::size_t kMaxSitesPerContext = 64;
  static constexpr std::size_t kMaxContexts = 256;

  // A summary owed: the line "… <suppressed> similar lines suppressed" on the
  // log object of `subsystem`/`category` at `level`.
  struct Summary {
    std::string subsystem;
    std::string category;
    Level level = Level::Default;
    uint64_t suppressed = 0;
  };

  // What to do with one line.
  struct Decision {
    bool write = true;
    std::vector<Summary> summaries;  // to write before the line (or at all, when write is false)
  };

  // Decides about one line of site (any stable address; null means "no
  // site": never limited) in context (0: never limited) on log.
  Decision admit(uint64_t context, const void* site, const Log& log, Level level, Clock::time_point now);

  // The summaries context still owes; forgets the context.
  std::vector<Summary> endContext(uint64_t context);

  // How many contexts and (context, site) pairs are kept, for tests.
  std::size_t contextCount() const;
  std::size_t entryCount(uint64_t context) const;

  static std::string summaryText(uint64_t suppressed);

 private:
  struct Entry {
    double tokens = kBurst;
    Clock::time_point refilled;
    uint64_t suppressed = 0;
    Summary owner;  // where its summary goes (suppressed is filled in when owed)
  };
  struct Context {
    std::unordered_map<const void*, Entry> entries;  // the overflow bucket has key null
    std::list<uint64_t>::iterator recent;             // its place in recent_
  };

  Context& contextFor(uint64_t context, std::vector<Summary>& owed);
  static void collect(Context& context, std::vector<Summary>& owed);

  mutable std::mutex mutex_;
  std::unordered_map<uint64_t, Context> contexts_;
  std::list<uint64_t> recent_;  // most recently used first
};

}  // namespace tn::log
