// Rules matching: "match" over 10,000 installed plug-ins must take at most
// 30 ms in all, so one plug-in's rules must cost well under a microsecond
// for simple rules. Measured here on the daemon's real plug-in records
// (10,000 in 1,000 applications, made by generate-registry-fixture with
// types and activation rules) and the system's shared MIME database:
//   MatchEveryPlugIn/*   one request's rules against all 10,000 records
//   MatchOnePlugIn/*     one record, one kind of rule
//   TypeConforms, TypeSnapshot   the type hierarchy's hot path
// Elections come from an in-memory table here; the daemon's come from its
// annotation store.

#include <benchmark/benchmark.h>

#include <stdlib.h>

#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "libtenon/registrar/RegistrarLookup.h"
#include "platform/registrar/Registrar.h"
#include "platform/types/TypeHierarchy.h"
#include "tenond/plugin/TNDPlugIn.h"

namespace {

struct Fixture {
  std::shared_ptr<registrar::Registrar> registrar;
  std::unique_ptr<tn::RegistrarLookup> lookup;
  std::vector<std::shared_ptr<tnd::TNDPlugIn>> plugIns;
  tnd::TNDMatchContext context;
};

const Fixture& fixture() {
  static const Fixture* const made = [] {
    std::string pattern = (std::filesystem::temp_directory_path() / "tenon-match-bench-XXXXXX").string();
    static const std::string root = ::mkdtemp(pattern.data());
    const std::string command = std::string(TENON_FIXTURE_GENERATOR) + " " + root + " 1000 10 typed";
    if (std::system(command.c_str()) != 0) std::abort();
    std::atexit([] {
      std::error_code ignored;
      std::filesystem::remove_all(root, ignored);
    });
    ::setenv("TENON_ROOT", root.c_str(), 1);
    auto* fixture = new Fixture();
    registrar::Registrar::Options options;
    options.watch = false;
    options.locale = "";
    fixture->registrar = *registrar::Registrar::open(registrar::RegistrarPaths::forRoot(root), options);
    fixture->lookup = std::make_unique<tn::RegistrarLookup>(fixture->registrar);
    for (const registrar::PlugInPtr& record : fixture->registrar->installedPlugIns()) {
      if (auto plugIn = tnd::TNDPlugIn::initWithRGData(record, fixture->registrar, *fixture->lookup)) {
        fixture->plugIns.push_back(std::move(plugIn));
      }
    }
    if (fixture->plugIns.size() != 10000) std::abort();
    fixture->context.types = types::loadTypeTable(types::TypePaths::forRoot("", "/usr/share"));
    fixture->context.annotationForPlugIn = [](const tnd::TNDPlugIn&) -> std::optional<tn::Dictionary> {
      return tn::Dictionary{{"election", tn::Value(1)}};
    };
    return fixture;
  }();
  return *made;
}

tn::Value offerOfImages() {
  return tn::Dictionary{
      {"items", tn::Array{tn::Value(tn::Dictionary{{"type", "image/png"}, {"count", 3}})}}};
}

// The rules of one kind, by benchmark argument.
tn::Value rules(int64_t kind) {
  switch (kind) {
    case 0:  // a host that wants one plug-in
      return tn::Dictionary{{"XTExtensionIdentifier", "com.example.app500.plugin5"}};
    case 1:  // a typical host: a kind, a version, the user's choice
      return tn::Dictionary{{"Kind", tn::Array{"kind1", "kind3"}}, {"XTExtensionVersion", ">=1.0"},
                            {"XTUserElection", "1"}};
    case 2:  // a type test
      return tn::Dictionary{{"SupportedTypes", "?TY-CONFORMS:image/*"}};
    default:  // an activation rule
      return tn::Dictionary{{"XTExtensionActivationRule", offerOfImages()}};
  }
}

const char* const kKinds[] = {"identifier", "typical", "type", "activation"};

void MatchEveryPlugIn(benchmark::State& state) {
  const Fixture& f = fixture();
  const tn::Value wanted = rules(state.range(0));
  state.SetLabel(kKinds[state.range(0)]);
  size_t matched = 0;
  for (auto _ : state) {
    matched = 0;
    for (const auto& plugIn : f.plugIns) matched += plugIn->match(wanted, f.context) ? 1 : 0;
    benchmark::DoNotOptimize(matched);
  }
  state.counters["matched"] = static_cast<double>(matched);
}
BENCHMARK(MatchEveryPlugIn)->DenseRange(0, 3)->Unit(benchmark::kMillisecond);

void MatchOnePlugIn(benchmark::State& state) {
  const Fixture& f = fixture();
  const tn::Value wanted = rules(state.range(0));
  state.SetLabel(kKinds[state.range(0)]);
  const auto& plugIn = f.plugIns[1];  // an image plug-in
  for (auto _ : state) benchmark::DoNotOptimize(plugIn->match(wanted, f.context));
}
BENCHMARK(MatchOnePlugIn)->DenseRange(0, 3);

void TypeConforms(benchmark::State& state) {
  const auto& table = *fixture().context.types;
  for (auto _ : state) benchmark::DoNotOptimize(table.conforms("image/svg+xml", "text/plain"));
}
BENCHMARK(TypeConforms);

void TypeSnapshot(benchmark::State& state) {
  static types::TypeHierarchy hierarchy(types::TypePaths::forRoot("", "/usr/share"));
  for (auto _ : state) benchmark::DoNotOptimize(hierarchy.snapshot());
}
BENCHMARK(TypeSnapshot)->Threads(1)->Threads(2);

}  // namespace
