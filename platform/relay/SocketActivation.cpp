#include "platform/relay/SocketActivation.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <systemd/sd-daemon.h>

#include <cstdlib>
#include <mutex>
#include <set>
#include <string>
#include <vector>

namespace relay {
namespace {

constexpr std::string_view kUnnamed = "unknown";

struct PassedSocket {
  int fd;
  std::string name;
};

// The passed fds that are listening AF_UNIX stream sockets, with names.
std::vector<PassedSocket> passedListeningSockets() {
  char** names = nullptr;
  const int count = sd_listen_fds_with_names(0, &names);
  std::vector<PassedSocket> sockets;
  for (int i = 0; i < count; ++i) {
    const int fd = SD_LISTEN_FDS_START + i;
    std::string name = names != nullptr && names[i] != nullptr ? names[i] : std::string(kUnnamed);
    if (sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) > 0) sockets.push_back({fd, std::move(name)});
  }
  if (names != nullptr) {
    for (int i = 0; i < count; ++i) std::free(names[i]);
    std::free(names);
  }
  return sockets;
}

}  // namespace

UniqueFd takeActivatedSocket(std::string_view serviceName) {
  static std::mutex mutex;
  static std::set<int> taken;  // guarded by mutex
  const std::lock_guard lock(mutex);
  const std::vector<PassedSocket> sockets = passedListeningSockets();
  auto chosen = sockets.end();
  for (auto it = sockets.begin(); it != sockets.end() && chosen == sockets.end(); ++it) {
    if (!taken.contains(it->fd) && it->name == serviceName) chosen = it;
  }
  for (auto it = sockets.begin(); it != sockets.end() && chosen == sockets.end(); ++it) {
    if (!taken.contains(it->fd) && it->name == kUnnamed) chosen = it;
  }
  if (chosen == sockets.end()) return UniqueFd();
  taken.insert(chosen->fd);
  // Passed descriptors are inherited without close-on-exec; keep them from
  // leaking into processes the daemon starts.
  ::fcntl(chosen->fd, F_SETFD, FD_CLOEXEC);
  return UniqueFd(chosen->fd);
}

void notifyReady() { sd_notify(0, "READY=1"); }

}  // namespace relay
