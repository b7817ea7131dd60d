// Termination: telling the connections of a process that it is about to exit.

#pragma once

#include <memory>

namespace relay {

class Connection;

// Delivers Event::Kind::TerminationImminent, once, to every live server
// connection of this process (those its listeners accepted), and to every
// server connection accepted from now on. The daemon calls it when it
// starts to shut down (its SIGTERM handler), so that per-client objects can
// finish or refuse work before the process exits. Threads: any.
void terminationImminent();

namespace detail {

// Listener: registers an accepted connection. Returns true when
// terminationImminent() was already called (the caller announces it).
bool registerForTermination(const std::shared_ptr<Connection>& connection);

}  // namespace detail

}  // namespace relay
