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

#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "libtenon/model/AtomicProperty.h"
#include "libtenon/model/TNPlugInCore.h"
#include "libtenon/model/TNRegistryLookup.h"
#include "platform/registrar/Registrar.h"

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

  // Adds "extensions" (file extensions for "Shared", or for the whole bundle
  // of an application extension) and "service-extension" (a service-lookup
  // extension for the bundle identifier, unless a data plug-in) to a form.
  void augmentForm(tn::Dictionary& form) const;
  // Resource (relative path, "." for the bundle) to its file extension
  // token; resources whose extension fails are logged and left out.
  tn::Dictionary issueResourceExtensions(const tn::Value& resources) const;

  // A copy of `dictionary` without the keys that begin with "DT".
  static tn::Dictionary prunedInfoDictionaryFor(const tn::Dictionary& dictionary);

  // $TENON_ROOT/System/
  static std::string systemVolumePrefix();

 private:
  void copyRegistrarFacts(const registrar::PlugInRecord& record, const tn::TNRegistryLookup& lookup);

  const std::shared_ptr<const registrar::Registrar> registrar_;
  std::optional<tn::URL> dataContainerURL_;  // set once, before the record is shared
  // Refreshed by the const information-dictionary questions.
  mutable tn::AtomicProperty<tn::Value> infoManifest_;
  mutable tn::AtomicProperty<std::optional<tn::UUID>> rgKnowledgeUUID_;
  mutable std::mutex refreshMutex_;  // one refresh of infoManifest_ at a time
};

}  // namespace tnd
