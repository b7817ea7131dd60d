#pragma once

// The daemon's lock order, as ranks of its serial queues
// (SerialQueue::setLockRank): a thread may sync onto a queue only while it
// holds queues of lower rank. Debug and sanitizer builds abort on the first
// sync that breaks it, naming both queues.
//
//   "service"                  may sync onto "serverSync" and "TNDatabase"
//   "serverSync", "TNDatabase"  sync onto no other ranked queue
//
// Unranked queues (a connection's events, the main queue, the registrar's)
// are not checked; they may sync onto any of these.

namespace tnd {

inline constexpr int kServiceQueueRank = 10;
inline constexpr int kLeafQueueRank = 20;  // "serverSync" and "TNDatabase"

}  // namespace tnd
