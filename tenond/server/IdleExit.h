#pragma once

// IdleExit: ends a socket-activated daemon that has had nothing to do for a
// while.
//
// Under socket activation the service manager keeps the listening sockets
// and starts the daemon again for the next connection, so a daemon with no
// connection, no hold and no plug-in instance may go and give its memory
// back. Once `isIdle` has held without a break for `limit`, the watcher has
// the listener stop accepting (`stopAccepting`, on the main queue: new
// clients now wait in the socket's backlog for the next daemon), then waits
// until `isIdle` holds again (a client accepted in between is served to its
// end) and calls `exit` on the main queue. Nothing is ever refused: a
// client either reaches this daemon or waits for the next one.
//
// The watcher never polls: a daemon with nothing to do must not wake. It
// sleeps until its deadline or until something that kept the daemon busy
// ends (relay::activityEnded: a connection of any listener, a hold, a
// supervisor's host or instance), and asks `isIdle` only then. Idle after
// an end re-arms the deadline a whole `limit` away; busy at the deadline
// disarms it until the next end. Work that begins needs no signal: it is
// either still going at the deadline (seen then) or has ended (an end).
//
// Threads: `isIdle` runs on the watcher thread and must be safe there;
// the other two run on the main queue. One IdleExit per process (it owns
// relay::setActivityEndedHandler). Destroying the object stops the watcher
// (and joins it) if it has not posted `exit` yet.

#include <chrono>
#include <functional>
#include <memory>
#include <thread>

namespace tnd {

class IdleExit {
 public:
  struct Actions {
    std::function<bool()> isIdle;
    std::function<void()> stopAccepting;
    std::function<void()> exit;
  };

  // Starts watching; `limit` is positive.
  static std::unique_ptr<IdleExit> start(std::chrono::milliseconds limit, Actions actions);

  ~IdleExit();
  IdleExit(const IdleExit&) = delete;
  IdleExit& operator=(const IdleExit&) = delete;

  // What the watcher waits on, shared with the activity handler and the
  // block that stops the listener (either may outlive the object).
  struct Signals;

 private:
  IdleExit(std::chrono::milliseconds limit, Actions actions);
  void watch();
  // Sleeps until `limit_` of unbroken idleness has passed; false when the
  // object is being destroyed.
  bool waitForIdleLimit();
  // Once the listener has stopped, sleeps until the daemon is idle again;
  // false when the object is being destroyed.
  bool waitForDrain();

  const std::chrono::milliseconds limit_;
  const Actions actions_;
  const std::shared_ptr<Signals> signals_;
  std::thread watcher_;
};

}  // namespace tnd
