#pragma once

// IdleExit: ends a socket-activated daemon that has had nothing to do for a
// while.
//
// Under socket activation the service manager keeps the listening sockets
// and starts the daemon again for the next connection, so a daemon with no
// connection, no hold and no plug-in instance may go and give its memory
// back. A watcher thread asks `isIdle` a few times per limit; once it has
// answered true without a break for `limit`, the watcher has the listener
// stop accepting (`stopAccepting`, on the main queue: new clients now wait
// in the socket's backlog for the next daemon), then waits until `isIdle`
// holds again (a client accepted in between is served to its end) and calls
// `exit` on the main queue. Nothing is ever refused: a client either
// reaches this daemon or waits for the next one.
//
// Threads: `isIdle` runs on the watcher thread and must be safe there;
// the other two run on the main queue. Destroying the object stops the
// watcher (and joins it) if it has not posted `exit` yet.

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
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

  // How often the watcher asks: a quarter of the limit, between 50 ms and
  // 5 s, so that the daemon exits at most a quarter late.
  static std::chrono::milliseconds pollPeriod(std::chrono::milliseconds limit);

 private:
  IdleExit(std::chrono::milliseconds limit, Actions actions);
  void watch();
  // Waits `period`; false when the object is being destroyed.
  bool pause(std::chrono::milliseconds period);

  const std::chrono::milliseconds limit_;
  const Actions actions_;
  std::mutex mutex_;
  std::condition_variable wake_;
  bool stopping_ = false;  // guarded by mutex_
  std::thread watcher_;
};

}  // namespace tnd
