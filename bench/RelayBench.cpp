// What the relay costs on top of the socket it runs on.
//
// BM_RawSocketEcho writes one frame over a socketpair to a thread that
// echoes it back: the floor any transport on Unix sockets pays (two thread
// wake-ups per round trip). BM_RelayRoundTrip sends the same request with
// Connection::sendWithReply to a listener in this process that replies at
// once; the ratio of the two is the relay's overhead. BM_RelayThroughput
// keeps `depth` requests in flight on each of 32 connections.
//
// BM_DaemonClientRoundTrip is the same round trip made through
// TNDaemonClient, the library hosts use (a "find" request, its logging
// checks, the client's reply queue), against the same replying listener;
// BM_DaemonClientToTenond makes it against a real tenond started for the
// run (the daemon's envelope checks and dispatch included). Both belong
// next to BM_RawSocketEcho of the same run: the target is a round trip
// within 1.5 times the echo.
//
// Sockets live under a private TENON_ROOT made for the run.

#include <benchmark/benchmark.h>

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <memory>
#include <string>
#include <thread>
#include <vector>

#include "libtenon/client/BlockingReply.h"
#include "libtenon/client/TNDaemonClient.h"
#include "platform/dispatch/Semaphore.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/log/Output.h"
#include "platform/log/Sink.h"
#include "platform/relay/Connection.h"
#include "platform/relay/Frame.h"
#include "platform/relay/Listener.h"

extern char** environ;

namespace relay {
namespace {

using tn::dispatch::Semaphore;
using tn::dispatch::SerialQueue;

tn::Value smallRequest() {
  return tn::Value(tn::Dictionary{{"request", "ping"}, {"version", 1}, {"flags", 0}});
}

// A private TENON_ROOT for the whole program, removed at exit.
class PrivateRoot {
 public:
  PrivateRoot() {
    char pattern[] = "/tmp/relay-bench-XXXXXX";
    if (::mkdtemp(pattern) == nullptr) std::abort();
    path_ = pattern;
    ::setenv("TENON_ROOT", path_.c_str(), 1);
  }
  ~PrivateRoot() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }

 private:
  std::string path_;
};

void usePrivateRoot() { static const PrivateRoot root; }

// A listener whose connections answer every request at once.
class ReplyingServer {
 public:
  explicit ReplyingServer(const std::string& service) {
    usePrivateRoot();
    auto listener = Listener::create(service, SerialQueue::create("bench.listener"));
    if (!listener.ok()) std::abort();
    listener_ = *listener;
    listener_->setNewConnectionHandler([](std::shared_ptr<Connection> connection) {
      const std::weak_ptr<Connection> weak = connection;
      connection->setEventHandler([weak](const Event& event) {
        if (event.kind != Event::Kind::Message) return;
        if (const auto self = weak.lock()) self->sendReply(event.message, tn::Value(tn::Dictionary{{"ok", true}}));
      });
      connection->resume();
    });
    listener_->resume();
  }

 private:
  std::shared_ptr<Listener> listener_;
};

std::shared_ptr<Connection> connectClient(const std::string& service) {
  auto connection = Connection::connectToService(service, SerialQueue::create("bench.client"));
  if (!connection.ok()) std::abort();
  (*connection)->setEventHandler([](const Event&) {});
  (*connection)->resume();
  return *connection;
}

void BM_RawSocketEcho(benchmark::State& state) {
  const tn::Bytes frame = *encodeFrame(smallRequest(), 0, 1);
  int pair[2];
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair) != 0) std::abort();
  const auto readAll = [](int fd, uint8_t* out, std::size_t size) {
    for (std::size_t got = 0; got < size;) {
      const ssize_t n = ::read(fd, out + got, size - got);
      if (n <= 0) return false;
      got += static_cast<std::size_t>(n);
    }
    return true;
  };
  std::thread echo([&] {
    tn::Bytes buffer(frame.size());
    while (readAll(pair[1], buffer.data(), buffer.size())) {
      if (::write(pair[1], buffer.data(), buffer.size()) != static_cast<ssize_t>(buffer.size())) return;
    }
  });
  tn::Bytes reply(frame.size());
  for (auto _ : state) {
    if (::write(pair[0], frame.data(), frame.size()) != static_cast<ssize_t>(frame.size())) std::abort();
    if (!readAll(pair[0], reply.data(), reply.size())) std::abort();
  }
  ::shutdown(pair[0], SHUT_RDWR);
  echo.join();
  ::close(pair[0]);
  ::close(pair[1]);
  state.counters["frame_bytes"] = static_cast<double>(frame.size());
}
BENCHMARK(BM_RawSocketEcho)->UseRealTime();

void BM_RelayRoundTrip(benchmark::State& state) {
  static ReplyingServer server("bench.roundtrip");
  const auto client = connectClient("bench.roundtrip");
  const auto replyQueue = SerialQueue::create("bench.reply");
  Semaphore replied;
  const tn::Value request = smallRequest();
  for (auto _ : state) {
    client->sendWithReply(request, replyQueue, [&](Reply reply) {
      if (!reply.ok()) std::abort();
      replied.signal();
    });
    replied.wait();
  }
  client->cancel();
}
BENCHMARK(BM_RelayRoundTrip)->UseRealTime();

void BM_RelayThroughput(benchmark::State& state) {
  constexpr int kConnections = 32;
  static ReplyingServer server("bench.throughput");
  const int depth = static_cast<int>(state.range(0));
  std::vector<std::shared_ptr<Connection>> clients;
  for (int i = 0; i < kConnections; ++i) clients.push_back(connectClient("bench.throughput"));
  const auto replyQueue = SerialQueue::create("bench.replies");
  const tn::Value request = smallRequest();
  Semaphore allReplied;
  std::atomic<int> outstanding{0};
  for (auto _ : state) {
    outstanding = kConnections * depth;
    for (int d = 0; d < depth; ++d) {
      for (const auto& client : clients) {
        client->sendWithReply(request, replyQueue, [&](Reply reply) {
          if (!reply.ok()) std::abort();
          if (outstanding.fetch_sub(1) == 1) allReplied.signal();
        });
      }
    }
    allReplied.wait();
  }
  for (const auto& client : clients) client->cancel();
  state.SetItemsProcessed(state.iterations() * kConnections * depth);
}
BENCHMARK(BM_RelayThroughput)->Arg(1)->Arg(16)->UseRealTime();

// Drops every record. The lookups log a line each at default level: its
// formatting stays in the measurement, the terminal it would scroll does not.
class DiscardingSink : public tn::log::Sink {
 public:
  void write(const tn::log::Record&) override {}
};

// One "find" through the client library, waiting for each reply.
void roundTripsThroughClient(benchmark::State& state, const std::string& service) {
  static const auto previous = tn::log::setSink(std::make_shared<DiscardingSink>());
  tn::TNDaemonClient client(service);
  const tn::UUID uuid = tn::UUID::random();
  for (auto _ : state) {
    tn::BlockingReply pending;
    client.findPlugInByUUID(uuid, pending.block());
    if (!pending.wait(std::chrono::seconds(10)).ok()) std::abort();
  }
}

void BM_DaemonClientRoundTrip(benchmark::State& state) {
  static ReplyingServer server("bench.client");
  roundTripsThroughClient(state, "bench.client");
}
BENCHMARK(BM_DaemonClientRoundTrip)->UseRealTime();

// The daemon binary beside this build, started under the private root with
// its log silenced; stopped with SIGTERM at exit.
class TenondForBench {
 public:
  explicit TenondForBench(const std::string& service) {
    usePrivateRoot();
    std::string binary = std::string(TENON_BINARY_DIR) + "/tenond/tenond";
    std::string option = "-S";
    std::string name = service;
    char* argv[] = {binary.data(), option.data(), name.data(), nullptr};
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_addopen(&actions, STDERR_FILENO, "/dev/null", O_WRONLY, 0);
    if (posix_spawn(&pid_, binary.c_str(), &actions, nullptr, argv, environ) != 0) std::abort();
    posix_spawn_file_actions_destroy(&actions);
    for (int attempt = 0; !Connection::connectToService(service, SerialQueue::create("bench.probe")).ok(); ++attempt) {
      if (attempt == 500) std::abort();
      std::this_thread::sleep_for(std::chrono::milliseconds(10));
    }
  }
  ~TenondForBench() {
    ::kill(pid_, SIGTERM);
    ::waitpid(pid_, nullptr, 0);
  }

 private:
  pid_t pid_ = -1;
};

void BM_DaemonClientToTenond(benchmark::State& state) {
  static TenondForBench daemon("bench.tenond");
  roundTripsThroughClient(state, "bench.tenond");
}
BENCHMARK(BM_DaemonClientToTenond)->UseRealTime();

}  // namespace
}  // namespace relay
