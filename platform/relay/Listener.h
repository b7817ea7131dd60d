// Listener: the named endpoint of a service, which turns each client that
// connects into a server Connection.
//
//   auto listener = relay::Listener::create("com.ostrel.tenond", queue);
//   (*listener)->setNewConnectionHandler([](std::shared_ptr<relay::Connection> c) { ... });
//   (*listener)->resume();
//
// The socket is $TENON_ROOT/run/tenon/relay/<service>, mode 0666 in a
// directory created with mode 0755: every local process may connect, and
// each request is judged by the peer's identity. Under systemd socket
// activation the listener takes the passed socket instead (see
// SocketActivation.h) and neither creates nor removes a file.
//
// A new listener is suspended: its socket is bound but not listening, so a
// client that tries to connect before resume() is refused at once
// (ServiceUnavailable) rather than left waiting on a service that is still
// starting. An activated socket is already listening; there, clients wait
// in the backlog until resume().
//
// Limits (Limits below): when a connection is accepted, its peer's uid is
// read (SO_PEERCRED) and the connection counted against the per-user and
// total limits before anything else is allocated for it; one over a limit
// is closed at once, and named in the log at most once a minute per uid.
// Each admitted connection is then identified (PeerIdentity) on the
// listener's queue before the handler sees it; a peer that cannot be
// identified is closed without reaching the handler. Each connection hands
// out at most `outstandingRequests` requests that are not yet handled
// (Message::charge); beyond that its socket is not read (back-pressure).
// Failures of the listening socket itself go to the error handler.
//
// Lifetime: the listener accepts while it exists and is resumed; cancel(),
// or destroying it, stops accepting, closes its socket and removes the
// socket file it created. Connections already made live on.
//
// Threads: handlers run on the listener's queue. Setters must be called
// before resume(); the other members from any thread.

#pragma once

#include <cstddef>
#include <functional>
#include <limits>
#include <memory>
#include <string>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "platform/value/Error.h"
#include "platform/value/Result.h"

namespace relay {

class Listener {
 public:
  using NewConnectionHandler = std::function<void(std::shared_ptr<Connection>)>;
  using ErrorHandler = std::function<void(const tn::Error&)>;

  struct Limits {
    std::size_t connectionsPerUser = 64;
    std::size_t connectionsTotal = std::numeric_limits<std::size_t>::max();
    // Places of the total kept for root and this process's own user.
    std::size_t privilegedReserve = 0;
    std::size_t outstandingRequests = 64;  // per connection
    // Descriptors one request may bring (Descriptors.h), at most
    // kMaxDescriptorsPerFrame; a request with more ends its connection. 0:
    // a service that takes none refuses them all, so no peer can make it
    // hold descriptors.
    std::size_t descriptorsPerRequest = 0;
  };

  // Binds (or adopts) the socket of `serviceName`; handlers run on `queue`.
  // Errors: InvalidServiceName; SystemError (directory, socket, bind),
  // including EADDRINUSE when a live listener already serves the name, or
  // when something other than a socket sits at the path. A stale socket
  // file (nothing listening) is replaced.
  static tn::Result<std::shared_ptr<Listener>> create(std::string serviceName,
                                                      std::shared_ptr<tn::dispatch::SerialQueue> queue);

  ~Listener();
  Listener(const Listener&) = delete;
  Listener& operator=(const Listener&) = delete;

  void setNewConnectionHandler(NewConnectionHandler handler);
  void setErrorHandler(ErrorHandler handler);
  void setMaxConnectionsPerUser(std::size_t limit);
  void setLimits(const Limits& limits);
  Limits limits() const;

  // Starts listening and accepting. Later calls do nothing.
  void resume();

  // Stops for good (see above). Later calls do nothing.
  void cancel();

  const std::string& serviceName() const;
  // The socket's path; for an activated socket, the path it would have had.
  const std::string& socketPath() const;
  bool isSocketActivated() const;
  // Connections admitted and not yet ended (their places under the limits).
  std::size_t connectionCount() const;


 private:
  struct Core;  // the state the I/O thread shares; in Listener.cpp

  explicit Listener(std::shared_ptr<Core> core);

  // Makes the server connection for an identified socket (Connection
  // befriends Listener, not its Core).
  static std::shared_ptr<Connection> makeConnection(UniqueFd socket, PeerIdentity identity,
                                                    std::string serviceName, std::shared_ptr<void> lease,
                                                    std::size_t outstandingRequests,
                                                    std::size_t descriptorsPerRequest);

  std::shared_ptr<Core> core_;
};

}  // namespace relay
