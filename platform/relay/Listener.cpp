#include "platform/relay/Listener.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <asio/post.hpp>
#include <asio/posix/stream_descriptor.hpp>
#include <asio/steady_timer.hpp>
#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <utility>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/relay/ConnectionLimit.h"
#include "platform/relay/IoContext.h"
#include "platform/relay/RelayError.h"
#include "platform/relay/ServicePath.h"
#include "platform/relay/SocketActivation.h"
#include "platform/relay/Termination.h"

namespace relay {
namespace {

// Accepts per wake-up before the I/O thread turns to other sockets.
constexpr int kAcceptsPerTurn = 64;
// After accept() fails for lack of resources (descriptors, memory), the
// listener waits this long before trying again instead of spinning.
constexpr std::chrono::milliseconds kAcceptBackoff{100};

constexpr unsigned kDirectoryMode = 0755;
constexpr unsigned kSocketMode = 0666;

sockaddr_un socketAddress(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.data(), path.size());  // length checked by servicePath
  return address;
}

// True when something accepts connections on the socket at `path`.
bool someoneListens(const std::string& path) {
  const UniqueFd probe(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!probe.valid()) return false;
  const sockaddr_un address = socketAddress(path);
  if (::connect(probe.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) == 0) return true;
  return errno == EAGAIN;  // a full backlog is a live listener too
}

// Clears the way for binding `path`: nothing there, or a socket nobody
// listens on (left behind by a process that died), which is removed.
tn::Result<void> removeStaleSocket(const std::string& path) {
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0) {
    if (errno == ENOENT) return {};
    return makeSystemError(fmt::format("lstat {}", path), errno);
  }
  if (!S_ISSOCK(status.st_mode)) {
    return makeSystemError(fmt::format("{} exists and is not a socket", path), EADDRINUSE);
  }
  if (someoneListens(path)) {
    return makeSystemError(fmt::format("a listener already serves {}", path), EADDRINUSE);
  }
  if (::unlink(path.c_str()) != 0 && errno != ENOENT) {
    return makeSystemError(fmt::format("unlink {}", path), errno);
  }
  return {};
}

struct BoundSocket {
  UniqueFd socket;
  dev_t device = 0;
  ino_t inode = 0;
};

tn::Result<BoundSocket> bindServiceSocket(const std::string& path) {
  if (tn::Result<void> made = createDirectories(relayDirectory(), kDirectoryMode); !made.ok()) return made.error();
  if (tn::Result<void> cleared = removeStaleSocket(path); !cleared.ok()) return cleared.error();
  BoundSocket bound{UniqueFd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0))};
  if (!bound.socket.valid()) return makeSystemError("socket", errno);
  const sockaddr_un address = socketAddress(path);
  if (::bind(bound.socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) {
    return makeSystemError(fmt::format("bind {}", path), errno);
  }
  struct stat status {};
  if (::chmod(path.c_str(), kSocketMode) != 0 || ::stat(path.c_str(), &status) != 0) {
    const int error = errno;
    ::unlink(path.c_str());
    return makeSystemError(fmt::format("chmod {}", path), error);
  }
  bound.device = status.st_dev;
  bound.inode = status.st_ino;
  return bound;
}

}  // namespace

struct Listener::Core : std::enable_shared_from_this<Core> {
  Core(std::string name, std::string socketPath, std::shared_ptr<tn::dispatch::SerialQueue> listenerQueue,
       UniqueFd socket, bool wasActivated)
      : serviceName(std::move(name)),
        path(std::move(socketPath)),
        queue(std::move(listenerQueue)),
        activated(wasActivated),
        fd(socket.get()),
        descriptor(detail::ioContext(), socket.release()),
        backoff(detail::ioContext()) {}

  const std::string serviceName;
  const std::string path;
  const std::shared_ptr<tn::dispatch::SerialQueue> queue;
  const bool activated;
  dev_t device = 0;  // of the socket file we created (not activated)
  ino_t inode = 0;
  const int fd;  // owned by descriptor
  const std::shared_ptr<detail::ConnectionLimit> limit =
      std::make_shared<detail::ConnectionLimit>(detail::ConnectionLimits{});
  std::atomic<std::size_t> outstandingRequests{Limits{}.outstandingRequests};
  std::atomic<std::size_t> descriptorsPerRequest{Limits{}.descriptorsPerRequest};

  // Set before resume(), then read on `queue`.
  NewConnectionHandler onConnection;
  ErrorHandler onError;

  std::atomic<bool> resumed{false};
  std::atomic<bool> cancelled{false};

  // I/O thread.
  asio::posix::stream_descriptor descriptor;
  asio::steady_timer backoff;
  bool closed = false;

  void armAccept() {
    if (closed) return;
    descriptor.async_wait(asio::posix::descriptor_base::wait_read,
                          [core = shared_from_this()](const asio::error_code& error) {
                            if (error || core->closed) return;
                            core->acceptPending();
                          });
  }

  void acceptPending() {
    for (int i = 0; i < kAcceptsPerTurn; ++i) {
      const int accepted = ::accept4(fd, nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
      if (accepted >= 0) {
        UniqueFd socket(accepted);
        std::shared_ptr<void> lease = leaseFor(socket.get());
        if (!lease) continue;  // closed here, before it costs anything more
        // Identification reads /proc: it runs on the listener's queue, not here.
        auto admitted = std::make_shared<std::pair<UniqueFd, std::shared_ptr<void>>>(std::move(socket),
                                                                                     std::move(lease));
        queue->async([core = shared_from_this(), admitted] {
          core->admit(std::move(admitted->first), std::move(admitted->second));
        });
        continue;
      }
      if (errno == EINTR || errno == ECONNABORTED) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) break;
      reportError(makeSystemError(fmt::format("accept on {}", path), errno));
      backoff.expires_after(kAcceptBackoff);
      backoff.async_wait([core = shared_from_this()](const asio::error_code& error) {
        if (!error) core->armAccept();
      });
      return;
    }
    armAccept();
  }

  // I/O thread. The connection's place under the limits, or null when it is
  // refused (or its peer has no credentials).
  std::shared_ptr<void> leaseFor(int socket) {
    ucred credentials{};
    socklen_t size = sizeof credentials;
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &credentials, &size) != 0) return nullptr;
    detail::ConnectionLimit::Refusal refusal = detail::ConnectionLimit::Refusal::None;
    std::shared_ptr<void> lease = limit->acquire(credentials.uid, &refusal);
    if (!lease && limit->refusalWorthLogging(credentials.uid, std::chrono::steady_clock::now())) {
      const detail::ConnectionLimits limits = limit->limits();
      TN_LOG_ERROR(tn::log::traffic(),
                   "relay service {}: connection from pid {} refused: {} (further refusals for uid {} are "
                   "not logged for a minute)",
                   serviceName, credentials.pid,
                   refusal == detail::ConnectionLimit::Refusal::PerUser
                       ? fmt::format("uid {} already holds {} connections", credentials.uid, limits.perUser)
                       : fmt::format("the service holds its limit of {} connections", limits.total),
                   credentials.uid);
    }
    return lease;
  }

  // Listener queue.
  void admit(UniqueFd socket, std::shared_ptr<void> lease) {
    if (cancelled) return;
    tn::Result<PeerIdentity> identity = PeerIdentity::ofSocketPeer(socket.get());
    if (!identity.ok()) {
      TN_LOG_INFO(tn::log::traffic(), "relay service {}: connection dropped: {}", serviceName,
                  identity.error().description());
      return;
    }
    std::shared_ptr<Connection> connection = makeConnection(std::move(socket), std::move(*identity), serviceName,
                                                            std::move(lease), outstandingRequests.load(),
                                                            descriptorsPerRequest.load());
    TN_LOG_DEBUG(tn::log::traffic(), "{} accepted", connection->description());
    if (onConnection) onConnection(std::move(connection));
  }

  void reportError(tn::Error error) {
    TN_LOG_ERROR(tn::log::traffic(), "relay service {}: {}", serviceName, error.description());
    queue->async([core = shared_from_this(), error = std::move(error)] {
      if (core->onError) core->onError(error);
    });
  }

  void closeOnIoThread() {
    closed = true;
    backoff.cancel();
    asio::error_code ignored;
    descriptor.close(ignored);
  }

  // Removes the socket file if it is still the one this listener bound.
  void unlinkSocketFile() const {
    if (activated) return;
    struct stat status {};
    if (::stat(path.c_str(), &status) == 0 && status.st_dev == device && status.st_ino == inode) {
      ::unlink(path.c_str());
    }
  }
};

tn::Result<std::shared_ptr<Listener>> Listener::create(std::string serviceName,
                                                       std::shared_ptr<tn::dispatch::SerialQueue> queue) {
  tn::Result<std::string> path = servicePath(serviceName);
  if (!path.ok()) return path.error();
  UniqueFd activatedSocket = takeActivatedSocket(serviceName);
  if (activatedSocket.valid()) {
    ::fcntl(activatedSocket.get(), F_SETFL, ::fcntl(activatedSocket.get(), F_GETFL) | O_NONBLOCK);
    auto core = std::make_shared<Core>(std::move(serviceName), std::move(*path), std::move(queue),
                                       std::move(activatedSocket), true);
    return std::shared_ptr<Listener>(new Listener(std::move(core)));
  }
  tn::Result<BoundSocket> bound = bindServiceSocket(*path);
  if (!bound.ok()) return bound.error();
  auto core = std::make_shared<Core>(std::move(serviceName), std::move(*path), std::move(queue),
                                     std::move(bound.value().socket), false);
  core->device = bound->device;
  core->inode = bound->inode;
  return std::shared_ptr<Listener>(new Listener(std::move(core)));
}

Listener::Listener(std::shared_ptr<Core> core) : core_(std::move(core)) {}

Listener::~Listener() { cancel(); }

std::shared_ptr<Connection> Listener::makeConnection(UniqueFd socket, PeerIdentity identity,
                                                     std::string serviceName, std::shared_ptr<void> lease,
                                                     std::size_t outstandingRequests,
                                                     std::size_t descriptorsPerRequest) {
  std::shared_ptr<Connection> connection = Connection::accepted(std::move(socket), std::move(identity),
                                                                std::move(serviceName), std::move(lease),
                                                                outstandingRequests, descriptorsPerRequest);
  if (detail::registerForTermination(connection)) connection->deliverTerminationImminent();
  return connection;
}

void Listener::setNewConnectionHandler(NewConnectionHandler handler) { core_->onConnection = std::move(handler); }

void Listener::setErrorHandler(ErrorHandler handler) { core_->onError = std::move(handler); }

void Listener::setMaxConnectionsPerUser(std::size_t limit) {
  Limits limits = this->limits();
  limits.connectionsPerUser = limit;
  setLimits(limits);
}

void Listener::setLimits(const Limits& limits) {
  core_->limit->setLimits({limits.connectionsPerUser, limits.connectionsTotal, limits.privilegedReserve});
  core_->outstandingRequests = std::max<std::size_t>(1, limits.outstandingRequests);
  core_->descriptorsPerRequest = std::min(limits.descriptorsPerRequest, kMaxDescriptorsPerFrame);
}

Listener::Limits Listener::limits() const {
  const detail::ConnectionLimits connections = core_->limit->limits();
  return Limits{connections.perUser, connections.total, connections.privilegedReserve,
                core_->outstandingRequests.load(), core_->descriptorsPerRequest.load()};
}

void Listener::resume() {
  if (core_->resumed.exchange(true) || core_->cancelled) return;
  if (!core_->activated && ::listen(core_->fd, SOMAXCONN) != 0) {
    core_->reportError(makeSystemError(fmt::format("listen on {}", core_->path), errno));
    return;
  }
  asio::post(detail::ioContext(), [core = core_] { core->armAccept(); });
}

void Listener::cancel() {
  if (core_->cancelled.exchange(true)) return;
  // The file goes now, so that a new listener may bind the name at once;
  // the descriptor is closed by the I/O thread, which may be waiting on it.
  core_->unlinkSocketFile();
  asio::post(detail::ioContext(), [core = core_] { core->closeOnIoThread(); });
}

const std::string& Listener::serviceName() const { return core_->serviceName; }

const std::string& Listener::socketPath() const { return core_->path; }

bool Listener::isSocketActivated() const { return core_->activated; }

std::size_t Listener::connectionCount() const { return core_->limit->total(); }

}  // namespace relay
