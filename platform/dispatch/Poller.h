// Poller: an event source (sockets, timers) that the shared ThreadPool's
// idle workers wait on themselves, instead of a thread of its own.
//
// One idle worker at a time is the poller: it blocks in pollOnce() until an
// event arrives, runs what the event calls for, and then runs the tasks that
// this queued before it goes back to waiting. A request that arrives on a
// socket therefore wakes exactly one thread, and that thread carries it
// through the queues it visits, instead of each hand-off waking another
// thread (waking a sleeping thread costs tens of microseconds on small
// virtual machines, more than the work of a small request).
//
// Threads: pollOnce() is called by one thread at a time (the pool
// guarantees it, and hands the role between threads under its lock, so what
// one call did is visible to the next). interrupt() may be called from any
// thread at any time.

#pragma once

namespace tn::dispatch {

class Poller {
 public:
  virtual ~Poller() = default;

  // Waits until at least one event is ready (or interrupt() was called),
  // runs the handler of one ready event, and returns. Must not throw.
  virtual void pollOnce() = 0;

  // Makes the pollOnce() now waiting, or the next one, return soon.
  virtual void interrupt() = 0;

 protected:
  Poller() = default;
  Poller(const Poller&) = default;
  Poller& operator=(const Poller&) = default;
};

}  // namespace tn::dispatch
