// "match" against a real tenond serving 10,000 installed plug-ins (1,000
// applications of 10, made by generate-registry-fixture), timed from the
// request's send to its decoded reply (the frame read, its CBOR body and
// the typed encoding of `matches` decoded), over a plain socket:
//
//   BM_MatchAll        no rules: every plug-in comes back (target 30 ms)
//   BM_MatchSelective  one identifier: one plug-in (target 2 ms)
//   BM_EncodeEachForm  encoding each of the forms BM_MatchAll returns, one by
//                      one, in the typed encoding: the cost per returned
//                      plug-in of BM_MatchAll is at most 2 times the cost of
//                      encoding its form alone (the ratio printed at the end)
//
// The registrar's store is made before the daemon starts, so that the daemon
// starts warm, as it does on a machine that has run it before.

#include <benchmark/benchmark.h>

#include <cstdlib>
#include <string>

#include "bench/support/BenchDaemon.h"
#include "bench/support/RatioReporter.h"
#include "platform/registrar/Registrar.h"
#include "platform/value/TypedEncoding.h"

namespace {

constexpr int kApplications = 1000;
constexpr int kPlugInsPerApplication = 10;
constexpr std::size_t kPlugIns = kApplications * kPlugInsPerApplication;

void makeRegistry() {
  const std::string root = std::getenv("TENON_ROOT");
  const std::string command = std::string(TENON_FIXTURE_GENERATOR) + " " + root + " " +
                              std::to_string(kApplications) + " " + std::to_string(kPlugInsPerApplication);
  if (std::system(command.c_str()) != 0) std::abort();
  registrar::Registrar::Options options;
  options.watch = false;
  options.locale = "";
  auto opened = registrar::Registrar::open(registrar::RegistrarPaths::forRoot(root), options);
  if (!opened.ok() || (*opened)->installedPlugIns().size() != kPlugIns) std::abort();
}

// Made after the private root, so destroyed before it: the daemon is
// stopped before its root is removed, and none outlives the run.
tn::bench::TenondForBench& daemon() {
  static const bool registryMade = [] {
    tn::bench::usePrivateRoot();
    makeRegistry();
    return true;
  }();
  static tn::bench::TenondForBench daemon("com.ostrel.tenon.bench.discovery");
  (void)registryMade;
  return daemon;
}

tn::Value matchRequest(tn::Dictionary rules) {
  return tn::Value(tn::Dictionary{{"request", "match"}, {"version", 3}, {"rules", tn::Value(std::move(rules))}});
}

// One "match", sent and answered; the decoded forms.
tn::Array match(tn::bench::FrameSocket& socket, const tn::Value& request) {
  const tn::Value reply = socket.request(request);
  tn::Result<tn::Value> forms = tn::decodeTyped(reply["matches"]);
  if (!forms.ok() || !forms->isArray()) std::abort();
  return std::move(*forms->array());
}

void runMatch(benchmark::State& state, const tn::Value& request, std::size_t expected) {
  tn::bench::FrameSocket socket(daemon().service());
  for (auto _ : state) {
    const tn::Array forms = match(socket, request);
    if (forms.size() != expected) {
      state.SkipWithError("unexpected number of plug-ins");
      return;
    }
  }
  state.counters["plug-ins"] = static_cast<double>(expected);
}

void BM_MatchAll(benchmark::State& state) { runMatch(state, matchRequest({}), kPlugIns); }

void BM_MatchSelective(benchmark::State& state) {
  runMatch(state, matchRequest({{"XTExtensionIdentifier", "com.example.app500.plugin3"}}), 1);
}

// Each form BM_MatchAll returns, encoded alone.
void BM_EncodeEachForm(benchmark::State& state) {
  tn::bench::FrameSocket socket(daemon().service());
  const tn::Array forms = match(socket, matchRequest({}));
  for (auto _ : state) {
    for (const tn::Value& form : forms) benchmark::DoNotOptimize(tn::encodeTyped(form));
  }
  state.counters["plug-ins"] = static_cast<double>(forms.size());
}

BENCHMARK(BM_MatchAll)->Unit(benchmark::kMillisecond)->MinTime(2);
BENCHMARK(BM_MatchSelective)->Unit(benchmark::kMicrosecond);
BENCHMARK(BM_EncodeEachForm)->Unit(benchmark::kMillisecond);

}  // namespace

int main(int argc, char** argv) {
  return tn::bench::runWithRatios(argc, argv, {{"BM_MatchAll", "BM_EncodeEachForm", 2.0}});
}
