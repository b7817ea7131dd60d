// Fuzzes form import: the input is one CBOR item in the typed dialect (what a
// client decodes from a reply), imported as a plug-in form. An accepted form
// goes on through everything a client or the daemon does with a record:
// diagnose, SDK resolution against the form's own "sdk" entry, localized
// values of its bundle information keys, and export. An exported form must
// import again as an equal record with the same identity fields.

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <span>
#include <string>
#include <vector>

#include "libtenon/model/TNPlugInCore.h"
#include "platform/log/Log.h"
#include "platform/value/Cbor.h"

namespace {

[[noreturn]] void failure(const char* what, const tn::Value& form) {
  std::fprintf(stderr, "%s\n%s\n", what, form.description().c_str());
  std::abort();
}

// A registry whose one SDK dictionary is taken from the fuzzed input.
class InputRegistry : public tn::TNRegistryLookup {
 public:
  explicit InputRegistry(const tn::Value& sdk) : sdk_(sdk) {}
  std::optional<tn::Dictionary> sdkDictionary(std::string_view) const override {
    if (!sdk_.isDictionary()) return std::nullopt;
    return *sdk_.dictionary();
  }
  std::optional<LocalizedStrings> localizedStrings(const tn::URL&, std::string_view,
                                                   const std::set<std::string, std::less<>>&) const override {
    return std::nullopt;
  }

 private:
  tn::Value sdk_;
};

void checkRoundTrip(const tn::TNPlugInCore& record, const tn::Value& form) {
  tn::Result<tn::Dictionary> exported = record.exportForm();
  if (!exported) return;  // incomplete records are refused with an error value
  const std::shared_ptr<tn::TNPlugInCore> again = tn::TNPlugInCore::createWithForm(tn::Value(*exported));
  if (!again) failure("an exported form does not import", form);
  if (!(*again == record) || again->identifier() != record.identifier() || again->path() != record.path() ||
      again->originalIdentifier() != record.originalIdentifier() ||
      again->hubProtocolVersion() != record.hubProtocolVersion() || again->lastModified() != record.lastModified()) {
    failure("an exported form imports as a different record", form);
  }
}

void exercise(tn::TNPlugInCore& record, const tn::Value& form) {
  (void)record.diagnose();
  (void)record.isData();
  (void)record.isDedicated();
  (void)record.oldStyle();
  checkRoundTrip(record, form);

  std::vector<std::string> keys;
  if (const tn::Dictionary* info = record.bundleInfoDictionary().dictionary()) {
    for (const auto& [key, value] : *info) keys.push_back(key);
  }
  int calls = 0;
  record.localizedInfoDictionaryForKeys(keys, [&calls](auto, auto) { ++calls; });
  if (calls != 1) failure("the localized-info completion was not called exactly once", form);

  if (!record.bundleInfoDictionary().isNull()) {
    // A non-string SDK key stops resolution before canonicalisation.
    const bool canonicalised = record.sdkSpec().isNull() || record.sdkSpec().isString();
    record.resolveSDK(InputRegistry(form["sdk"]));
    (void)record.diagnose();
    if (canonicalised && record.version().isNull()) {
      failure("a resolved record has no version", form);
    }
  }
  record.updateFromForm(form);
}

}  // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***) {
  // Logging stays on so that every log line's formatting runs, but goes nowhere.
  class Discard : public tn::log::Sink {
   public:
    void write(const tn::log::Record&) override {}
  };
  tn::log::setSink(std::make_shared<Discard>());
  tn::log::configure("debug");
  return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  tn::Result<tn::Value> form = tn::decodeCbor(std::span<const uint8_t>(data, size), tn::CborDialect::Typed);
  if (!form) return 0;
  const std::shared_ptr<tn::TNPlugInCore> record = tn::TNPlugInCore::createWithForm(*form);
  if (record) exercise(*record, *form);
  return 0;
}
