#pragma once

// TNDatabase: the daemon's view of the installed plug-ins.
//
// The registrar (platform/registrar) is the authority on what is installed.
// The database asks it for records, turns each into a TNDPlugIn and keeps
// those in a cache keyed by UUID, so repeated requests reuse one object. It
// also owns the annotation store, forwards bundle registration to the
// registrar, follows its install and uninstall batches, and empties the
// cache when the user's locale changes.
//
// Queues: the cache and every use of the annotation store belong to the
// serial queue "TNDatabase". Lookups and the annotation wrappers enter it
// synchronously (so they must not be called from a task already on it);
// createPlugInForProxy, purgeCachesToLimit and autoElect run only on it.
// Registration, path and application lookups run on the caller's thread.
//
// The purge policy is all-or-nothing: an insertion that finds more than
// cacheLimit entries empties the cache (and the registrar's schema caches)
// first, so the cache never holds more than cacheLimit + 1 plug-ins.

#include <atomic>
#include <cstdint>
#include <mutex>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "libtenon/registrar/RegistrarLookup.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/locale/Locale.h"
#include "platform/registrar/Registrar.h"
#include "platform/value/Error.h"
#include "platform/value/URL.h"
#include "platform/value/UUID.h"
#include "tenond/database/TNDAnnotationStore.h"
#include "tenond/plugin/TNDPlugIn.h"

namespace tnd {

// Told about plug-ins that the registrar is about to uninstall, after the
// cache has let go of them and outside the database queue.
class TNDatabaseDelegate {
 public:
  virtual ~TNDatabaseDelegate() = default;
  virtual void removedPlugIns(const registrar::PlugInList& records) = 0;
};

class TNDatabase {
 public:
  // The auto-elect entitlement (Part of the install events).
  static constexpr const char* kAutoElectEntitlement = "com.ostrel.developer.auto-elect-plugin";
  static constexpr const char* kAnnotationChangeNotification = "com.ostrel.tenon.annotation-change";

  virtual ~TNDatabase();
  TNDatabase(const TNDatabase&) = delete;
  TNDatabase& operator=(const TNDatabase&) = delete;

  // --- Lookups ---

  // The cached plug-in for the record's UUID, or one built from the record.
  std::shared_ptr<TNDPlugIn> plugInForProxy(const registrar::PlugInPtr& record);
  // The cached plug-in, or one built from the registrar's record of the
  // UUID; none (logged) when the registrar does not know it.
  std::shared_ptr<TNDPlugIn> findPlugIn(const tn::UUID& uuid);
  // findPlugIn of the UUID the registrar reports for the bundle at `url`;
  // none (logged) when it knows no plug-in there.
  std::shared_ptr<TNDPlugIn> findPlugInAtPath(const tn::URL& url);
  // The usable plug-ins of the application at `url`, in the registrar's
  // order; none when it has no plug-ins (or is unknown).
  std::optional<std::vector<std::shared_ptr<TNDPlugIn>>> plugInsWithinApplication(const tn::URL& url);

  // The discovery query (RegistryQuery.cpp): the installed plug-ins that
  // may satisfy `rules` (a dictionary or null: every plug-in), narrowed by
  // the registrar and by the election filter of the rules'
  // "XTUserElection" entry (ElectionFilter.h), as cached plug-ins, each
  // once, in the registrar's order. Records of placeholder applications are
  // skipped. None when the registrar answered none (rules of another kind).
  // On the service queue; never on the database queue.
  std::optional<std::vector<std::shared_ptr<TNDPlugIn>>> findPlugIns(const tn::Value& rules);

  // --- Registration (the registrar's) ---

  // None on success; else Tenon error 2 "Registrar failed to register the
  // plug-in" (the registrar's reason is logged).
  std::optional<tn::Error> addPlugIn(const tn::URL& url);
  // None on success; else Tenon error 2 "Registrar failed to deregister the
  // plug-in".
  std::optional<tn::Error> removePlugIn(const tn::URL& url);

  // --- Annotations ---

  using AnnotationSave = TNDAnnotationStore::Save;

  std::optional<tn::Dictionary> annotationForPlugIn(const TNDPlugIn& plugIn);
  // Merges (or with none removes) the plug-in's annotation and saves the
  // file, or with AnnotationSave::Deferred leaves the save to
  // saveAnnotations(). A failed save is logged, never reported. The one
  // error: an annotation beyond the store's bounds, refused with nothing
  // changed (TNDAnnotationStore::setAnnotation). Does not post the change
  // notification.
  std::optional<tn::Error> setAnnotation(const std::optional<tn::Dictionary>& annotation, const TNDPlugIn& plugIn,
                                         AnnotationSave save = AnnotationSave::Now);
  // Writes the annotation file when a change has not reached it yet: a
  // request that deferred its saves calls this before it answers.
  void saveAnnotations();
  // Posts "com.ostrel.tenon.annotation-change".
  void notifyAnnotationChange();
  // On the database queue: elects a plug-in that carries the auto-elect
  // entitlement unless a non-zero election is stored.
  void autoElect(const TNDPlugIn& plugIn);

  // --- Install events (registrar observer callbacks) ---

  void pluginsDidInstall(const registrar::PlugInList& records);
  void pluginsWillUninstall(const registrar::PlugInList& records);

  // --- Properties ---

  uint32_t cacheLimit() const { return cacheLimit_.load(); }
  void setCacheLimit(uint32_t limit) { cacheLimit_.store(limit); }
  std::weak_ptr<TNDatabaseDelegate> delegate() const;
  void setDelegate(std::weak_ptr<TNDatabaseDelegate> delegate);
  const std::string& annotationsPath() const { return annotations_->annotationsPath(); }
  const std::shared_ptr<registrar::Registrar>& workspace() const { return workspace_; }
  const std::shared_ptr<tn::dispatch::SerialQueue>& databaseQueue() const { return sync_; }
  const tn::TNRegistryLookup& registryLookup() const { return *lookup_; }
  // The number of cached plug-ins (read on the database queue).
  size_t cacheCount();

 protected:
  TNDatabase();

  // Opens the registrar of $TENON_ROOT (read-write, scanning the roots and
  // watching them), creates the annotation store with `path` (none: the
  // default location), registers as the registrar's observer and for
  // locale changes on `localeQueue` (the main queue in the daemon). False
  // (logged) when the registrar cannot be opened or the annotation file's
  // directory cannot be made.
  bool initWithDatabase(const std::optional<std::string>& path,
                        std::shared_ptr<tn::dispatch::SerialQueue> localeQueue);

 private:
  class RegistrarObserver;

  // On the database queue.
  std::shared_ptr<TNDPlugIn> createPlugInForProxy(const registrar::PlugInPtr& record);
  void purgeCachesToLimit(uint32_t limit);
  std::shared_ptr<TNDPlugIn> cachedPlugIn(const tn::UUID& uuid);
  void localeChanged(const std::string& locale);
  // The registrar's answer to the discovery query (RegistryQuery.cpp).
  std::optional<registrar::PlugInList> queryRegistrar(const tn::Value& rules);

  std::shared_ptr<registrar::Registrar> workspace_;
  std::unique_ptr<tn::RegistrarLookup> lookup_;
  std::unique_ptr<TNDAnnotationStore> annotations_;  // used on sync_ only
  std::unordered_map<tn::UUID, std::shared_ptr<TNDPlugIn>> cache_;  // sync_ only
  std::shared_ptr<tn::dispatch::SerialQueue> sync_;
  std::shared_ptr<RegistrarObserver> observer_;
  std::unique_ptr<locale::LocaleWatcher> regionObserver_;
  std::atomic<uint32_t> cacheLimit_{0};
  mutable std::mutex delegateMutex_;
  std::weak_ptr<TNDatabaseDelegate> delegate_;  // guarded by delegateMutex_
};

}  // namespace tnd
