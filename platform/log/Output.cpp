#include "platform/log/Output.h"

#include <cstdlib>
#include <mutex>
#include <unistd.h>

#include "platform/log/JournalSink.h"
#include "platform/log/StderrSink.h"

namespace tn::log {

namespace {

struct CurrentSink {
  std::mutex mutex;
  std::shared_ptr<Sink> sink;  // null until first use
};

// Never destroyed: objects with static storage may still log while the
// process exits.
CurrentSink& current() {
  static auto* current = new CurrentSink;
  return *current;
}

}  // namespace

std::shared_ptr<Sink> makeDefaultSink() {
  if (journalStreamMatches(std::getenv("JOURNAL_STREAM"), STDERR_FILENO)) {
    return std::make_shared<JournalSink>();
  }
  return std::make_shared<StderrSink>(STDERR_FILENO);
}

std::shared_ptr<Sink> currentSink() {
  CurrentSink& state = current();
  std::lock_guard lock(state.mutex);
  if (!state.sink) state.sink = makeDefaultSink();
  return state.sink;
}

std::shared_ptr<Sink> setSink(std::shared_ptr<Sink> sink) {
  if (!sink) sink = makeDefaultSink();
  CurrentSink& state = current();
  std::lock_guard lock(state.mutex);
  if (!state.sink) state.sink = makeDefaultSink();
  std::swap(state.sink, sink);
  return sink;
}

}  // namespace tn::log
