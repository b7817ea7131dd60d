// The registrar's targets: cold open of an existing 10,000-plug-in store
// ready to answer (<= 200 ms), rescan of unchanged roots (<= 1 s), lookup by
// UUID (<= 5 us), listing every plug-in (<= 50 ms). The fixture is made once
// per run on a private root by generate-registry-fixture.

#include <benchmark/benchmark.h>

#include <stdlib.h>

#include <cstdlib>
#include <filesystem>
#include <string>

#include "platform/registrar/Registrar.h"

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

}  // namespace
