// KeepAlive: the process-wide count of transactions in progress, and the
// signal that something which kept the process busy has ended.
//
// Code that must not be interrupted by an idle exit brackets its work with
// transactionBegin() / transactionEnd(); the daemon may consider itself idle
// when keepAliveCount() is 0. The relay itself never changes the count.
//
// An idle exit sleeps until the process may have become idle rather than
// asking again and again: activityEnded() runs the handler set with
// setActivityEndedHandler() (none by default: then it costs one atomic
// load). transactionEnd() calls it, so does a listener when one of its
// connections ends, and so does any other owner of something the daemon
// counts as work when that ends (the supervisor's hosts and instances). The
// handler runs on the thread that ended the work, after its owner has
// counted it out and with none of the owner's locks held, so it may ask
// every count again.
//
// Threads: any; the count and the handler are one atomic each.

#pragma once

#include <cstdint>

namespace relay {

void transactionBegin();

// Must follow a transactionBegin(); an end without a begin is a programming
// error and aborts the process with a message.
void transactionEnd();

uint64_t keepAliveCount();

// The handler must stay callable for the rest of the process (a plain
// function), and must be quick: it runs on whatever thread ended the work.
// Null removes it.
void setActivityEndedHandler(void (*handler)());
void activityEnded();

}  // namespace relay
