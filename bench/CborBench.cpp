// The CBOR codec on a dictionary the size of a plug-in form (about 50 keys,
// nested a few levels). Target: an encode + decode round trip in at most
// 20 µs.

#include <benchmark/benchmark.h>

#include <cstdlib>

#include "platform/value/Cbor.h"
#include "platform/value/TypedEncoding.h"

namespace tn {
namespace {

Value attributes() {
  Dictionary d;
  d.set("TNExtensionPointName", Value("com.ostrel.tenon.share-services"));
  d.set("TNExtensionPointVersion", Value("1.0"));
  d.set("XTExtensionActivationRule",
        Value(Dictionary{{"accepts", Value(Dictionary{{"image/*", Value(int64_t{16})}, {"video/*", Value(int64_t{1})}})}}));
  d.set("TNSupportsImages", Value(true));
  d.set("TNSupportsMovies", Value(false));
  d.set("TNMaximumItemCount", Value(int64_t{16}));
  d.set("TNPreferredWidth", Value(480.5));
  d.set("TNAcceptedTypes", Value(Array{Value("image/png"), Value("video/mp4"), Value("text/uri-list")}));
  d.set("TNServiceRole", Value("viewer"));
  d.set("TNPrincipalClass", Value("ShareServiceMain"));
  return Value(std::move(d));
}

Value pluginForm() {
  Dictionary form;
  form.set("BNBundleIdentifier", Value("com.example.photos.share-extension"));
  form.set("BNBundleName", Value("Photos Share"));
  form.set("BNBundleDisplayName", Value("Share to Photos"));
  form.set("BNBundleVersion", Value("1742.3.1"));
  form.set("BNBundleShortVersionString", Value("12.4"));
  form.set("BNBundleExecutable", Value("photos-share"));
  form.set("BNBundlePackageType", Value("TNPI"));
  form.set("BNBundleDevelopmentRegion", Value("en"));
  form.set("TNPlugInUUID", Value(UUID::random()));
  form.set("TNRegistrationDate", Value(Date{1795902780.25}));
  form.set("TNPath", Value("/opt/tenon/applications/Photos/Support/PlugIns/Share.tnx"));
  form.set("TNContainingBundle", Value("/opt/tenon/applications/Photos"));
  form.set("TNAttributes", attributes());
  form.set("TNSignature", Value(Bytes(48, 0xA5)));
  form.set("TNLocalizedNames",
           Value(Array{Value("Share"), Value("Partager"), Value("Teilen"), Value("Compartir"), Value("共有")}));
  form.set("TNEntitlements", Value(Dictionary{{"com.ostrel.tenon.sandbox", Value(true)},
                                              {"com.ostrel.tenon.network.client", Value(true)},
                                              {"com.ostrel.tenon.files.user-selected", Value("read-only")}}));
  for (int i = 0; form.size() < 50; ++i) {
    switch (i % 5) {
      case 0: form.set(fmt::format("TNOption{}", i), Value(fmt::format("value number {}", i))); break;
      case 1: form.set(fmt::format("TNCount{}", i), Value(uint64_t(i) * 1000)); break;
      case 2: form.set(fmt::format("TNOffset{}", i), Value(-i)); break;
      case 3: form.set(fmt::format("TNScale{}", i), Value(i * 0.125)); break;
      default:
        form.set(fmt::format("TNList{}", i), Value(Array{Value("alpha"), Value("beta"), Value("gamma")}));
    }
  }
  return Value(std::move(form));
}

void BM_FormRoundTrip(benchmark::State& state) {
  const Value form = pluginForm();
  for (auto _ : state) {
    Bytes bytes = encodeCbor(form);
    Result<Value> back = decodeMessageBody(bytes);
    if (!back.ok()) std::abort();
    benchmark::DoNotOptimize(back);
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * encodeCbor(form).size()));
}
BENCHMARK(BM_FormRoundTrip);

void BM_FormEncode(benchmark::State& state) {
  const Value form = pluginForm();
  for (auto _ : state) {
    Bytes bytes = encodeCbor(form);
    benchmark::DoNotOptimize(bytes);
  }
}
BENCHMARK(BM_FormEncode);

// The relay appends into a buffer it reuses, so this is the encoder alone.
void BM_FormAppendToReusedBuffer(benchmark::State& state) {
  const Value form = pluginForm();
  Bytes buffer;
  for (auto _ : state) {
    buffer.clear();
    appendCbor(buffer, form);
    benchmark::DoNotOptimize(buffer.data());
  }
}
BENCHMARK(BM_FormAppendToReusedBuffer);

void BM_FormDecode(benchmark::State& state) {
  const Bytes bytes = encodeCbor(pluginForm());
  for (auto _ : state) {
    Result<Value> back = decodeMessageBody(bytes);
    benchmark::DoNotOptimize(back);
  }
  state.SetBytesProcessed(static_cast<int64_t>(state.iterations() * bytes.size()));
}
BENCHMARK(BM_FormDecode);

// A version-3 reply: the form in its typed encoding, inside a message that
// goes through the wire and back.
void BM_FormTypedRoundTrip(benchmark::State& state) {
  const Value form = pluginForm();
  for (auto _ : state) {
    const Value reply(Dictionary{{"version", Value(3)}, {"form", encodeTyped(form)}});
    Result<Value> received = decodeMessageBody(encodeCbor(reply));
    if (!received.ok()) std::abort();
    Result<Value> back = decodeTyped((*received)["form"]);
    if (!back.ok()) std::abort();
    benchmark::DoNotOptimize(back);
  }
}
BENCHMARK(BM_FormTypedRoundTrip);

}  // namespace
}  // namespace tn
