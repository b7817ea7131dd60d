// What the relay costs on top of the socket it runs on.
//
// BM_RawSocketEcho writes one frame (a minimal "find" request) over a
// socketpair to a thread that echoes it back: the floor any transport on
// Unix sockets pays (two thread wake-ups per round trip).
// BM_FramedClientToTenond sends the same frame to a real tenond started for
// the run, with a client that only frames bytes, as the echo's client does:
// the daemon's own cost (reading, envelope checks, the service queue, the
// reply). BM_DaemonClientToTenond makes the same request through
// TNDaemonClient, the library hosts use (its logging checks, its reply
// queue, the waiting thread). BM_RelayRoundTrip and
// BM_DaemonClientRoundTrip measure the relay and the client library against
// a listener in this process that replies at once; BM_RelayThroughput keeps
// `depth` requests in flight on each of 32 connections.
//
// The ratios to the echo of the same run are printed after the table, with
// their targets.
//
// Sockets live under a private TENON_ROOT made for the run.

#include <benchmark/benchmark.h>

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/socket.h>
#include <sys/un.h>
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

#include "bench/support/BenchDaemon.h"
#include "bench/support/RatioReporter.h"
#include "libtenon/client/BlockingReply.h"
#include "libtenon/client/TNDaemonClient.h"
#include "platform/dispatch/Semaphore.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/log/Output.h"
#include "platform/log/Sink.h"
#include "platform/relay/Connection.h"
#include "platform/relay/Frame.h"
#include "platform/relay/Listener.h"
#include "platform/relay/ServicePath.h"

extern char** environ;

namespace relay {
namespace {

using tn::bench::usePrivateRoot;

using tn::dispatch::Semaphore;
using tn::dispatch::SerialQueue;

// A minimal real request: "find" of a plug-in nobody has.
tn::Value smallRequest() {
  static const tn::UUID uuid = tn::UUID::random();
  return tn::Value(tn::Dictionary{{"request", "find"}, {"version", 3}, {"uuids", tn::Value(uuid)}});
}

bool readAll(int fd, uint8_t* out, std::size_t size) {
  for (std::size_t got = 0; got < size;) {
    const ssize_t n = ::read(fd, out + got, size - got);
    if (n <= 0) return false;
    got += static_cast<std::size_t>(n);
  }
  return true;
}

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

// One daemon for every benchmark that needs one.
const std::string& benchTenond() {
  static tn::bench::TenondForBench daemon("bench.tenond");
  return daemon.service();
}

void BM_DaemonClientToTenond(benchmark::State& state) {
  roundTripsThroughClient(state, benchTenond());
}
BENCHMARK(BM_DaemonClientToTenond)->UseRealTime();

// The echo's client, talking to tenond: write a frame, read the reply.
void BM_FramedClientToTenond(benchmark::State& state) {
  tn::bench::FrameSocket socket(benchTenond());
  if (!socket.connected()) std::abort();
  tn::Bytes frame = tn::bench::findFrame();
  tn::Bytes reply;
  for (auto _ : state) {
    if (!socket.send(frame) || !socket.receive(reply, tn::bench::FrameSocket::kNoLimit)) std::abort();
  }
  state.counters["reply_bytes"] = static_cast<double>(reply.size());
}
BENCHMARK(BM_FramedClientToTenond)->UseRealTime();

}  // namespace
}  // namespace relay

int main(int argc, char** argv) {
  return tn::bench::runWithRatios(argc, argv,
                                  {{"BM_FramedClientToTenond", "BM_RawSocketEcho", 1.3},
                                   {"BM_DaemonClientToTenond", "BM_RawSocketEcho", 1.6},
                                   {"BM_RelayRoundTrip", "BM_RawSocketEcho", std::nullopt}});
}
