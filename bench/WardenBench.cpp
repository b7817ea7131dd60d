// The supervisor: from a host's "start" request to the first answer of the
// plug-in's process. The host (this process) asks the supervisor's relay
// service for the example plug-in (upcase), receives its socket end in the
// reply, writes one line and reads the answer; the plug-in declares itself
// busy and idle at the busy-assertion service meanwhile, as it does for
// every request. Everything runs in a private root; the supervisor and the
// busy-assertion service run in this process, as they do in tenond.

#include <benchmark/benchmark.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <future>
#include <memory>
#include <string>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/AuditToken.h"
#include "platform/relay/Connection.h"
#include "platform/vigil/Vigil.h"
#include "platform/warden/SandboxProfile.h"
#include "platform/warden/Warden.h"
#include "platform/warden/WardenService.h"

namespace {

namespace fs = std::filesystem;

struct Platform {
  Platform() {
    std::string pattern = (fs::temp_directory_path() / "tenon-bench-XXXXXX").string();
    root = ::mkdtemp(pattern.data());
    ::setenv("TENON_ROOT", root.c_str(), 1);
    fs::create_directories(warden::SandboxProfile::directory());
    for (const auto& profile : fs::directory_iterator(TENON_SOURCE_DIR "/packaging/sandbox-profiles")) {
      fs::copy_file(profile.path(), warden::SandboxProfile::directory() + "/" + profile.path().filename().string());
    }
    const fs::path bundle = fs::path(root) / "Upcase.bundle";
    fs::create_directories(bundle / "bin");
    fs::copy_file(TENON_SOURCE_DIR "/examples/plugins/Upcase.bundle/Info.manifest", bundle / "Info.manifest");
    fs::copy_file(TENON_BINARY_DIR "/examples/plugins/upcase/upcase", bundle / "bin/upcase");
    warden::Warden::Limits limits;
    limits.instancesPerHost = 10000;
    limits.instancesTotal = 10000;
    supervisor = warden::Warden::create(limits);
    auto created = warden::WardenService::create(supervisor, {});
    service = std::move(created.value());
    busy = *vigil::Vigil::create(supervisor, {});
    int ends[2];
    ::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends);
    const relay::AuditToken self = *relay::AuditToken::ofSocketPeer(ends[0]);
    ::close(ends[0]);
    ::close(ends[1]);
    const tn::Value overlay = tn::Dictionary{{"RelayService", tn::Dictionary{}}, {"BNBundlePackageType", "RLY!"}};
    supervisor->addExternalService(self, (bundle / "bin/upcase").string(), overlay);
    connection = *relay::Connection::connectToService(warden::kWardenServiceName, queue);
    connection->setEventHandler([](const relay::Event&) {});
    connection->resume();
  }
  ~Platform() {
    connection->cancel();
    fs::remove_all(root);
  }

  std::string root;
  std::shared_ptr<warden::Warden> supervisor;
  std::unique_ptr<warden::WardenService> service;
  std::shared_ptr<vigil::Vigil> busy;
  std::shared_ptr<tn::dispatch::SerialQueue> queue = tn::dispatch::SerialQueue::create("bench.host");
  std::shared_ptr<relay::Connection> connection;
};

// Starts the plug-in and returns its socket end (invalid on failure).
relay::UniqueFd start(Platform& platform) {
  std::promise<relay::Descriptors> received;
  platform.connection->sendWithReply(tn::Dictionary{{"request", "start"}, {"plug-in", "com.example.upcase"}},
                                     relay::Descriptors(), platform.queue,
                                     [&](relay::Reply, relay::Descriptors descriptors) {
                                       received.set_value(std::move(descriptors));
                                     });
  relay::Descriptors descriptors = received.get_future().get();
  return descriptors.size() == 1 ? std::move(descriptors[0]) : relay::UniqueFd();
}

void BM_StartToFirstAnswer(benchmark::State& state) {
  static Platform platform;
  for (auto _ : state) {
    const relay::UniqueFd socket = start(platform);
    if (!socket.valid()) {
      state.SkipWithError("the start was refused");
      return;
    }
    char answer[2];
    if (::write(socket.get(), "x\n", 2) != 2 || ::read(socket.get(), answer, sizeof answer) != 2) {
      state.SkipWithError("no answer");
      return;
    }
  }  // closing the socket ends the plug-in
}
BENCHMARK(BM_StartToFirstAnswer)->Unit(benchmark::kMillisecond)->MinTime(2.0);

}  // namespace
