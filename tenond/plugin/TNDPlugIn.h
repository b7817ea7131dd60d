#pragma once

// TNDPlugIn: the daemon's record of one installed plug-in, built from the
// registrar's record and cached by the plug-in database (TNDatabase).
//
// Compared with the shared record (TNPlugInCore) it takes its facts from
// the registrar (identity, location, names, entitlements, data container,
// the registrar's copy of Info.manifest), keeps that copy fresh (one fetch
// at most per change of the registrar's knowledge UUID, under the record's
// own lock), refuses to exist when misconfigured (two rules on top of the
// shared diagnosis), and completes forms with sandbox extensions.
//
// Created only through initWithRGData; the database owns it through a
// shared_ptr. Thread-safe: fields are atomic properties and the refresh is
// serialised.

#include <functional>
#include <memory>
#include <mutex>
#include <set>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "libtenon/model/AtomicProperty.h"
#include "libtenon/model/TNPlugInCore.h"
#include "libtenon/model/TNRegistryLookup.h"
#include "platform/registrar/Registrar.h"
#include "tenond/plugin/TNDHost.h"
#include "tenond/plugin/TNDMatchContext.h"

namespace tnd {

class TNDPlugIn final : public tn::TNPlugInCore {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  // The entitlement whose string value replaces the identifier as the
  // annotation key.
  static constexpr const char* kReplacePlugInEntitlement = "com.ostrel.developer.replace-plugin";

  // A record for the registrar's `record`, or null when the plug-in cannot
  // be used (no bundle URL, no identifier, or a failed diagnosis, logged).
  // `lookup` answers the localized action titles.
  static std::shared_ptr<TNDPlugIn> initWithRGData(const registrar::PlugInPtr& record,
                                                   std::shared_ptr<const registrar::Registrar> registrar,
                                                   const tn::TNRegistryLookup& lookup);

  explicit TNDPlugIn(CreateTag, std::shared_ptr<const registrar::Registrar> registrar);

  // The registrar's current record of this plug-in: by UUID, else (logged)
  // by bundle URL; null when it knows neither.
  registrar::PlugInPtr getProxy() const;

  // The registrar's Info.manifest, fetched again when the registrar's
  // knowledge changed since the last fetch; none when it no longer knows
  // the plug-in.
  tn::Value bundleInfoDictionary() const override;
  tn::Value infoKey(std::string_view key) const override;
  tn::Value pluginKey(std::string_view key) const override;
  tn::Value attribute(std::string_view key) const override;
  bool isStillValid() const { return true; }

  // Registrar facts. The localized names, original identifier and
  // entitlements are copied into the shared record's fields at construction
  // (so its getters and setters serve); the data container is this
  // record's own.
  std::optional<tn::URL> dataContainerURL() const override { return dataContainerURL_; }
  tn::Value infoManifest() const { return infoManifest_.get(); }
  std::optional<tn::UUID> rgKnowledgeUUID() const { return rgKnowledgeUUID_.get(); }
  bool ageRestricted() const { return false; }

  // The entitlement's value, or none.
  tn::Value valueForEntitlement(std::string_view name) const;
  // Present and not equal to false (a zero number counts as false).
  bool hasEntitlement(std::string_view name) const;
  // The replace-plugin entitlement when it is a string, else the identifier.
  std::string annotationKey() const;

  // The shared diagnosis, then: a non-data plug-in needs a data container;
  // a plug-in outside any application must lie on the system volume
  // ($TENON_ROOT/System/). Errors of code 12.
  std::optional<tn::Error> diagnose() const;

  // --- Forms (TNDPlugInForms.cpp) ---
  //
  // A form depends on the request only through the user's annotation. The
  // rest (the exported form, the sandbox extensions that complete it, and
  // its typed encoding) depends only on this record and the registrar's
  // knowledge of it, so it is made once per knowledge generation and kept
  // (its encoding only, tokens included, not the form's dictionary):
  // answering a lookup then costs the annotation's encoding and a copy of
  // bytes. Tokens can be kept because a token depends only on the key and
  // its subject; extensions are kept only when every token was issued, so a
  // failure is tried (and logged) again on the next request.

  // Adds "extensions" (file extensions for "Shared", or for the whole bundle
  // of an application extension) and "service-extension" (a service-lookup
  // extension for the bundle identifier, unless a data plug-in) to a form,
  // issued again (the same tokens as the kept encoding's).
  void augmentForm(tn::Dictionary& form) const;
  // Why exportForm() fails for the record as the registrar knows it now,
  // or none.
  std::optional<tn::Error> exportError() const;
  // The typed encoding (tn::encodeTyped) of the form a lookup answers with:
  // the exported form, or an empty one when the plug-in cannot be exported
  // (logged as an error on "ops"), with "annotations" set to `annotations`,
  // then augmented, then `extra`'s entries added. Byte for byte what
  // encoding that dictionary would give. appendEncodedForm appends those
  // bytes (a discovery's array of forms).
  tn::Value encodedForm(const tn::Dictionary& annotations, const tn::Dictionary& extra = {}) const;
  void appendEncodedForm(tn::Bytes& out, const tn::Dictionary& annotations, const tn::Dictionary& extra = {}) const;
  // Resource (relative path, "." for the bundle) to its file extension
  // token; resources whose extension fails are logged and left out. A
  // resource that is absolute, has a ".." component or resolves outside the
  // bundle (links followed) gets no token: it is logged at info level on
  // "ops" as "refusing extension for resource <name> of plug-in at <path>".
  tn::Dictionary issueResourceExtensions(const tn::Value& resources) const;
  // A read-only extension for one resource of the bundle (see resourcePaths_).
  tn::Result<std::string> issueResourceExtension(const tn::URL& bundle, const std::string& resource) const;

  // --- Matching rules (TNDPlugInMatching.cpp) ---
  //
  // A rules dictionary maps attribute keys to patterns; a plug-in matches
  // when it matches every entry, tried in the dictionary's order up to the
  // first that fails. Null and empty rules match every plug-in; rules of
  // another kind match none. Keys: "ENTITLEMENT:<name>" (an entitlement,
  // never falling back), "XTExtensionIdentifier", "com.ostrel.uuid",
  // "XTUserElection" (the election as a decimal string),
  // "XTExtensionContainingApp" (the containing application's path; no
  // application fails whatever the pattern), and any other key: the
  // attribute, else the information dictionary's own value. Patterns: true
  // and false (present / absent, numbers 1 and 0 alike), a dictionary (an
  // activation rule's offer), a string (one comparison), an array (any of
  // its strings). Evaluation only reads; its only side effects are log
  // lines. Bounded: rules of more than kMaxRuleEntries entries and arrays
  // (values or patterns) of more than kMaxMatchAlternatives elements match
  // nothing, and one call does at most kMaxMatchWork units of work (a unit
  // is about one byte compared); a call that would do more answers no.
  // Not on the database queue (the election reads the annotation store).

  static constexpr size_t kMaxRuleEntries = 64;
  static constexpr size_t kMaxMatchAlternatives = 256;
  static constexpr size_t kMaxMatchWork = 65536;

  // match(rules, TNDMatchContext::current()).
  bool match(const tn::Value& rules) const;
  bool match(const tn::Value& rules, const TNDMatchContext& context) const;
  // One entry of a rules dictionary.
  bool matchKey(std::string_view key, const tn::Value& pattern, const TNDMatchContext& context) const;
  // The plug-in's activation rule (value) against a host's offer (pattern),
  // logged at debug level on "extension".
  static bool matchDictionary(const tn::Value& value, const tn::Value& pattern, const TNDMatchContext& context);
  // A string value against a string pattern or an array of them (any).
  static bool matchValue(std::string_view value, const tn::Value& patterns, const TNDMatchContext& context);
  // One comparison: the pattern's leading operator ("?TY-CONFORMS:",
  // "?TY-IS:", "<>", "<=", ">=", "=", "<", ">", or none: equality) and the
  // numeric string comparison of version strings.
  static bool matchValue(std::string_view value, std::string_view pattern, const TNDMatchContext& context);
  // The value "XTUserElection" compares: the annotation's election as a
  // signed 64-bit integer with bits 8 to 15 cleared, in decimal; "0"
  // without an annotation or an election.
  std::string electionValue(const TNDMatchContext& context) const;

  // --- Host authorization (HostAuthorization.cpp) ---

  // The host entitlement whose value (rules) restricts the plug-ins a host
  // may use, and the plug-in key naming an entitlement every host needs.
  static constexpr const char* kHostRestrictionEntitlement = "com.ostrel.developer.tenon.allowedplugins";
  static constexpr std::string_view kHostEntitlementKey = "XTExtensionHostEntitlement";

  // None when `host` may use this plug-in; else the reason: "invalid host
  // restriction entitlement" (the host's restriction is not a dictionary),
  // "the host's plug-in entitlement does not allow this plug-in" (the
  // plug-in does not match it), or "the host does not have the \"E\"
  // entitlement" (the plug-in demands E of its hosts). In that order.
  std::optional<std::string> allowForClient(const TNDHost& host, const TNDMatchContext& context) const;
  std::optional<std::string> allowForClient(const TNDHost& host) const {
    return allowForClient(host, TNDMatchContext::current());
  }
  // The privacy services the user granted to the plug-in's containing
  // application (the consent store, platform/privy); empty for a plug-in
  // outside any application.
  std::set<std::string> allowedPrivyServices() const;

  // --- Activation (TNDPlugInActivation.cpp) ---

  // Registers (executable path, activation overlay) with the process
  // supervisor for the host being enabled: 0, or the supervisor's error
  // number. The caller binds it to its host (warden::Warden).
  using ExternalServiceRegistrar = std::function<int(const std::string& executablePath, const tn::Value& overlay)>;
  // The busy instances of some bundle identifiers (vigil::Vigil).
  using BusyInstanceSource = std::function<std::vector<tn::Value>(const std::set<std::string>& bundleIdentifiers)>;

  static constexpr const char* kEntryPadExtensionPoint = "com.ostrel.entry-pad-service";
  static constexpr const char* kTrafficScreenExtensionPoint = "com.ostrel.trafficguard.screen-data";
  static constexpr std::string_view kRequestsOpenAccessKey = "RequestsOpenAccess";
  // The consent store's service for network access of entry-pad plug-ins.
  static constexpr const char* kEntryPadNetworkService = "com.ostrel.privy.entry-pad-network";
  static constexpr std::string_view kRelayServiceKey = "RelayService";
  static constexpr const char* kEnvironmentVariablesKey = "EnvironmentVariables";
  static constexpr const char* kSandboxProfileKey = "_SandboxProfile";
  static constexpr const char* kOmitSandboxParametersKey = "_OmitSandboxParameters";
  static constexpr const char* kBundlePackageTypeKey = "BNBundlePackageType";
  static constexpr const char* kRelayPackageType = "RLY!";
  // The bundle identifier's key in a busy instance and in a busy report.
  static constexpr const char* kBusyBundleIdentifierKey = "BNBundleIdentifier";

  // The sandbox profile by the extension point, with the open-access rule.
  std::string sandboxProfile() const;
  // The host's environment, then the data container's HOME, BNFIXED_USER_HOME
  // and TMPDIR (when there is a container).
  tn::Dictionary mergedEnvironment(const std::optional<tn::Dictionary>& hostEnvironment) const;
  // {"RelayService": the service configuration, "BNBundlePackageType": "RLY!"}.
  tn::Value activationOverlay(const std::optional<tn::Dictionary>& hostEnvironment) const;
  // Makes the plug-in launchable for `host`: none, or an error of code 4
  // ("cannot obtain executable path for plug-in I(U)", "unable to enable
  // plug-in I(U)").
  std::optional<tn::Error> enableForClient(const TNDHost& host, const std::optional<tn::Dictionary>& environment,
                                           const ExternalServiceRegistrar& registrar) const;
  // {"BNBundleIdentifier": B} for the first busy instance of the plug-in's
  // bundle that names its bundle, or none.
  std::optional<tn::Value> checkBusy(const BusyInstanceSource& busyInstances) const;

  // A copy of `dictionary` without the keys that begin with "DT".
  static tn::Dictionary prunedInfoDictionaryFor(const tn::Dictionary& dictionary);

  // $TENON_ROOT/System/
  static std::string systemVolumePrefix();

 private:
  // The entries augmentForm adds, and whether every token was issued.
  struct Augmentation {
    tn::Dictionary entries;  // "extensions" and "service-extension", as present
    bool complete = true;
  };
  struct KeptForm;

  void copyRegistrarFacts(const registrar::PlugInRecord& record, const tn::TNRegistryLookup& lookup);
  Augmentation augmentation() const;
  tn::Dictionary issueResourceExtensions(const tn::Value& resources, bool& complete) const;
  // What is kept for the registrar's current knowledge, made when missing,
  // with the extensions made along when they could not be kept.
  struct CurrentForm {
    std::shared_ptr<const KeptForm> kept;
    std::optional<Augmentation> augmentation;
    // The extensions a form of this record gets now.
    tn::Dictionary augmentationEntries(const TNDPlugIn& plugIn) const;
  };
  CurrentForm currentForm() const;
  CurrentForm makeKeptForm(const std::optional<tn::UUID>& knowledge) const;

  const std::shared_ptr<const registrar::Registrar> registrar_;
  std::optional<tn::URL> dataContainerURL_;  // set once, before the record is shared
  // Refreshed by the const information-dictionary questions.
  mutable tn::AtomicProperty<tn::Value> infoManifest_;
  mutable tn::AtomicProperty<std::optional<tn::UUID>> rgKnowledgeUUID_;
  mutable std::mutex refreshMutex_;  // one refresh of infoManifest_ at a time
  // The canonical paths of the resources the record has shared so far, by
  // resource name: resolving them costs several system calls per resource,
  // and every form a host gets needs them. Only successes are kept (a
  // resource that appears later is found then); a kept path was inside the
  // bundle when it was checked, and the token names exactly that path.
  mutable std::mutex resourcePathsMutex_;
  mutable std::unordered_map<std::string, std::string> resourcePaths_;
  mutable std::mutex keptFormMutex_;
  mutable std::shared_ptr<const KeptForm> keptForm_;  // guarded by keptFormMutex_
};

}  // namespace tnd
