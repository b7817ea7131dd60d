#include "tenond/database/TNDatabase.h"

#include <filesystem>
#include <system_error>

#include "libtenon/model/SmallDictionaryChanges.h"
#include "platform/log/Log.h"
#include "platform/notify/Post.h"
#include "tenond/QueueRanks.h"

namespace tnd {

// Forwards the registrar's batches to the database. The registrar holds
// observers weakly; the database owns this one and outlives it.
class TNDatabase::RegistrarObserver final : public registrar::RegistrarObserver {
 public:
  explicit RegistrarObserver(TNDatabase& database) : database_(database) {}
  void pluginsDidInstall(const registrar::PlugInList& plugIns) override { database_.pluginsDidInstall(plugIns); }
  void pluginsWillUninstall(const registrar::PlugInList& plugIns) override {
    database_.pluginsWillUninstall(plugIns);
  }

 private:
  TNDatabase& database_;
};

namespace {

// "com.example.a com.example.a.share(1.0) <UUID> <path>"
std::string describe(const registrar::PlugInRecord& record) {
  return fmt::format("{} {}({}) {} {}", record.bundleIdentifier().value_or("(null)"), record.identifier(),
                     record.bundleVersion().value_or("(null)"), record.uuid().string(), record.bundlePath());
}

bool annotationDirectoryUsable(const std::string& annotationsPath) {
  const std::filesystem::path directory = std::filesystem::path(annotationsPath).parent_path();
  if (directory.empty()) return true;  // a bare file name lives in the working directory
  std::error_code error;
  std::filesystem::create_directories(directory, error);
  if (error || !std::filesystem::is_directory(directory)) {
    TN_LOG_ERROR(tn::log::ops(), "cannot use {} for the annotation file: {}", directory.string(),
                 error ? error.message() : std::string("not a directory"));
    return false;
  }
  return true;
}

}  // namespace

TNDatabase::TNDatabase() = default;

TNDatabase::~TNDatabase() {
  if (workspace_ && observer_) workspace_->removeObserver(observer_.get());
}

bool TNDatabase::initWithDatabase(const std::optional<std::string>& path,
                                  std::shared_ptr<tn::dispatch::SerialQueue> localeQueue) {
  // The annotation file's place is checked first: it costs nothing, and a
  // daemon that could never save a choice should not scan anything.
  if (!annotationDirectoryUsable(path ? *path : TNDAnnotationStore::defaultDatabasePath())) return false;
  sync_ = tn::dispatch::SerialQueue::create("TNDatabase");
  sync_->setLockRank(kLeafQueueRank);
  // The annotation file is read on the database queue while the registrar
  // opens its store here: they are a warm start's two largest reads, and
  // nothing sees the store before the queue has loaded it, since every use
  // of it is on that queue (the registrar's install events included).
  sync_->async([this, path] { annotations_ = std::make_unique<TNDAnnotationStore>(path); });
  // The observer is in place before the registrar verifies its store in
  // the background (a warm start answers from the store at once), so a
  // bundle changed while the daemon was down is announced like any install.
  observer_ = std::make_shared<RegistrarObserver>(*this);
  registrar::Registrar::Options options;
  options.initialScan = registrar::Registrar::InitialScan::Auto;
  options.observers.push_back(observer_);
  tn::Result<std::shared_ptr<registrar::Registrar>> opened =
      registrar::Registrar::open(registrar::RegistrarPaths::fromEnvironment(), std::move(options));
  sync_->sync([] {});  // the annotations are loaded when this returns, whatever it answers
  if (!opened) {
    TN_LOG_ERROR(tn::log::ops(), "cannot open the registrar: {}", opened.error().localizedDescription());
    return false;
  }
  workspace_ = *opened;
  lookup_ = std::make_unique<tn::RegistrarLookup>(workspace_);
  if (localeQueue) {
    auto watcher = locale::LocaleWatcher::create(localeQueue, [this](const std::string& now) { localeChanged(now); });
    if (watcher) {
      regionObserver_ = std::move(*watcher);
    } else {
      TN_LOG_ERROR(tn::log::ops(), "locale changes will not be seen: {}", watcher.error().localizedDescription());
    }
  }
  return true;
}

std::weak_ptr<TNDatabaseDelegate> TNDatabase::delegate() const {
  const std::lock_guard lock(delegateMutex_);
  return delegate_;
}

void TNDatabase::setDelegate(std::weak_ptr<TNDatabaseDelegate> delegate) {
  const std::lock_guard lock(delegateMutex_);
  delegate_ = std::move(delegate);
}

size_t TNDatabase::cacheCount() {
  return sync_->sync([&] { return cache_.size(); });
}

// --- Lookups -----------------------------------------------------------

std::shared_ptr<TNDPlugIn> TNDatabase::cachedPlugIn(const tn::UUID& uuid) {
  sync_->assertOnQueue();
  const auto found = cache_.find(uuid);
  if (found != cache_.end() && found->second->isStillValid()) return found->second;
  cache_.erase(uuid);
  return nullptr;
}

std::shared_ptr<TNDPlugIn> TNDatabase::plugInForProxy(const registrar::PlugInPtr& record) {
  if (!record) return nullptr;
  return sync_->sync([&]() -> std::shared_ptr<TNDPlugIn> {
    if (auto cached = cachedPlugIn(record->uuid())) return cached;
    return createPlugInForProxy(record);
  });
}

std::shared_ptr<TNDPlugIn> TNDatabase::findPlugIn(const tn::UUID& uuid) {
  return sync_->sync([&]() -> std::shared_ptr<TNDPlugIn> {
    if (auto cached = cachedPlugIn(uuid)) return cached;
    registrar::PlugInPtr record = workspace_->plugInForUUID(uuid);
    if (!record) {
      TN_LOG_INFO(tn::log::ops(), "Registrar cannot find plug-in with UUID:{}", uuid.string());
      return nullptr;
    }
    return createPlugInForProxy(record);
  });
}

std::shared_ptr<TNDPlugIn> TNDatabase::findPlugInAtPath(const tn::URL& url) {
  registrar::PlugInPtr record = workspace_->plugInForURL(url);
  if (!record) {
    TN_LOG_INFO(tn::log::ops(), "Registrar cannot find plug-in at path:{}", url.path());
    return nullptr;
  }
  return findPlugIn(record->uuid());
}

std::optional<std::vector<std::shared_ptr<TNDPlugIn>>> TNDatabase::plugInsWithinApplication(const tn::URL& url) {
  registrar::AppPtr app = workspace_->applicationForURL(url);
  if (!app) return std::nullopt;
  const registrar::PlugInList records = workspace_->plugInsOfApplication(*app);
  if (records.empty()) return std::nullopt;
  std::vector<std::shared_ptr<TNDPlugIn>> plugIns;
  for (const registrar::PlugInPtr& record : records) {
    if (auto plugIn = plugInForProxy(record)) plugIns.push_back(std::move(plugIn));
  }
  return plugIns;
}

std::shared_ptr<TNDPlugIn> TNDatabase::createPlugInForProxy(const registrar::PlugInPtr& record) {
  sync_->assertOnQueue();
  TN_LOG_DEFAULT(tn::log::ops(), "createPlugInForProxy");
  std::shared_ptr<TNDPlugIn> plugIn = TNDPlugIn::initWithRGData(record, workspace_, *lookup_);
  if (!plugIn) return nullptr;
  if (plugIn->hasEntitlement(kAutoElectEntitlement)) autoElect(*plugIn);
  purgeCachesToLimit(cacheLimit());
  cache_[*plugIn->uuid()] = plugIn;
  return plugIn;
}

void TNDatabase::purgeCachesToLimit(uint32_t limit) {
  sync_->assertOnQueue();
  if (cache_.size() <= limit) return;
  TN_LOG_INFO(tn::log::ops(), "purging cache for {} > {}", cache_.size(), limit);
  cache_.clear();
  workspace_->clearSchemaCaches();
}

void TNDatabase::localeChanged(const std::string& locale) {
  TN_LOG_DEFAULT(tn::log::ops(), "locale change detected; purging cache");
  // New records carry names in the new language; the purge makes the
  // following requests build from them.
  workspace_->setLocale(locale);
  sync_->async([this] { purgeCachesToLimit(0); });
}

// --- Registration --------------------------------------------------------

std::optional<tn::Error> TNDatabase::addPlugIn(const tn::URL& url) {
  if (tn::Result<void> registered = workspace_->registerPlugIn(url); !registered) {
    TN_LOG_INFO(tn::log::rg(), "registrar refused {}: {}", url.path(), registered.error().localizedDescription());
    return tn::TNMakeError(2, std::string("Registrar failed to register the plug-in"));
  }
  return std::nullopt;
}

std::optional<tn::Error> TNDatabase::removePlugIn(const tn::URL& url) {
  if (tn::Result<void> removed = workspace_->unregisterPlugIn(url); !removed) {
    TN_LOG_INFO(tn::log::rg(), "registrar refused to unregister {}: {}", url.path(),
                removed.error().localizedDescription());
    return tn::TNMakeError(2, std::string("Registrar failed to deregister the plug-in"));
  }
  return std::nullopt;
}

// --- Annotations -----------------------------------------------------------

std::optional<tn::Dictionary> TNDatabase::annotationForPlugIn(const TNDPlugIn& plugIn) {
  const std::string key = plugIn.annotationKey();
  return sync_->sync([&] { return annotations_->annotationForIdentifier(key); });
}

std::optional<tn::Error> TNDatabase::setAnnotation(const std::optional<tn::Dictionary>& annotation,
                                                   const TNDPlugIn& plugIn, AnnotationSave save) {
  const std::string key = plugIn.annotationKey();
  return sync_->sync([&] { return annotations_->setAnnotation(annotation, key, save); });
}

void TNDatabase::saveAnnotations() {
  sync_->sync([&] { annotations_->saveIfNeeded(); });
}

void TNDatabase::notifyAnnotationChange() {
  if (auto posted = notify::post(kAnnotationChangeNotification); !posted) {
    TN_LOG_ERROR(tn::log::ops(), "cannot post {}: {}", kAnnotationChangeNotification,
                 posted.error().localizedDescription());
  }
}

void TNDatabase::autoElect(const TNDPlugIn& plugIn) {
  sync_->assertOnQueue();
  const std::string key = plugIn.annotationKey();
  const tn::Dictionary annotation = annotations_->annotationForIdentifier(key).value_or(tn::Dictionary());
  if (const tn::Value* election = annotation.find("election")) {
    // Compared by value, never through a converted integer: 0.5 is not 0,
    // and a huge or NaN number must not be converted at all.
    if (election->isNumber() && *election != tn::Value(0)) return;
  }
  // An entry within bounds stays within them with one number changed.
  (void)annotations_->setAnnotation(tn::dictionaryChanging(annotation, "election", tn::Value(1)), key);
}

// --- Install events ----------------------------------------------------------

void TNDatabase::pluginsDidInstall(const registrar::PlugInList& records) {
  for (const registrar::PlugInPtr& record : records) {
    TN_LOG_DEFAULT(tn::log::ops(), "plug-in INSTALLED:{}", describe(*record));
  }
}

void TNDatabase::pluginsWillUninstall(const registrar::PlugInList& records) {
  sync_->sync([&] {
    for (const registrar::PlugInPtr& record : records) {
      TN_LOG_DEFAULT(tn::log::ops(), "plug-in UNINSTALLED:{}", describe(*record));
      cache_.erase(record->uuid());
    }
  });
  if (auto told = delegate().lock()) told->removedPlugIns(records);
}

}  // namespace tnd
