#pragma once

// What the benchmarks that talk to a real tenond share: a private
// TENON_ROOT for the whole program (removed at exit), the daemon binary of
// this build started on it with its log silenced (stopped with SIGTERM at
// exit), and the raw-frame client of the tests (a plain socket, as a client
// in any language would have).

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <string>
#include <thread>

#include "platform/relay/Frame.h"
#include "platform/relay/ServicePath.h"
#include "platform/value/Cbor.h"
#include "platform/value/UUID.h"
#include "platform/value/Value.h"
#include "tests/support/FrameSocket.h"

extern char** environ;

namespace tn::bench {

// Sets TENON_ROOT to a new directory for the rest of the program.
inline void usePrivateRoot() {
  struct PrivateRoot {
    PrivateRoot() {
      char pattern[] = "/tmp/tenon-bench-XXXXXX";
      if (::mkdtemp(pattern) == nullptr) std::abort();
      path = pattern;
      ::setenv("TENON_ROOT", path.c_str(), 1);
    }
    ~PrivateRoot() {
      std::error_code ignored;
      std::filesystem::remove_all(path, ignored);
    }
    std::string path;
  };
  static const PrivateRoot root;
}

// A raw-frame client of `service` (tests/support/FrameSocket.h).
class FrameSocket : public test::FrameSocket {
 public:
  explicit FrameSocket(const std::string& service) : test::FrameSocket(*relay::servicePath(service)) {}
};

// The frame of a minimal real request: "find" of a plug-in nobody has.
inline Bytes findFrame() {
  const Value request(Dictionary{{"request", "find"}, {"version", 3}, {"uuids", Value(UUID::random())}});
  return *relay::encodeFrame(request, 0, 1);
}

// tenond of this build, serving `service` on the private root.
class TenondForBench {
 public:
  explicit TenondForBench(std::string service) : service_(std::move(service)) {
    usePrivateRoot();
    std::string binary = std::string(TENON_BINARY_DIR "/tenond/tenond");
    std::string option = "-S";
    char* argv[] = {binary.data(), option.data(), service_.data(), nullptr};
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
    if (posix_spawn(&pid_, binary.c_str(), &actions, nullptr, argv, environ) != 0) std::abort();
    posix_spawn_file_actions_destroy(&actions);
    for (int attempt = 0; !FrameSocket(service_).connected(); ++attempt) {
      if (attempt == 500) std::abort();
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
  }
  ~TenondForBench() {
    ::kill(pid_, SIGTERM);
    ::waitpid(pid_, nullptr, 0);
  }
  TenondForBench(const TenondForBench&) = delete;
  TenondForBench& operator=(const TenondForBench&) = delete;

  const std::string& service() const { return service_; }
  pid_t pid() const { return pid_; }

 private:
  std::string service_;
  pid_t pid_ = -1;
};

}  // namespace tn::bench
