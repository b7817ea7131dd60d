// Plug-in forms: the dictionary that carries one record from the daemon to a
// client (export), and back into a record (import).

#include "libtenon/model/PlugInKeys.h"
#include "libtenon/model/TNPlugInCore.h"
#include "platform/log/Log.h"

namespace tn {
namespace {

constexpr std::string_view kExportOperation = "TNPlugInCore::exportForm";

std::optional<std::string> stringIn(const Value& form, std::string_view key) {
  const std::string* text = form[key].string();
  return text ? std::optional<std::string>(*text) : std::nullopt;
}

// A form value that must be a dictionary; any other kind counts as absent.
Value dictionaryIn(const Value& form, std::string_view key) {
  const Value& value = form[key];
  return value.isDictionary() ? value : Value();
}

std::optional<URL> fileURLIn(const Value& form, std::string_view key) {
  std::optional<std::string> path = stringIn(form, key);
  if (!path) return std::nullopt;
  return URL::fileURLWithPath(*path);
}

bool booleanIn(const Value& form, std::string_view key) {
  const Value& value = form[key];
  if (std::optional<bool> flag = value.boolean()) return *flag;
  if (std::optional<double> number = value.numberAsDouble()) return *number != 0;
  return false;
}

// The first field export needs that the record lacks, or none.
std::optional<std::string_view> missingForExport(const TNPlugInCore& record, const Value& bundleInfo) {
  if (!record.identifier()) return "identifier";
  if (!record.path()) return "path";
  if (!record.originalIdentifier()) return "original identifier";
  if (!bundleInfo.isDictionary()) return "bundle information dictionary";
  if (record.plugInDictionary().isNull()) return "plug-in dictionary";
  if (!record.uuid()) return "uuid";
  return std::nullopt;
}

// The bundle information dictionary as a form carries it.
Value bundleInfoForForm(const Value& bundleInfo, const std::optional<std::string>& localizedName) {
  Dictionary copy = *bundleInfo.dictionary();
  copy.erase(keys::kBundleInfoManifestURL);
  if (localizedName) {
    TN_LOG_DEBUG(log::rg(), "{} BundleInfo[BundleDisplayName] was {}", kExportOperation,
                 copy.get(keys::kBundleDisplayName));
    copy.set(std::string(keys::kBundleDisplayName), Value(*localizedName));
    TN_LOG_DEBUG(log::rg(), "{} BundleInfo[BundleDisplayName] is {}", kExportOperation,
                 copy.get(keys::kBundleDisplayName));
  }
  return Value(std::move(copy));
}

}  // namespace

Value TNPlugInCore::formVersion() const {
  const Value current = version();
  return current.isNull() ? Value(formkeys::kNoVersion) : current;
}

Value TNPlugInCore::formUUID() const {
  const std::optional<UUID> current = uuid();
  return current ? Value(current->string()) : Value();
}

Result<Dictionary> TNPlugInCore::exportForm() const {
  const Value bundleInfo = bundleInfoDictionary();
  if (std::optional<std::string_view> missing = missingForExport(*this, bundleInfo)) {
    const std::optional<std::string> location = path();
    return TNMakeErrorWithFormat(kUnusablePlugInErrorCode, "cannot export plug-in {}: no {}",
                                 location ? *location : identifier().value_or("(unnamed)"), *missing);
  }
  const std::optional<std::string> localized = localizedName();
  const Value currentAnnotations = annotations();

  Dictionary form;
  form.reserve(17);
  form.set(std::string(formkeys::kHubProtocolVersion), Value(hubProtocolVersion()));
  form.set(std::string(formkeys::kPath), Value(*path()));
  form.set(std::string(formkeys::kSystemResident), Value(onSystemVolume()));
  form.set(std::string(formkeys::kIdentifier), Value(*identifier()));
  form.set(std::string(formkeys::kOriginalIdentifier), Value(*originalIdentifier()));
  form.set(std::string(formkeys::kVersion), formVersion());
  form.set(std::string(formkeys::kBundleInfo), bundleInfoForForm(bundleInfo, localized));
  form.set(std::string(formkeys::kInfo), plugInDictionary());
  form.set(std::string(formkeys::kUUID), formUUID());
  form.set(std::string(formkeys::kLastModified), Value(lastModified()));
  form.set(std::string(formkeys::kAnnotations), currentAnnotations.isNull() ? Value(Dictionary()) : currentAnnotations);

  if (Value value = entitlements(); !value.isNull()) form.set(std::string(formkeys::kEntitlements), value);
  if (std::optional<std::string> value = containingPath()) form.set(std::string(formkeys::kContainingPath), Value(*value));
  if (std::optional<std::string> value = localizedContainingName()) {
    form.set(std::string(formkeys::kLocalizedContainingDisplayName), Value(*value));
  }
  if (localized) form.set(std::string(formkeys::kLocalizedDisplayName), Value(*localized));
  if (std::optional<std::string> value = localizedShortName()) {
    form.set(std::string(formkeys::kLocalizedShortName), Value(*value));
  }
  if (Value value = localizedFileSourceActionNames(); !value.isNull()) {
    form.set(std::string(formkeys::kLocalizedFileSourceActionNames), value);
  }
  return form;
}

std::shared_ptr<TNPlugInCore> TNPlugInCore::createWithForm(const Value& form) {
  auto record = std::make_shared<TNPlugInCore>();
  if (!record->setupWithForm(form)) return nullptr;
  return record;
}

bool TNPlugInCore::setupWithForm(const Value& form) {
  const std::optional<std::string> uuidText = stringIn(form, formkeys::kUUID);
  const std::optional<UUID> formUUID = uuidText ? UUID::parse(*uuidText) : std::nullopt;
  if (!setupWithName(stringIn(form, formkeys::kIdentifier), fileURLIn(form, formkeys::kPath),
                     form[formkeys::kBundleInfo], form[formkeys::kInfo], formUUID)) {
    return false;
  }
  const Value& hub = form[formkeys::kHubProtocolVersion];
  setHubProtocolVersion(hub.isNull() ? 1 : hub.uint64().value_or(1));

  setOriginalIdentifier(stringIn(form, formkeys::kOriginalIdentifier));
  const Bytes* hash = form[formkeys::kHash].data();
  setCdhash(hash ? std::optional<Bytes>(*hash) : std::nullopt);
  setRequirement(stringIn(form, formkeys::kRequirement));
  setLastModified(form[formkeys::kLastModified].int64().value_or(0));
  setEntitlements(dictionaryIn(form, formkeys::kEntitlements));

  if (std::optional<URL> containing = fileURLIn(form, formkeys::kContainingPath)) setContainingUrl(containing);

  setOnSystemVolume(booleanIn(form, formkeys::kSystemResident));
  setAnnotations(dictionaryIn(form, formkeys::kAnnotations));
  setLocalizedName(stringIn(form, formkeys::kLocalizedDisplayName));
  setLocalizedShortName(stringIn(form, formkeys::kLocalizedShortName));
  setLocalizedContainingName(stringIn(form, formkeys::kLocalizedContainingDisplayName));
  setLocalizedFileSourceActionNames(dictionaryIn(form, formkeys::kLocalizedFileSourceActionNames));
  return true;
}

void TNPlugInCore::updateFromForm(const Value& form) { setAnnotations(dictionaryIn(form, formkeys::kAnnotations)); }

void TNPlugInCore::canonicalize() {
  const Value currentAttributes = attributes();
  Dictionary newAttributes = currentAttributes.isDictionary() ? *currentAttributes.dictionary() : Dictionary();
  const Value currentPlugIn = plugInDictionary();
  Dictionary newPlugIn = currentPlugIn.isDictionary() ? *currentPlugIn.dictionary() : Dictionary();
  if (newAttributes.get(keys::kVersion).isNull()) {
    const Value shortVersion = infoKey(keys::kBundleShortVersionString);
    newAttributes.set(std::string(keys::kVersion), shortVersion.isNull() ? Value("1") : shortVersion);
  }
  newPlugIn.set(std::string(keys::kAttributes), Value(std::move(newAttributes)));
  setPlugInDictionary(Value(std::move(newPlugIn)));
}

}  // namespace tn
