#pragma once

// SignalSource: delivers a process signal (SIGTERM for the daemon) as a block
// on a serial queue, the way the daemon's termination handler wants it: on
// the main queue, with no signal handler installed and no disposition
// changed. The signal is blocked in every thread and taken with sigwait() by
// one watcher thread, which hands each arrival to the queue.

#include <csignal>
#include <functional>
#include <memory>
#include <thread>

#include "platform/dispatch/SerialQueue.h"

namespace tn::dispatch {

class SignalSource {
 public:
  // Blocks `signo` in the calling thread. Must be called before the process
  // starts any other thread (threads inherit the mask), i.e. first in main;
  // a thread started earlier could still take the signal's default action.
  static void blockInAllThreads(int signo);

  // Starts watching `signo`; each arrival runs `handler` on `queue`. The
  // signal must have been blocked with blockInAllThreads. The watcher runs
  // for the rest of the process (the source is never destroyed).
  static std::unique_ptr<SignalSource> create(int signo, std::shared_ptr<SerialQueue> queue,
                                              std::function<void()> handler);

  SignalSource(const SignalSource&) = delete;
  SignalSource& operator=(const SignalSource&) = delete;
  ~SignalSource();

 private:
  SignalSource() = default;
  std::thread watcher_;
};

}  // namespace tn::dispatch
