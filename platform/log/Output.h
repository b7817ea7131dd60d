// Output: the process's current sink, which every log object writes to.
//
// At first use the sink is chosen from the environment: the journal when
// JOURNAL_STREAM names the file stderr is open on (systemd connected stderr
// to the journal), otherwise stderr, one line per message.

#pragma once

#include <memory>

#include "platform/log/Sink.h"

namespace tn::log {

// Returns the sink the environment calls for (see above). A new object on
// every call.
std::shared_ptr<Sink> makeDefaultSink();

// Returns the current sink, choosing the default one on first use. Never
// null. Thread-safe.
std::shared_ptr<Sink> currentSink();

// Makes `sink` the current sink and returns the previous one. A null `sink`
// puts a fresh default sink in place. Thread-safe: a record being written
// while the swap happens goes wholly to one of the two sinks, and the
// previous sink stays alive until its writers are done with it.
std::shared_ptr<Sink> setSink(std::shared_ptr<Sink> sink);

}  // namespace tn::log
