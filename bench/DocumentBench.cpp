// Documents at the size the annotation store reaches: 10,000 plug-in
// entries, each a small dictionary, half of them with an extension
// dictionary. The target is at most 150 ms to write or read it as XML; the
// JSON figures are for comparison.

#include <benchmark/benchmark.h>

#include <fmt/format.h>

#include "platform/value/Document.h"

namespace {

tn::Value annotationDocument(int entries) {
  tn::Dictionary data;
  data.reserve(static_cast<size_t>(entries));
  for (int i = 0; i < entries; ++i) {
    tn::Dictionary entry{{"election", i % 3 == 0 ? 0 : 1}};
    if (i % 2 == 0)
      entry.set("extension", tn::Value(tn::Dictionary{
                                 {"XTExtensionPointIdentifier", "com.ostrel.share-services"},
                                 {"changed", tn::Value(tn::Date{1795380780.0 + i})},
                                 {"token", tn::Value(tn::UUID::random())},
                                 {"options", tn::Value(tn::Array{"compact", tn::Value(int64_t{i})})},
                             }));
    data.set(fmt::format("com.example.plugin.{}", i), tn::Value(std::move(entry)));
  }
  return tn::Value(tn::Dictionary{{"version", 16}, {"data", tn::Value(std::move(data))}});
}

constexpr int kEntries = 10000;

void BM_WriteXml(benchmark::State& state) {
  const tn::Value document = annotationDocument(kEntries);
  size_t bytes = 0;
  for (auto _ : state) {
    tn::Result<std::string> text = tn::writeXmlDocument(document);
    bytes = text->size();
    benchmark::DoNotOptimize(text);
  }
  state.counters["bytes"] = static_cast<double>(bytes);
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes));
}
BENCHMARK(BM_WriteXml)->Unit(benchmark::kMillisecond);

void BM_ReadXml(benchmark::State& state) {
  const std::string text = *tn::writeXmlDocument(annotationDocument(kEntries));
  for (auto _ : state) {
    tn::Result<tn::Value> document = tn::readDocument(text, "annotations");
    if (!document) state.SkipWithError(document.error().localizedDescription().c_str());
    benchmark::DoNotOptimize(document);
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * text.size()));
}
BENCHMARK(BM_ReadXml)->Unit(benchmark::kMillisecond);

void BM_WriteJson(benchmark::State& state) {
  const tn::Value document = annotationDocument(kEntries);
  for (auto _ : state) benchmark::DoNotOptimize(tn::writeJsonDocument(document));
}
BENCHMARK(BM_WriteJson)->Unit(benchmark::kMillisecond);

void BM_ReadJson(benchmark::State& state) {
  const std::string text = *tn::writeJsonDocument(annotationDocument(kEntries));
  for (auto _ : state) {
    tn::Result<tn::Value> document = tn::readDocument(text, "annotations.json");
    if (!document) state.SkipWithError(document.error().localizedDescription().c_str());
    benchmark::DoNotOptimize(document);
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * text.size()));
}
BENCHMARK(BM_ReadJson)->Unit(benchmark::kMillisecond);

}  // namespace
