// The registrar's targets: cold open of an existing 10,000-plug-in store
// ready to answer (<= 200 ms), rescan of unchanged roots (<= 1 s), lookup by
// UUID (<= 5 us), listing every plug-in (<= 50 ms); a warm open (store
// present, verification in the background) ready to answer, and until
// verified; an application renamed into a watched root until observers are
// told (the registrar's share of the 200 ms install target); the memory a
// loaded store holds. The fixture is made once per run on a private root by
// generate-registry-fixture.

#include <benchmark/benchmark.h>

#include <stdlib.h>

#include <malloc.h>

#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>

#include "platform/dispatch/Semaphore.h"
#include "platform/registrar/Registrar.h"
#include "platform/registrar/Store.h"

namespace {

// The fixture's directory, removed at exit. A static of its own, made
// before the fixture's paths: statics are destroyed in the reverse order of
// their making, so it goes last, after everything that could still use it.
struct FixtureDirectory {
  FixtureDirectory() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tenon-registrar-bench-XXXXXX").string();
    if (::mkdtemp(pattern.data()) == nullptr) std::abort();
    path = pattern;
  }
  ~FixtureDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path, ignored);
  }
  std::string path;
};

// A private root with the fixture and a store made by a first scan.
const registrar::RegistrarPaths& fixture() {
  static const FixtureDirectory directory;
  static const registrar::RegistrarPaths paths = [] {
    const std::string command = std::string(TENON_FIXTURE_GENERATOR) + " " + directory.path + " 1000 10";
    if (std::system(command.c_str()) != 0) std::abort();
    registrar::RegistrarPaths made = registrar::RegistrarPaths::forRoot(directory.path);
    registrar::Registrar::Options options;
    options.watch = false;
    options.locale = "";
    if (!registrar::Registrar::open(made, options).ok()) std::abort();
    return made;
  }();
  return paths;
}

std::shared_ptr<registrar::Registrar> openQuiet(registrar::Registrar::InitialScan scan) {
  registrar::Registrar::Options options;
  options.watch = false;
  options.initialScan = scan;
  options.locale = "";
  return *registrar::Registrar::open(fixture(), options);
}

void ColdOpen(benchmark::State& state) {
  fixture();
  for (auto _ : state) {
    auto registrar = openQuiet(registrar::Registrar::InitialScan::None);
    benchmark::DoNotOptimize(registrar->installedPlugIns().size());
  }
}
BENCHMARK(ColdOpen)->Unit(benchmark::kMillisecond);

void RescanUnchanged(benchmark::State& state) {
  auto registrar = openQuiet(registrar::Registrar::InitialScan::None);
  for (auto _ : state) {
    auto summary = registrar->scan();
    if (!summary.ok() || summary->changed || summary->plugIns != 10000) state.SkipWithError("unexpected scan");
  }
}
BENCHMARK(RescanUnchanged)->Unit(benchmark::kMillisecond);

void LookupByUUID(benchmark::State& state) {
  auto registrar = openQuiet(registrar::Registrar::InitialScan::None);
  const registrar::PlugInList all = registrar->installedPlugIns();
  size_t i = 0;
  for (auto _ : state) {
    benchmark::DoNotOptimize(registrar->plugInForUUID(all[i++ % all.size()]->uuid()));
  }
}
BENCHMARK(LookupByUUID);

void ListEveryPlugIn(benchmark::State& state) {
  auto registrar = openQuiet(registrar::Registrar::InitialScan::None);
  for (auto _ : state) benchmark::DoNotOptimize(registrar->installedPlugIns());
}
BENCHMARK(ListEveryPlugIn)->Unit(benchmark::kMillisecond);

// The daemon's open: the store is there, so open returns with its contents
// and verifies the roots on the registrar queue. "ready" is what a first
// request waits for; "verified" adds the background scan (watches included).
std::shared_ptr<registrar::Registrar> openAsTheDaemonDoes() {
  registrar::Registrar::Options options;
  options.initialScan = registrar::Registrar::InitialScan::Auto;
  options.locale = "";
  return *registrar::Registrar::open(fixture(), options);
}

void WarmOpenToReady(benchmark::State& state) {
  fixture();
  for (auto _ : state) {
    auto registrar = openAsTheDaemonDoes();
    benchmark::DoNotOptimize(registrar->installedPlugIns().size());
    state.PauseTiming();
    registrar->waitForObservers();  // not timed: let the verification end before the next round
    registrar.reset();
    state.ResumeTiming();
  }
}
BENCHMARK(WarmOpenToReady)->Unit(benchmark::kMillisecond);

void WarmOpenUntilVerified(benchmark::State& state) {
  fixture();
  for (auto _ : state) {
    auto registrar = openAsTheDaemonDoes();
    registrar->waitForObservers();
    if (registrar->lastScan().changed) state.SkipWithError("the verification changed something");
  }
}
BENCHMARK(WarmOpenUntilVerified)->Unit(benchmark::kMillisecond);

// Counts the batches observers are told of.
class CountingObserver : public registrar::RegistrarObserver {
 public:
  void pluginsDidInstall(const registrar::PlugInList&) override { installed.signal(); }
  void pluginsWillUninstall(const registrar::PlugInList&) override { uninstalled.signal(); }
  tn::dispatch::Semaphore installed;
  tn::dispatch::Semaphore uninstalled;
};

// An application of 10 plug-ins renamed into a watched root of 10,000,
// until the install batch reaches an observer: inotify, one application's
// rescan, the store's write and the new state.
void RenamedApplicationSeen(benchmark::State& state) {
  registrar::Registrar::Options options;
  options.locale = "";
  options.initialScan = registrar::Registrar::InitialScan::Wait;
  auto registrar = *registrar::Registrar::open(fixture(), options);
  auto observer = std::make_shared<CountingObserver>();
  registrar->addObserver(observer);
  const std::string inRoot = registrar->applications().front()->bundlePath();
  const std::string aside = fixture().root + "/aside";
  for (auto _ : state) {
    state.PauseTiming();
    std::filesystem::rename(inRoot, aside);
    if (!observer->uninstalled.waitFor(std::chrono::seconds(10))) state.SkipWithError("no uninstall seen");
    state.ResumeTiming();
    std::filesystem::rename(aside, inRoot);
    if (!observer->installed.waitFor(std::chrono::seconds(10))) state.SkipWithError("no install seen");
  }
  const registrar::ScanSummary last = registrar->lastScan();
  state.counters["looked_at"] = static_cast<double>(last.examined);
  state.counters["bundles_read"] = static_cast<double>(last.read);
}
BENCHMARK(RenamedApplicationSeen)->Unit(benchmark::kMillisecond)->UseRealTime();

long residentKilobytes() {
  std::ifstream status("/proc/self/status");
  std::string line;
  while (std::getline(status, line)) {
    if (line.starts_with("VmRSS:")) return std::stol(line.substr(6));
  }
  return 0;
}

// What a loaded store holds: heap in use (malloc's own count) and resident
// memory, after minus before opening, per plug-in and in all.
void OpenStoreMemory(benchmark::State& state) {
  fixture();
  for (auto _ : state) {
    ::malloc_trim(0);
    const size_t heapBefore = ::mallinfo2().uordblks;
    const long residentBefore = residentKilobytes();
    auto registrar = openQuiet(registrar::Registrar::InitialScan::None);
    const size_t heapAfter = ::mallinfo2().uordblks;
    const long residentAfter = residentKilobytes();
    const double plugIns = static_cast<double>(registrar->installedPlugIns().size());
    state.counters["heap_MB"] = static_cast<double>(heapAfter - heapBefore) / 1e6;
    state.counters["heap_per_plugin_B"] = static_cast<double>(heapAfter - heapBefore) / plugIns;
    state.counters["rss_MB"] = static_cast<double>(residentAfter - residentBefore) / 1e3;
    registrar.reset();
    // The store's rows alone, decoded, before any record is made of them.
    ::malloc_trim(0);
    const size_t rowsBefore = ::mallinfo2().uordblks;
    auto rows = registrar::Store::open(fixture().storeFile, registrar::Store::Mode::ReadOnly);
    state.counters["rows_MB"] = static_cast<double>(::mallinfo2().uordblks - rowsBefore) / 1e6;
  }
}
BENCHMARK(OpenStoreMemory)->Unit(benchmark::kMillisecond)->Iterations(1);

}  // namespace
