#include "platform/dispatch/MainLoop.h"

#include <unistd.h>

#include <exception>
#include <string>

#include "platform/dispatch/Fatal.h"

namespace tn::dispatch {

class MainLoop::Running {
 public:
  Running(MainLoop& loop, const char* what) : loop_(loop) {
    if (!isMainThread()) {
      detail::fatal(std::string(what) + " called off the main thread");
    }
    if (loop_.running_) {
      detail::fatal(std::string(what) + " called from inside the main loop");
    }
    loop_.running_ = true;
  }
  ~Running() { loop_.running_ = false; }
  Running(const Running&) = delete;
  Running& operator=(const Running&) = delete;

 private:
  MainLoop& loop_;
};

MainLoop& MainLoop::shared() {
  // Leaked on purpose: other threads may schedule onto it during exit.
  static MainLoop* const loop = new MainLoop();
  return *loop;
}

bool MainLoop::isMainThread() { return ::gettid() == ::getpid(); }

void MainLoop::schedule(std::function<void()> task) {
  std::lock_guard lock(mutex_);
  tasks_.push_back(std::move(task));
  taskAvailable_.notify_one();
}

void MainLoop::run() {
  const Running running(*this, "runMainLoop");
  for (;;) {
    runNext(nullptr);
  }
}

void MainLoop::runUntil(const std::function<bool()>& done) {
  const Running running(*this, "runMainLoopUntil");
  while (!done()) {
    runNext(nullptr);
  }
}

bool MainLoop::runOnce(std::chrono::milliseconds timeout) {
  const Running running(*this, "runMainLoopOnce");
  const auto deadline = std::chrono::steady_clock::now() + timeout;
  return runNext(&deadline);
}

bool MainLoop::runNext(const std::chrono::steady_clock::time_point* deadline) {
  std::function<void()> task;
  {
    std::unique_lock lock(mutex_);
    const auto ready = [this] { return !tasks_.empty(); };
    if (deadline == nullptr) {
      taskAvailable_.wait(lock, ready);
    } else if (!taskAvailable_.wait_until(lock, *deadline, ready)) {
      return false;
    }
    task = std::move(tasks_.front());
    tasks_.pop_front();
  }
  try {
    task();
  } catch (const std::exception& error) {
    detail::fatalBlockThrew("on the main loop", error.what());
  } catch (...) {
    detail::fatalBlockThrew("on the main loop", nullptr);
  }
  return true;
}

const std::shared_ptr<SerialQueue>& mainQueue() {
  static const auto* const queue =
      new std::shared_ptr<SerialQueue>(SerialQueue::create("main", 0, MainLoop::shared()));
  return *queue;
}

void runMainLoop() { MainLoop::shared().run(); }

void runMainLoopUntil(const std::function<bool()>& done) { MainLoop::shared().runUntil(done); }

bool runMainLoopOnce(std::chrono::milliseconds timeout) {
  return MainLoop::shared().runOnce(timeout);
}

}  // namespace tn::dispatch
