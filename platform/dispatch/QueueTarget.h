// QueueTarget: where a SerialQueue's blocks run.
//
// A SerialQueue owns no thread. When it has work it hands a "drain" task to its
// target, and whatever thread the target runs that task on executes the queue's
// blocks. Two targets exist: the shared ThreadPool (every queue made by
// SerialQueue::create(label)) and the MainLoop (the main queue, run by the
// main thread). Tests may build queues on a private ThreadPool.

#pragma once

#include <functional>

namespace tn::dispatch {

class QueueTarget {
 public:
  virtual ~QueueTarget() = default;

  // Arranges for `task` to run exactly once, later, on a thread of this
  // target, and returns without running it. Callable from any thread,
  // including from inside a task of this target. Tasks scheduled from one
  // thread start in the order they were scheduled.
  virtual void schedule(std::function<void()> task) = 0;

  // True when the calling thread is the only thread that could ever run this
  // target's tasks, so that blocking it until one of them has run can never
  // end. SerialQueue::sync aborts instead of waiting for a turn that needs
  // such a task. The pool answers false.
  virtual bool waitingWouldStall() const { return false; }

 protected:
  QueueTarget() = default;
  QueueTarget(const QueueTarget&) = default;
  QueueTarget& operator=(const QueueTarget&) = default;
};

}  // namespace tn::dispatch
