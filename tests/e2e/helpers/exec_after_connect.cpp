// A client of the daemon for the trust tests, small enough to install as a
// trusted (entitled) program in a test's private root.
//
//   exec_after_connect --service NAME REQUEST...
//       connects to the service itself and sends each REQUEST (a JSON
//       dictionary) in turn on that connection;
//   exec_after_connect --as-entitled --fd N REQUEST...
//       sends them on the connected socket N it inherited from the process
//       that exec'ed it: the connection was made before the exec;
//   exec_after_connect --service NAME --wait
//       connects and stays connected until its standard input closes;
//   exec_after_connect --service NAME --exec PROGRAM ARGUMENT...
//       connects, moves the socket to descriptor 100 (kept across exec),
//       waits for one byte on its standard input, then execs PROGRAM with
//       the ARGUMENTs (e.g. "--as-entitled --fd 100 REQUEST...").
//
// For each request it prints one line, the reply's "errorcode" (0 when the
// reply has none), and exits 0; 2 for bad arguments, 3 when the connection
// fails. It speaks the relay's frames directly (platform/relay/Frame.h), so
// that it can use a socket it did not open.

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

#include "platform/relay/Frame.h"
#include "platform/relay/ServicePath.h"
#include "platform/value/Cbor.h"
#include "platform/value/Document.h"

namespace {

bool writeAll(int fd, const uint8_t* data, std::size_t size) {
  while (size > 0) {
    const ssize_t n = ::write(fd, data, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    data += n;
    size -= static_cast<std::size_t>(n);
  }
  return true;
}

bool readAll(int fd, uint8_t* data, std::size_t size) {
  while (size > 0) {
    const ssize_t n = ::read(fd, data, size);
    if (n < 0 && errno == EINTR) continue;
    if (n <= 0) return false;
    data += n;
    size -= static_cast<std::size_t>(n);
  }
  return true;
}

int connectTo(const std::string& service) {
  const tn::Result<std::string> path = relay::servicePath(service);
  if (!path) return -1;
  const int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path->data(), path->size());
  if (::connect(fd, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0) return -1;
  return fd;
}

// Sends request (JSON text) as frame `id` and prints the reply's error code.
bool exchange(int fd, const std::string& request, uint64_t id) {
  const tn::Result<tn::Value> body = tn::readDocument(request, "request", tn::DocumentEncoding::Json);
  if (!body) return false;
  const tn::Result<tn::Bytes> frame = relay::encodeFrame(*body, 0, id);
  if (!frame || !writeAll(fd, frame->data(), frame->size())) return false;
  uint8_t header[relay::kFrameHeaderSize];
  if (!readAll(fd, header, sizeof header)) return false;
  const uint32_t length = relay::loadBigEndian32(header);
  if (length < relay::kFrameIdsSize || length > relay::kMaxFrameLength) return false;
  std::vector<uint8_t> reply(length - relay::kFrameIdsSize);
  if (!readAll(fd, reply.data(), reply.size())) return false;
  const tn::Result<tn::Value> decoded = tn::decodeMessageBody(reply);
  if (!decoded) return false;
  std::printf("%llu\n", static_cast<unsigned long long>((*decoded)["errorcode"].uint64().value_or(0)));
  std::fflush(stdout);
  return true;
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<std::string> arguments(argv + 1, argv + argc);
  int fd = -1;
  std::size_t first = 2;
  if (arguments.size() >= 3 && arguments[0] == "--as-entitled" && arguments[1] == "--fd") {
    fd = std::atoi(arguments[2].c_str());
    first = 3;
  } else if (arguments.size() >= 2 && arguments[0] == "--service") {
    fd = connectTo(arguments[1]);
    if (fd < 0) return 3;
  } else {
    std::fprintf(stderr, "usage: exec_after_connect (--service NAME | --as-entitled --fd N) (REQUEST... | --wait)\n");
    return 2;
  }
  if (arguments.size() > first + 1 && arguments[first] == "--exec") {
    constexpr int kKeptFd = 100;
    char byte;
    if (::dup2(fd, kKeptFd) != kKeptFd || ::read(STDIN_FILENO, &byte, 1) != 1) return 3;
    std::vector<char*> argp;
    for (std::size_t i = first + 1; i < arguments.size(); ++i) argp.push_back(arguments[i].data());
    argp.push_back(nullptr);
    ::execv(argp[0], argp.data());
    return 3;
  }
  if (arguments.size() > first && arguments[first] == "--wait") {
    char byte;
    while (::read(STDIN_FILENO, &byte, 1) > 0) {
    }
    return 0;
  }
  uint64_t id = 1;
  for (std::size_t i = first; i < arguments.size(); ++i) {
    if (!exchange(fd, arguments[i], id++)) return 3;
  }
  return 0;
}
