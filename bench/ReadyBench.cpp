// "ready" of one plug-in against a real tenond, from the request's send to
// its reply, over a plain socket: the daemon looks the plug-in up, checks
// its hold and host authorization, builds its activation overlay and
// registers it with the process supervisor for this process (registering
// again replaces the earlier registration). The plug-in is the example
// upcase, in an application of the daemon's private root.

#include <benchmark/benchmark.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "bench/support/BenchDaemon.h"
#include "platform/registrar/Registrar.h"

namespace {

namespace fs = std::filesystem;

// The application, registered before the daemon starts; the plug-in's UUID.
tn::UUID makeApplication() {
  const std::string root = std::getenv("TENON_ROOT");
  const fs::path app = fs::path(root) / "opt/tenon/applications/TextTools";
  fs::create_directories(app / "Support/PlugIns/Upcase.tnx/bin");
  std::ofstream(app / "Info.manifest") << R"({"BNBundleIdentifier": "com.example.texttools"})";
  fs::copy_file(TENON_SOURCE_DIR "/examples/plugins/Upcase.bundle/Info.manifest",
                app / "Support/PlugIns/Upcase.tnx/Info.manifest");
  fs::copy_file(TENON_BINARY_DIR "/examples/plugins/upcase/upcase", app / "Support/PlugIns/Upcase.tnx/bin/upcase");
  fs::create_directories(fs::path(root) / "usr/share/tenon/sandbox-profiles");
  for (const auto& profile : fs::directory_iterator(TENON_SOURCE_DIR "/packaging/sandbox-profiles")) {
    fs::copy_file(profile.path(), fs::path(root) / "usr/share/tenon/sandbox-profiles" / profile.path().filename());
  }
  registrar::Registrar::Options options;
  options.watch = false;
  options.locale = "";
  auto opened = registrar::Registrar::open(registrar::RegistrarPaths::forRoot(root), options);
  if (!opened.ok() || (*opened)->installedPlugIns().size() != 1) std::abort();
  return (*opened)->installedPlugIns().front()->uuid();
}

void BM_ReadyOnePlugIn(benchmark::State& state) {
  tn::bench::usePrivateRoot();
  static const tn::UUID plugIn = makeApplication();
  static tn::bench::TenondForBench daemon("com.ostrel.tenon.bench.ready");
  tn::bench::FrameSocket socket(daemon.service());
  const tn::Value request(
      tn::Dictionary{{"request", "ready"}, {"version", 3}, {"uuids", tn::Array{tn::Value(plugIn)}}});
  for (auto _ : state) {
    const tn::Value reply = socket.request(request);
    if (!reply["errorcode"].isNull()) {
      state.SkipWithError(reply["error"].description().c_str());
      return;
    }
  }
}
BENCHMARK(BM_ReadyOnePlugIn)->Unit(benchmark::kMicrosecond);

}  // namespace
