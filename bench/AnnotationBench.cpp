// The annotation requests against a real tenond whose annotation file holds
// 10,000 annotations: one "annotate" of one plug-in (target at most 20 ms,
// the durable write of the whole file included), and one "bulk-annotate"
// of 1,000 plug-ins (target at most 200 ms). Each request is timed from
// its send to its reply, by which time the file is on disk (written to a
// temporary file, flushed, renamed, directory flushed).
//
// The fixture, made once per run on a private root: generate-registry-fixture
// with 500 applications of 4 plug-ins, half of them data plug-ins (the
// 1,000 plug-ins the requests name), and an annotation file of 10,000
// entries like {"election": 1, "extension": {"color": "blue", "order": N}}.

#include <benchmark/benchmark.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "bench/support/BenchDaemon.h"
#include "platform/registrar/Registrar.h"
#include "platform/value/Document.h"

namespace {

constexpr int kStoredAnnotations = 10000;

std::string root() { return std::getenv("TENON_ROOT"); }

// The UUIDs of the fixture's data plug-ins ("...plugin1", "...plugin3"),
// from a registrar that makes the store the daemon then opens.
std::vector<tn::UUID> makeRegistry() {
  const std::string command = std::string(TENON_FIXTURE_GENERATOR) + " " + root() + " 500 4";
  if (std::system(command.c_str()) != 0) std::abort();
  registrar::Registrar::Options options;
  options.watch = false;
  options.locale = "";
  auto opened = registrar::Registrar::open(registrar::RegistrarPaths::forRoot(root()), options);
  if (!opened.ok()) std::abort();
  std::vector<tn::UUID> data;
  for (const registrar::PlugInPtr& record : (*opened)->installedPlugIns()) {
    const std::string& identifier = record->identifier();
    if (identifier.ends_with("plugin1") || identifier.ends_with("plugin3")) data.push_back(record->uuid());
  }
  if (data.size() != 1000) std::abort();
  return data;
}

void writeAnnotationFile() {
  tn::Dictionary data;
  data.reserve(kStoredAnnotations);
  for (int i = 0; i < kStoredAnnotations; ++i) {
    data.set("com.example.seed.plugin" + std::to_string(i),
             tn::Value(tn::Dictionary{{"election", tn::Value(1)},
                                      {"extension", tn::Value(tn::Dictionary{{"color", "blue"}, {"order", i}})}}));
  }
  const tn::Value document(tn::Dictionary{{"version", tn::Value(16)}, {"data", tn::Value(std::move(data))}});
  std::filesystem::create_directories(root() + "/var/db");
  std::ofstream(root() + "/var/db/Tenon-Annotations") << *tn::writeXmlDocument(document);
}

struct Fixture {
  std::vector<tn::UUID> plugIns;
  std::unique_ptr<tn::bench::TenondForBench> daemon;
  std::unique_ptr<tn::bench::FrameSocket> client;
};

Fixture& fixture() {
  static Fixture made = [] {
    tn::bench::usePrivateRoot();
    Fixture f;
    f.plugIns = makeRegistry();
    writeAnnotationFile();
    f.daemon = std::make_unique<tn::bench::TenondForBench>("com.ostrel.tenon.bench.annotation");
    f.client = std::make_unique<tn::bench::FrameSocket>(f.daemon->service());
    return f;
  }();
  return made;
}

tn::Dictionary bulkRequest(const std::vector<tn::UUID>& plugIns, int round) {
  tn::Dictionary annotations;
  for (const tn::UUID& uuid : plugIns) {
    annotations.set(uuid.string(), tn::Value(tn::Dictionary{{"round", round}, {"theme", "dark"}}));
  }
  return tn::Dictionary{{"request", "bulk-annotate"}, {"version", 3u}, {"annotations", tn::Value(std::move(annotations))}};
}

// Sends `body` and checks that it succeeded.
void expectSuccess(benchmark::State& state, Fixture& f, const tn::Value& body) {
  const tn::Value reply = f.client->request(body);
  if (!reply.isDictionary() || !reply.dictionary()->empty()) state.SkipWithError(reply.description().c_str());
}

void AnnotateOnePlugIn(benchmark::State& state) {
  Fixture& f = fixture();
  expectSuccess(state, f, tn::Value(bulkRequest(f.plugIns, 0)));  // every record built and cached
  int64_t election = 0;
  for (auto _ : state) {
    const tn::UUID& uuid = f.plugIns[static_cast<size_t>(election) % f.plugIns.size()];
    expectSuccess(state, f,
                  tn::Value(tn::Dictionary{{"request", "annotate"},
                                           {"version", 3u},
                                           {"annotations", tn::Value(tn::Dictionary{{"election", election % 2}})},
                                           {"uuids", tn::Value(tn::Array{tn::Value(uuid)})}}));
    ++election;
  }
}
BENCHMARK(AnnotateOnePlugIn)->Unit(benchmark::kMillisecond)->UseRealTime();

void BulkAnnotateThousandPlugIns(benchmark::State& state) {
  Fixture& f = fixture();
  int round = 1;
  for (auto _ : state) {
    state.PauseTiming();
    const tn::Value body(bulkRequest(f.plugIns, round++));
    state.ResumeTiming();
    expectSuccess(state, f, body);
  }
}
BENCHMARK(BulkAnnotateThousandPlugIns)->Unit(benchmark::kMillisecond)->UseRealTime();

}  // namespace
