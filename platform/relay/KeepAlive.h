// KeepAlive: the process-wide count of transactions in progress.
//
// Code that must not be interrupted by an idle exit brackets its work with
// transactionBegin() / transactionEnd(); the daemon may consider itself idle
// when keepAliveCount() is 0. The relay itself never changes the count.
//
// Threads: any; the count is one atomic.

#pragma once

#include <cstdint>

namespace relay {

void transactionBegin();

// Must follow a transactionBegin(); an end without a begin is a programming
// error and aborts the process with a message.
void transactionEnd();

uint64_t keepAliveCount();

}  // namespace relay
