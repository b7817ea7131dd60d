// One client's requests while another floods the daemon.
//
// A client sends "find" requests one after the other to a real tenond and
// times each round trip, in three phases of one run:
//   quiet    nobody else talks to the daemon;
//   flooded  a second client writes requests as fast as the daemon takes
//            them and never reads a reply (a hostile peer);
//   busy     a second client keeps 64 requests in flight and reads its
//            replies as fast as it can (a heavy but honest peer).
// The daemon serves clients in turn and stops reading a client that has 64
// requests whose replies have not left, so the flood costs the daemon one
// burst and then nothing; the busy client gets half the service queue and,
// on a small machine, competes for the processor with everybody else.
// Printed: median and 99th percentile of each phase, and the ratios of the
// 99th percentiles to the quiet one (target for the flood: at most 2).
//
//   build/default/bench/flood_bench [requests]      (default 20000)

#include <sys/resource.h>
#include <sys/socket.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <string>
#include <thread>
#include <vector>

#include "bench/support/BenchDaemon.h"

namespace {

using Clock = std::chrono::steady_clock;

struct Latencies {
  double median = 0;
  double p99 = 0;
};

Latencies measure(const std::string& service, int requests) {
  tn::bench::FrameSocket client(service);
  if (!client.connected()) std::abort();
  tn::Bytes frame = tn::bench::findFrame();
  tn::Bytes reply;
  std::vector<double> micros;
  micros.reserve(static_cast<std::size_t>(requests));
  for (int i = 0; i < requests; ++i) {
    const Clock::time_point start = Clock::now();
    if (!client.send(frame) || !client.receive(reply, tn::bench::FrameSocket::kNoLimit)) std::abort();
    micros.push_back(std::chrono::duration<double, std::micro>(Clock::now() - start).count());
  }
  std::sort(micros.begin(), micros.end());
  return {micros[micros.size() / 2], micros[micros.size() * 99 / 100]};
}

// A second client for the length of one measurement.
class Peer {
 public:
  Peer(const std::string& service, bool readsReplies) : socket_(service) {
    writer_ = std::thread([this] {
      tn::Bytes frame = tn::bench::findFrame();
      while (!stop_ && socket_.send(frame)) ++sent_;
    });
    if (readsReplies) {
      reader_ = std::thread([this] {
        tn::Bytes reply;
        while (!stop_ && socket_.receive(reply, tn::bench::FrameSocket::kNoLimit)) {
        }
      });
    }
  }
  ~Peer() {
    stop_ = true;
    socket_.shutdown();  // a writer the daemon no longer reads returns too
    writer_.join();
    if (reader_.joinable()) reader_.join();
  }
  long sent() const { return sent_; }

 private:
  tn::bench::FrameSocket socket_;
  std::atomic<bool> stop_{false};
  std::atomic<long> sent_{0};
  std::thread writer_, reader_;
};

void print(const char* phase, const Latencies& latencies, const Latencies& quiet, long peerRequests) {
  std::printf("%-8s median %7.1f us   p99 %7.1f us", phase, latencies.median, latencies.p99);
  if (peerRequests >= 0) {
    std::printf("   p99 / quiet p99 = %5.2f   (the other client sent %ld requests)", latencies.p99 / quiet.p99,
                peerRequests);
  }
  std::printf("\n");
}

}  // namespace

int main(int argc, char** argv) {
  const int requests = argc > 1 ? std::atoi(argv[1]) : 20000;
  tn::bench::TenondForBench daemon("bench.flood");
  measure(daemon.service(), 1000);  // warm up
  const Latencies quiet = measure(daemon.service(), requests);
  print("quiet", quiet, quiet, -1);
  {
    Peer flooder(daemon.service(), false);
    std::this_thread::sleep_for(std::chrono::milliseconds(200));  // the flood's first burst
    const Latencies flooded = measure(daemon.service(), requests);
    print("flooded", flooded, quiet, flooder.sent());
    std::printf("flooded p99 / quiet p99 = %.2f  (target at most 2.00)\n", flooded.p99 / quiet.p99);
  }
  {
    Peer busy(daemon.service(), true);
    const Latencies loaded = measure(daemon.service(), requests);
    print("busy", loaded, quiet, busy.sent());
  }
  return 0;
}
