// platform/dispatch: work queues for Tenon (library tn_dispatch).
//
// The daemon's design speaks in serial queues: every piece of state belongs
// to one queue and is touched only by blocks running on it. This folder
// provides them, standing in for the platform's dispatch service:
//
//   SerialQueue  a serial queue: async(), sync(), assertOnQueue(), lock ranks
//   FairQueue    a serial queue shared by clients, which takes them in turn
//   ThreadPool   the shared workers queues run on; BlockingScope for workers
//                that wait
//   Semaphore    a counting semaphore
//   MainLoop     the main thread's loop and the main queue (mainQueue(),
//                runMainLoop())
//   QueueTarget  what a queue runs on (pool or main loop)
//   Poller       an event source the pool's idle workers wait in (the relay's
//                sockets)
//   SignalSource a process signal delivered as a block on a queue
//
// Programming errors (sync onto the queue you are on, a block run off its
// queue, a block that throws) abort the process with a "tenon: fatal:" line
// on stderr instead of hanging. The library depends only on the standard
// library and threads; it includes nothing else from the repository.
//
// Including this header includes all of the above.

#pragma once

#include "platform/dispatch/FairQueue.h"
#include "platform/dispatch/MainLoop.h"
#include "platform/dispatch/Poller.h"
#include "platform/dispatch/QueueTarget.h"
#include "platform/dispatch/Semaphore.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/dispatch/SignalSource.h"
#include "platform/dispatch/ThreadPool.h"
