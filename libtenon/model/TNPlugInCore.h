#pragma once

// TNPlugInCore: the one record of a plug-in that the daemon and its clients
// share.
//
// It holds the plug-in's identity (UUID, identifier), its location (bundle
// URL, containing application URL), the two dictionaries read from the
// bundle's Info.manifest (the whole bundle information dictionary and its
// plug-in dictionary, the "XTExtension" entry) and the facts the registry or
// the daemon attach. Everything else (protocol, principal class, version,
// attributes, style flags) is derived on demand from the two dictionaries,
// so a record never holds a stale copy of a derived value.
//
// Records live behind std::shared_ptr. The daemon's record derives from this
// class and answers the virtual getters below from fresh registry data;
// every derived property reads through them. Stored fields are atomic
// properties: single reads and writes are safe from any queue; compound
// changes (setAnnotation) are serialised by the record's owner.
//
// "None" is a null Value for values of any kind (dictionaries included) and
// std::nullopt for typed fields. Input never throws or crashes: setup fails
// with a log line, lookups answer none, diagnose answers an error value.
//
// Operations beyond this file: forms (PlugInForm.cpp), SDK resolution
// (SDKResolution.cpp), localization (Localization.cpp). docs/model.md
// describes the record, its forms and the SDK merge for plug-in authors.

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "libtenon/model/AtomicProperty.h"
#include "libtenon/model/TNRegistryLookup.h"
#include "platform/value/Date.h"
#include "platform/value/Error.h"
#include "platform/value/Result.h"
#include "platform/value/URL.h"
#include "platform/value/UUID.h"
#include "platform/value/Value.h"

namespace tn {

// The code of diagnose's errors, and of exportForm's.
inline constexpr int64_t kUnusablePlugInErrorCode = 12;
// The code of localizedInfoDictionaryForKeys's errors.
inline constexpr int64_t kLocalizedInfoErrorCode = -1;

class TNPlugInCore {
 public:
  // An empty record.
  TNPlugInCore() = default;
  virtual ~TNPlugInCore() = default;
  TNPlugInCore(const TNPlugInCore&) = delete;
  TNPlugInCore& operator=(const TNPlugInCore&) = delete;

  // A record set up with setupWithName; null when setup fails. The plug-in
  // dictionary `info` is stored only when setup left none (no bundle
  // information dictionary given).
  static std::shared_ptr<TNPlugInCore> create(const std::optional<std::string>& identifier,
                                              const std::optional<URL>& url, const Value& bundleInfo,
                                              const Value& info, const std::optional<UUID>& uuid);

  // A record imported from a form (setupWithForm); null when that fails.
  static std::shared_ptr<TNPlugInCore> createWithForm(const Value& form);

  // ---- Setup ----

  // Fails without a URL, and without an identifier (logged). A non-null
  // bundleInfo goes through normalizeInfoDictionary and setDictionaries and
  // fails setup (logged) unless it holds an "XTExtension" dictionary. Then
  // stores identifier, URL and the UUID, or a new random UUID. `info` is not
  // read here (create() uses it).
  bool setupWithName(const std::optional<std::string>& identifier, const std::optional<URL>& url,
                     const Value& bundleInfo, const Value& info, const std::optional<UUID>& uuid);

  // Stores a dictionary as the bundle information dictionary and its
  // "XTExtension" dictionary as the plug-in dictionary. False, storing
  // nothing, for a non-dictionary; false, keeping the bundle information,
  // when "XTExtension" is not a dictionary.
  bool setDictionaries(const Value& bundleInfo);

  // A hook for derived records; this class answers its argument.
  virtual Value normalizeInfoDictionary(const Value& bundleInfo) const;

  // ---- Stored fields ----

  bool onSystemVolume() const { return onSystemVolume_.get(); }
  void setOnSystemVolume(bool value) { onSystemVolume_.set(value); }
  Value plugInDictionary() const { return plugInDictionary_.get(); }
  void setPlugInDictionary(Value value) { plugInDictionary_.set(std::move(value)); }
  std::optional<std::string> identifier() const { return identifier_.get(); }
  // The identifier and the UUID as log lines and messages show them:
  // "(null)" when there is none.
  std::string identifierText() const { return identifier().value_or("(null)"); }
  std::string uuidText() const { return uuid() ? uuid()->string() : std::string("(null)"); }
  void setIdentifier(std::optional<std::string> value) { identifier_.set(std::move(value)); }
  virtual std::optional<std::string> originalIdentifier() const { return originalIdentifier_.get(); }
  void setOriginalIdentifier(std::optional<std::string> value) { originalIdentifier_.set(std::move(value)); }
  std::optional<URL> url() const { return url_.get(); }
  void setUrl(std::optional<URL> value) { url_.set(std::move(value)); }
  std::optional<URL> containingUrl() const { return containingUrl_.get(); }
  void setContainingUrl(std::optional<URL> value) { containingUrl_.set(std::move(value)); }
  virtual Value bundleInfoDictionary() const { return bundleInfoDictionary_.get(); }
  void setBundleInfoDictionary(Value value) { bundleInfoDictionary_.set(std::move(value)); }
  virtual Value entitlements() const { return entitlements_.get(); }
  void setEntitlements(Value value) { entitlements_.set(std::move(value)); }
  uint64_t hubProtocolVersion() const { return hubProtocolVersion_.get(); }
  void setHubProtocolVersion(uint64_t value) { hubProtocolVersion_.set(value); }
  virtual std::optional<std::string> localizedName() const { return localizedName_.get(); }
  void setLocalizedName(std::optional<std::string> value) { localizedName_.set(std::move(value)); }
  virtual std::optional<std::string> localizedShortName() const { return localizedShortName_.get(); }
  void setLocalizedShortName(std::optional<std::string> value) { localizedShortName_.set(std::move(value)); }
  virtual std::optional<std::string> localizedContainingName() const { return localizedContainingName_.get(); }
  void setLocalizedContainingName(std::optional<std::string> value) { localizedContainingName_.set(std::move(value)); }
  // Action name to localized title; a dictionary or none.
  virtual Value localizedFileSourceActionNames() const { return localizedFileSourceActionNames_.get(); }
  void setLocalizedFileSourceActionNames(Value value) { localizedFileSourceActionNames_.set(std::move(value)); }
  Value annotations() const { return annotations_.get(); }
  void setAnnotations(Value value) { annotations_.set(std::move(value)); }
  int64_t lastModified() const { return lastModified_.get(); }
  void setLastModified(int64_t value) { lastModified_.set(value); }
  std::optional<UUID> uuid() const { return uuid_.get(); }
  void setUuid(std::optional<UUID> value) { uuid_.set(value); }
  std::optional<Bytes> cdhash() const { return cdhash_.get(); }
  void setCdhash(std::optional<Bytes> value) { cdhash_.set(std::move(value)); }
  std::optional<std::string> requirement() const { return requirement_.get(); }
  void setRequirement(std::optional<std::string> value) { requirement_.set(std::move(value)); }
  // The sandbox data container; always none here (the daemon record has one).
  virtual std::optional<URL> dataContainerURL() const { return std::nullopt; }

  // ---- Derived properties (nothing stored) ----

  std::optional<std::string> path() const;            // path of url
  std::optional<std::string> containingPath() const;  // path of containingUrl
  Value attributes() const;                           // pluginKey "XTExtensionAttributes"
  Value version() const;                              // attribute "XTExtensionVersion"
  // pluginKey "XTExtensionProtocol"; "XTObject" for an application extension
  // without one; else none.
  Value protocolSpec() const;
  // pluginKey "PrincipalClass"; "XTObject" for an application extension
  // without one; else none.
  Value principalSpec() const;
  Value sdkSpec() const;  // pluginKey "XTExtensionPointIdentifier"
  std::optional<std::string> embeddedCodePath() const { return std::nullopt; }
  Value embeddedProtocolSpec() const;  // pluginKey "EmbeddedProtocol", else protocolSpec
  // The bundle path (less trailing slashes) ends in ".tnx".
  bool isAppExtension() const;
  bool isMultiplexed() const { return false; }
  bool isHybrid() const;     // "EmbeddedCode" present, whatever its value
  bool isDedicated() const;  // "Dedicated" is true or a non-zero number
  bool isData() const;       // protocolSpec is the string "#Data"
  Date timestamp() const;    // lastModified as a date
  // False with an "XTExtension" entry; true with "Tenon"; with neither, an
  // internal inconsistency is reported (logged at error level) and the
  // answer is true.
  bool oldStyle() const;

  // ---- Lookups (none for a missing key or dictionary) ----

  // The bundle information dictionary's value; logged at debug level on "rg".
  virtual Value infoKey(std::string_view key) const;
  virtual Value pluginKey(std::string_view key) const;
  virtual Value attribute(std::string_view key) const;
  // Always none.
  virtual Value augmentInterface(const Value& interface) const;

  // ---- Identity: by UUID only ----

  bool isEqual(const TNPlugInCore* other) const;
  size_t hash() const;
  friend bool operator==(const TNPlugInCore& a, const TNPlugInCore& b) { return a.isEqual(&b); }

  // Replaces annotations with a copy in which key maps to value, or lacks
  // key when value is none. The old dictionary is never changed.
  void setAnnotation(std::string_view key, const std::optional<Value>& value);

  // None when the record is usable; otherwise an error (code 12) for the
  // first failing check: identifier, protocol, attributes, an application
  // extension's principal class, "PassProxy", hybrid.
  std::optional<Error> diagnose() const;

  // ---- Forms (PlugInForm.cpp) ----

  // The record's form: the always-present keys in order, then the optional
  // ones. Fails (code 12, the missing field named) when the record lacks an
  // identifier, path, original identifier, bundle information dictionary,
  // plug-in dictionary or UUID. The record is not changed.
  Result<Dictionary> exportForm() const;
  // What the form carries under "version" (the version, or "<none>") and
  // "uuid" (the UUID's text; null without a UUID), for code that compares
  // or names plug-ins as their forms show them.
  Value formVersion() const;
  Value formUUID() const;
  // Fills the record from a form; false when the setup fails.
  bool setupWithForm(const Value& form);
  // Replaces annotations with the form's "annotations" (none when absent).
  void updateFromForm(const Value& form);
  // Rewrites the plug-in dictionary so that it holds an attributes
  // dictionary with a version.
  void canonicalize();

  // ---- SDK resolution (SDKResolution.cpp) ----

  // Merges the SDK dictionary of the record's extension point into its
  // bundle information dictionary, re-derives the plug-in dictionary and
  // canonicalises. Without a bundle information dictionary it reports the
  // broken precondition (error log) and does nothing.
  void resolveSDK(const TNRegistryLookup& registry);
  // The SDK dictionary of an extension point, or none (logged).
  static std::optional<Dictionary> readSDKDictionary(std::string_view identifier, const TNRegistryLookup& registry);
  // A new dictionary: plugIn with sdk merged in by the merge rules, at every
  // depth. Neither argument is changed.
  static Dictionary mergeDictionary(const Dictionary& sdk, const Dictionary& plugIn);
  // True only for "CleanTimeout".
  static bool sdkOverridesKey(std::string_view key);
  // The union of two "Shared" values (arrays; a single value counts as a
  // one-element array, none as empty): the plug-in's distinct elements in
  // order, then the SDK's that are new.
  static Array mergeSharedResources(const Value& sdkShared, const Value& plugInShared);

  // ---- Localization (Localization.cpp) ----

  using LocalizedInfoCompletion = std::function<void(std::optional<Dictionary>, std::optional<Error>)>;
  // The values of keys, localized where the record knows a localized name;
  // completion is called exactly once, on this thread, before returning.
  void localizedInfoDictionaryForKeys(const std::vector<std::string>& keys,
                                      const LocalizedInfoCompletion& completion) const;

 private:
  AtomicProperty<bool> onSystemVolume_;
  AtomicProperty<Value> plugInDictionary_;
  AtomicProperty<std::optional<std::string>> identifier_;
  AtomicProperty<std::optional<std::string>> originalIdentifier_;
  AtomicProperty<std::optional<URL>> url_;
  AtomicProperty<std::optional<URL>> containingUrl_;
  AtomicProperty<Value> bundleInfoDictionary_;
  AtomicProperty<Value> entitlements_;
  AtomicProperty<uint64_t> hubProtocolVersion_;
  AtomicProperty<std::optional<std::string>> localizedName_;
  AtomicProperty<std::optional<std::string>> localizedShortName_;
  AtomicProperty<std::optional<std::string>> localizedContainingName_;
  AtomicProperty<Value> localizedFileSourceActionNames_;
  AtomicProperty<Value> annotations_;
  AtomicProperty<int64_t> lastModified_;
  AtomicProperty<std::optional<UUID>> uuid_;
  AtomicProperty<std::optional<Bytes>> cdhash_;
  AtomicProperty<std::optional<std::string>> requirement_;
};

// The localized titles of a file-source plug-in's actions: action name
// ("XTExtensionFileSourceActionName" of each "XTExtensionFileSourceActions"
// element) to its string in the bundle's "Localizable" table, or to the name
// itself when the table has none. One strings-table query for all names.
// Elements without a name, or that are not dictionaries, are logged and left
// out. Never fails: a plug-in without actions gets an empty dictionary.
// plugInDescription names the plug-in in the log line.
Dictionary localizedFileSourceActionNamesForTNDict(const TNRegistryLookup& registry, const URL& plugInBundle,
                                                   const Value& plugInDictionary, std::string_view plugInDescription);

}  // namespace tn

template <>
struct std::hash<tn::TNPlugInCore> {
  size_t operator()(const tn::TNPlugInCore& record) const noexcept { return record.hash(); }
};
