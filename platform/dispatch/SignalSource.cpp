#include "platform/dispatch/SignalSource.h"

#include <pthread.h>

#include <cerrno>

namespace tn::dispatch {

void SignalSource::blockInAllThreads(int signo) {
  sigset_t set;
  sigemptyset(&set);
  sigaddset(&set, signo);
  pthread_sigmask(SIG_BLOCK, &set, nullptr);
}

std::unique_ptr<SignalSource> SignalSource::create(int signo, std::shared_ptr<SerialQueue> queue,
                                                   std::function<void()> handler) {
  std::unique_ptr<SignalSource> source(new SignalSource());
  source->watcher_ = std::thread([signo, queue = std::move(queue), handler = std::move(handler)] {
    sigset_t set;
    sigemptyset(&set);
    sigaddset(&set, signo);
    for (;;) {
      int received = 0;
      if (sigwait(&set, &received) == 0 && received == signo) queue->async(handler);
    }
  });
  // The watcher lives as long as the process: it only ever waits.
  source->watcher_.detach();
  return source;
}

SignalSource::~SignalSource() = default;

}  // namespace tn::dispatch
