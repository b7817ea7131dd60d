#include "platform/registrar/Registrar.h"
#include "platform/locale/Locale.h"

#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <algorithm>
#include <filesystem>

#include <fmt/format.h>

#include "platform/bundle/BundleLayout.h"
#include "platform/bundle/BundlePaths.h"
#include "platform/bundle/ManifestFile.h"
#include "platform/dispatch/ThreadPool.h"
#include "platform/log/Log.h"
#include "platform/registrar/BundleReader.h"
#include "platform/registrar/ChangeScope.h"
#include "platform/registrar/InstallWatcher.h"
#include "platform/registrar/Locale.h"
#include "platform/registrar/QueryNarrowing.h"
#include "platform/registrar/RegistrarState.h"
#include "platform/registrar/Scanner.h"

namespace registrar {

namespace {

using StatePtr = std::shared_ptr<const State>;

AppPtr makeAppRecord(const StoredApp& stored, const State& state, const RegistrarPaths& paths,
                     std::vector<tn::UUID> plugIns) {
  AppRecord::Fields fields;
  fields.bundlePath = stored.path;
  if (const std::string* identifier = stored.info[kBundleIdentifierKey].string()) fields.identifier = *identifier;
  fields.localizedName = localizedNames(stored.localizations, state.languages, stored.info, stored.path).name;
  fields.placeholder = stored.placeholder;
  fields.onSystemPartition = paths.onSystemPartition(stored.path);
  fields.infoDictionary = stored.info;
  fields.plugInUUIDs = std::move(plugIns);
  return std::make_shared<const AppRecord>(std::move(fields));
}

PlugInPtr makePlugInRecord(const StoredPlugIn& stored, AppPtr app, const State& state, const RegistrarPaths& paths) {
  PlugInRecord::Fields fields;
  fields.uuid = stored.uuid;
  fields.bundlePath = stored.path;
  fields.containingApp = std::move(app);
  if (const std::string* identifier = stored.info[kBundleIdentifierKey].string()) {
    fields.bundleIdentifier = *identifier;
  }
  fields.identifier = stored.identifier;
  if (const std::string* version = stored.info[kBundleVersionKey].string()) fields.bundleVersion = *version;
  fields.plugInDictionary = stored.info[kExtensionKey];
  fields.infoDictionary = stored.info;
  fields.registrationDate = stored.registered;
  fields.onSystemPartition = paths.onSystemPartition(stored.path);
  const LocalizedNames names = localizedNames(stored.localizations, state.languages, stored.info, stored.path);
  fields.localizedName = names.name;
  fields.localizedShortName = names.shortName;
  fields.entitlements = stored.entitlements.isDictionary() ? stored.entitlements : tn::Value(tn::Dictionary());
  fields.dataContainerPath = stored.container;
  fields.registeredByURL = stored.registeredByURL;
  return std::make_shared<const PlugInRecord>(std::move(fields));
}

bool sameApp(const StoredApp& a, const StoredApp& b) { return a.fingerprint == b.fingerprint && a.sameContents(b); }

bool samePlugIn(const StoredPlugIn& a, const StoredPlugIn& b) {
  return a.uuid == b.uuid && a.fingerprint == b.fingerprint && a.container == b.container && a.sameContents(b);
}

// Builds the state for the stored facts. Records of previous are reused
// where neither their facts nor their application's record changed, so an
// unchanged rescan makes no new records.
StatePtr buildState(std::map<std::string, StoredApp> apps, std::map<std::string, StoredPlugIn> plugIns,
                    std::map<std::string, StoredExtensionPoint> points, tn::UUID knowledge, std::string locale,
                    const State* previous, const RegistrarPaths& paths) {
  auto state = std::make_shared<State>();
  state->knowledge = knowledge;
  state->locale = std::move(locale);
  state->languages = languageChain(state->locale);
  const bool sameLocale = previous != nullptr && previous->locale == state->locale;

  std::map<std::string, std::vector<tn::UUID>> appPlugIns;
  for (const auto& [path, plugIn] : plugIns) {
    if (plugIn.appPath) appPlugIns[*plugIn.appPath].push_back(plugIn.uuid);
  }
  for (const auto& [path, app] : apps) {
    std::vector<tn::UUID>& uuids = appPlugIns[path];
    if (sameLocale) {
      const auto old = previous->apps.find(path);
      const auto oldStored = previous->storedApps.find(path);
      if (old != previous->apps.end() && sameApp(oldStored->second, app) && old->second->plugInUUIDs() == uuids) {
        state->apps.emplace(path, old->second);
        continue;
      }
    }
    state->apps.emplace(path, makeAppRecord(app, *state, paths, uuids));
  }
  for (const auto& [path, plugIn] : plugIns) {
    AppPtr app;
    if (plugIn.appPath) {
      if (auto found = state->apps.find(*plugIn.appPath); found != state->apps.end()) app = found->second;
    }
    PlugInPtr record;
    if (sameLocale) {
      const auto old = previous->plugIns.find(path);
      if (old != previous->plugIns.end() && old->second->containingApp() == app &&
          samePlugIn(previous->storedPlugIns.at(path), plugIn)) {
        record = old->second;
      }
    }
    if (!record) record = makePlugInRecord(plugIn, app, *state, paths);
    state->plugIns.emplace(path, record);
    state->byUUID.emplace(record->uuid(), record);
    state->byIdentifierKey.emplace(equalityKey(record->identifier()), record);
  }
  for (const auto& [identifier, point] : points) {
    state->points.emplace(identifier, std::make_shared<const ExtensionPointRecord>(point.identifier, point.path,
                                                                                  point.sdk));
  }
  state->storedApps = std::move(apps);
  state->storedPlugIns = std::move(plugIns);
  state->storedPoints = std::move(points);
  return state;
}

StatePtr stateFromContents(Store::Contents contents, const std::string& locale, const RegistrarPaths& paths) {
  std::map<std::string, StoredApp> apps;
  std::map<std::string, StoredPlugIn> plugIns;
  std::map<std::string, StoredExtensionPoint> points;
  for (StoredApp& app : contents.apps) apps.emplace(app.path, std::move(app));
  for (StoredPlugIn& plugIn : contents.plugIns) plugIns.emplace(plugIn.path, std::move(plugIn));
  for (StoredExtensionPoint& point : contents.extensionPoints) points.emplace(point.identifier, std::move(point));
  return buildState(std::move(apps), std::move(plugIns), std::move(points), contents.knowledge, locale, nullptr,
                    paths);
}

// A path with a NUL names nothing: the file system would see only the part
// before it, which may be another bundle.
bool namesNothing(const std::string& path) { return path.find('\0') != std::string::npos; }

std::string resolvedPath(const std::string& path) {
  char resolved[PATH_MAX];
  if (::realpath(path.c_str(), resolved) != nullptr) return resolved;
  return path;
}

}  // namespace

tn::Result<std::shared_ptr<Registrar>> Registrar::open(const RegistrarPaths& paths, Options options) {
  const bool readOnly = options.mode == Mode::ReadOnly;
  tn::Result<Store::Opened> opened = Store::open(paths.storeFile, readOnly ? Store::Mode::ReadOnly
                                                                             : Store::Mode::ReadWrite);
  if (!opened) return opened.error();
  const std::string locale = options.locale.value_or(locale::currentLocale(paths.localeFile));
  // Held weakly like every observer: the registrar keeps no reference.
  const std::vector<std::shared_ptr<RegistrarObserver>> observers = std::move(options.observers);
  options.observers.clear();
  auto registrar = std::make_shared<Registrar>(CreateTag(), paths, options, std::move(opened->store));
  registrar->installState(stateFromContents(std::move(opened->contents), locale, paths));
  TN_LOG_INFO(tn::log::rg(), "opened registrar store {} ({} plug-ins, knowledge {})", paths.storeFile,
              registrar->state()->plugIns.size(), registrar->knowledgeUUID());
  if (readOnly) return registrar;
  if (options.watch) registrar->startWatching();
  InitialScan initialScan = options.initialScan;
  if (opened->rebuilt && initialScan == InitialScan::None) initialScan = InitialScan::Wait;
  if (initialScan == InitialScan::Auto) {
    const StatePtr current = registrar->state();
    const bool empty = current->storedApps.empty() && current->storedPlugIns.empty() && current->storedPoints.empty();
    initialScan = empty || opened->rebuilt ? InitialScan::Wait : InitialScan::Background;
  }
  if (initialScan == InitialScan::Wait) {
    if (tn::Result<ScanSummary> scanned = registrar->firstScan(); !scanned) return scanned.error();
  }
  for (const std::shared_ptr<RegistrarObserver>& observer : observers) registrar->addObserver(observer);
  if (initialScan == InitialScan::Background) {
    ChangeScope everything;
    everything.everything = true;
    registrar->scheduleRescan(everything);
  }
  return registrar;
}

Registrar::Registrar(CreateTag, RegistrarPaths paths, Options options, std::unique_ptr<Store> store)
    : paths_(std::move(paths)),
      options_(std::move(options)),
      store_(std::move(store)),
      queue_(tn::dispatch::SerialQueue::create("registrar")),
      observerQueue_(tn::dispatch::SerialQueue::create("registrar-observers")),
      pendingScope_(std::make_unique<ChangeScope>()) {}

Registrar::~Registrar() {
  watcher_.reset();
  // The last reference may go at the end of a block of either queue (an
  // observer holding the registrar); that block has then finished its work.
  if (!queue_->isCurrent()) queue_->sync([] {});
  if (!observerQueue_->isCurrent()) observerQueue_->sync([] {});
}

StatePtr Registrar::state() const {
  const std::lock_guard lock(stateMutex_);
  return state_;
}

void Registrar::installState(StatePtr state) {
  const std::lock_guard lock(stateMutex_);
  state_ = std::move(state);
}

tn::UUID Registrar::knowledgeUUID() const { return state()->knowledge; }

PlugInPtr Registrar::plugInForUUID(const tn::UUID& uuid) const {
  const std::lock_guard lock(stateMutex_);
  if (auto found = state_->byUUID.find(uuid); found != state_->byUUID.end()) return found->second;
  if (auto found = lingering_.find(uuid); found != lingering_.end()) return found->second;
  return nullptr;
}

std::string Registrar::normalisedPath(const tn::URL& url) const { return bundle::absoluteBundlePath(url.path()); }

PlugInPtr Registrar::plugInForURL(const tn::URL& url) const {
  if (!url.isFileURL() && !url.scheme().empty()) return nullptr;
  const StatePtr current = state();
  const std::string path = normalisedPath(url);
  if (namesNothing(path)) return nullptr;
  if (auto found = current->plugIns.find(path); found != current->plugIns.end()) return found->second;
  if (auto found = current->plugIns.find(resolvedPath(path)); found != current->plugIns.end()) return found->second;
  return nullptr;
}

AppPtr Registrar::applicationForURL(const tn::URL& url) const {
  if (!url.isFileURL() && !url.scheme().empty()) return nullptr;
  const StatePtr current = state();
  const std::string path = normalisedPath(url);
  if (namesNothing(path)) return nullptr;
  if (auto found = current->apps.find(path); found != current->apps.end()) return found->second;
  if (auto found = current->apps.find(resolvedPath(path)); found != current->apps.end()) return found->second;
  return nullptr;
}

PlugInList Registrar::plugInsOfApplication(const AppRecord& app) const {
  const StatePtr current = state();
  PlugInList plugIns;
  for (const tn::UUID& uuid : app.plugInUUIDs()) {
    if (auto found = current->byUUID.find(uuid); found != current->byUUID.end()) plugIns.push_back(found->second);
  }
  return plugIns;
}

PlugInList Registrar::installedPlugIns() const {
  const StatePtr current = state();
  PlugInList plugIns;
  plugIns.reserve(current->plugIns.size());
  for (const auto& [path, plugIn] : current->plugIns) plugIns.push_back(plugIn);
  return plugIns;
}

std::vector<AppPtr> Registrar::applications() const {
  const StatePtr current = state();
  std::vector<AppPtr> apps;
  apps.reserve(current->apps.size());
  for (const auto& [path, app] : current->apps) apps.push_back(app);
  return apps;
}

ExtensionPointPtr Registrar::extensionPoint(std::string_view identifier) const {
  const StatePtr current = state();
  if (auto found = current->points.find(identifier); found != current->points.end()) return found->second;
  return nullptr;
}

std::vector<ExtensionPointPtr> Registrar::extensionPoints() const {
  const StatePtr current = state();
  std::vector<ExtensionPointPtr> points;
  for (const auto& [identifier, point] : current->points) points.push_back(point);
  return points;
}

std::optional<PlugInList> Registrar::queryPlugIns(const tn::Value& rules, const Filter& filter) const {
  if (!rules.isNull() && !rules.isDictionary()) return std::nullopt;
  const StatePtr current = state();
  PlugInList candidates;
  if (const std::optional<std::vector<std::string>> keys = identifierKeys(rules)) {
    for (const std::string& key : *keys) {
      const auto [first, last] = current->byIdentifierKey.equal_range(key);
      for (auto it = first; it != last; ++it) candidates.push_back(it->second);
    }
    std::sort(candidates.begin(), candidates.end(),
              [](const PlugInPtr& a, const PlugInPtr& b) { return a->bundlePath() < b->bundlePath(); });
    candidates.erase(std::unique(candidates.begin(), candidates.end()), candidates.end());
  } else {
    candidates.reserve(current->plugIns.size());
    for (const auto& [path, plugIn] : current->plugIns) candidates.push_back(plugIn);
  }
  PlugInList result;
  for (const PlugInPtr& plugIn : candidates) {
    if (!mayMatch(rules, *plugIn)) continue;
    if (!filter || filter(plugIn->identifier(), plugIn->entitlements())) result.push_back(plugIn);
  }
  return result;
}

std::optional<LocalizedStrings> Registrar::localizedStrings(const std::string& bundlePath, std::string_view table,
                                                            const std::set<std::string, std::less<>>& keys) const {
  std::vector<std::string> languages = state()->languages;
  languages.emplace_back(kBaseLanguage);
  return const_cast<StringsTables&>(stringsTables_).lookup(bundle::absoluteBundlePath(bundlePath), table,
                                                            languages, keys);
}

void Registrar::clearSchemaCaches() {
  stringsTables_.clear();
  TN_LOG_DEBUG(tn::log::rg(), "cleared schema caches");
}

std::string Registrar::locale() const { return state()->locale; }

void Registrar::setLocale(const std::string& locale) {
  queue_->sync([&] {
    const StatePtr current = state();
    if (current->locale == locale) return;
    installState(buildState(current->storedApps, current->storedPlugIns, current->storedPoints, current->knowledge,
                            locale, current.get(), paths_));
    stringsTables_.clear();
    TN_LOG_DEFAULT(tn::log::rg(), "locale is now \"{}\"", locale);
  });
}

tn::Result<ScanSummary> Registrar::scan(const Progress& progress) {
  if (options_.mode == Mode::ReadOnly) {
    return registrarError(RegistrarErrorCode::ReadOnly, "the registrar was opened read-only");
  }
  return queue_->sync([&] { return scanOnQueue(progress); });
}

tn::Result<ScanSummary> Registrar::scanOnQueue(const Progress& progress) {
  queue_->assertOnQueue();
  // A fifth of a second on 10,000 plug-ins: requests must not wait for it
  // to notice their sockets.
  tn::dispatch::ThreadPool::willRunLongTask();
  for (int attempt = 0;; ++attempt) {
    Scanner scanner(*state(), paths_, watcher_.get(), true);
    scanner.scanRoots(progress);
    scanner.scanRegistered();
    scanner.scanExtensionPoints();
    tn::Result<ScanSummary> summary = commit(scanner.plan);
    if (summary) {
      summary->examined = scanner.examined;
      summary->read = scanner.read;
      const std::lock_guard lock(stateMutex_);
      lastScan_ = *summary;
    }
    if (summary || summary.error().code() != static_cast<int64_t>(RegistrarErrorCode::StaleKnowledge) ||
        attempt > 0) {
      return summary;
    }
    // Another process (tnctl registry scan) wrote the store: start from its contents.
    tn::Result<Store::Contents> contents = store_->load();
    if (!contents) return contents.error();
    installState(stateFromContents(std::move(*contents), state()->locale, paths_));
  }
}

// Writes what changed between the current state and the plan, then makes
// the plan the current state and tells observers.
tn::Result<ScanSummary> Registrar::commit(ScanPlan& plan) {
  const StatePtr current = state();
  Store::Changes changes;
  changes.expectedKnowledge = current->knowledge;
  bool contentsChanged = false;
  PlugInList uninstalled;
  std::vector<tn::UUID> installedUUIDs;

  for (const auto& [path, old] : current->storedPlugIns) {
    const auto now = plan.plugIns.find(path);
    if (now == plan.plugIns.end() || now->second.uuid != old.uuid) {
      changes.removedPlugIns.push_back(old.uuid);
      uninstalled.push_back(current->plugIns.at(path));
    }
  }
  for (const auto& [path, plugIn] : plan.plugIns) {
    const auto old = current->storedPlugIns.find(path);
    const bool fresh = old == current->storedPlugIns.end() || old->second.uuid != plugIn.uuid;
    if (fresh) installedUUIDs.push_back(plugIn.uuid);
    if (fresh || !samePlugIn(old->second, plugIn)) changes.putPlugIns.push_back(plugIn);
  }
  for (const auto& [path, old] : current->storedApps) {
    if (!plan.apps.contains(path)) {
      changes.removedApps.push_back(path);
      contentsChanged = true;
    }
  }
  for (const auto& [path, app] : plan.apps) {
    const auto old = current->storedApps.find(path);
    if (old != current->storedApps.end() && sameApp(old->second, app)) continue;
    changes.putApps.push_back(app);
    if (old == current->storedApps.end() || !old->second.sameContents(app)) contentsChanged = true;
  }
  for (const auto& [identifier, old] : current->storedPoints) {
    if (!plan.points.contains(identifier)) {
      changes.removedExtensionPoints.push_back(identifier);
      contentsChanged = true;
    }
  }
  for (const auto& [identifier, point] : plan.points) {
    const auto old = current->storedPoints.find(identifier);
    if (old != current->storedPoints.end() && old->second.fingerprint == point.fingerprint) continue;
    changes.putExtensionPoints.push_back(point);
    if (old == current->storedPoints.end() || !tn::Value::identical(old->second.sdk, point.sdk) ||
        old->second.path != point.path) {
      contentsChanged = true;
    }
  }
  contentsChanged = contentsChanged || !uninstalled.empty() || !installedUUIDs.empty();
  if (contentsChanged) changes.newKnowledge = tn::UUID::random();

  if (tn::Result<void> written = store_->apply(changes); !written) {
    if (written.error().code() != static_cast<int64_t>(RegistrarErrorCode::StaleKnowledge)) {
      TN_LOG_ERROR(tn::log::rg(), "cannot write the registrar store: {}", written.error());
    }
    return written.error();
  }

  ScanSummary summary;
  summary.installed = installedUUIDs.size();
  summary.uninstalled = uninstalled.size();
  summary.skipped = plan.skipped;
  summary.changed = contentsChanged;
  if (changes.empty()) {
    summary.applications = current->apps.size();
    summary.plugIns = current->plugIns.size();
    return summary;
  }
  StatePtr next = buildState(std::move(plan.apps), std::move(plan.plugIns), std::move(plan.points),
                             changes.newKnowledge.value_or(current->knowledge), current->locale, current.get(), paths_);
  summary.applications = next->apps.size();
  summary.plugIns = next->plugIns.size();
  PlugInList installed;
  for (const tn::UUID& uuid : installedUUIDs) installed.push_back(next->byUUID.at(uuid));
  {
    const std::lock_guard lock(stateMutex_);
    for (const PlugInPtr& plugIn : uninstalled) lingering_.emplace(plugIn->uuid(), plugIn);
    state_ = next;
  }
  for (const PlugInPtr& plugIn : uninstalled) {
    TN_LOG_INFO(tn::log::rg(), "uninstalled plug-in {} {} at {}", plugIn->identifier(), plugIn->uuid(),
                plugIn->bundlePath());
  }
  for (const PlugInPtr& plugIn : installed) {
    TN_LOG_INFO(tn::log::rg(), "installed plug-in {} {} at {}", plugIn->identifier(), plugIn->uuid(),
                plugIn->bundlePath());
  }
  if (!uninstalled.empty()) deliver(std::move(uninstalled), false);
  if (!installed.empty()) deliver(std::move(installed), true);
  return summary;
}

void Registrar::deliver(PlugInList plugIns, bool install) {
  // Observers hear of the changes made after they were added: the list is
  // taken now, not when the batch is delivered.
  std::vector<std::weak_ptr<RegistrarObserver>> observers;
  {
    const std::lock_guard lock(observersMutex_);
    std::erase_if(observers_, [](const std::weak_ptr<RegistrarObserver>& o) { return o.expired(); });
    observers = observers_;
  }
  std::weak_ptr<Registrar> weakSelf = weak_from_this();
  observerQueue_->async([weakSelf, observers = std::move(observers), plugIns = std::move(plugIns), install] {
    // Declared first, released last: the registrar may end with this block.
    const std::shared_ptr<Registrar> self = weakSelf.lock();
    if (!self) return;  // closing: pending batches are dropped
    for (const auto& weak : observers) {
      const std::shared_ptr<RegistrarObserver> observer = weak.lock();
      if (!observer) continue;
      if (install) {
        observer->pluginsDidInstall(plugIns);
      } else {
        observer->pluginsWillUninstall(plugIns);
      }
    }
    if (!install) {
      const std::lock_guard lock(self->stateMutex_);
      for (const PlugInPtr& plugIn : plugIns) self->lingering_.erase(plugIn->uuid());
    }
  });
}

tn::Result<void> Registrar::registerPlugIn(const tn::URL& url) {
  if (options_.mode == Mode::ReadOnly) {
    return registrarError(RegistrarErrorCode::ReadOnly, "the registrar was opened read-only");
  }
  const std::string path = normalisedPath(url);
  if (namesNothing(path)) return registrarError(RegistrarErrorCode::NotFound, "a path with a NUL names nothing");
  return queue_->sync([&]() -> tn::Result<void> {
    std::string reason;
    if (!isDirectory(path, &reason)) {
      return registrarError(RegistrarErrorCode::NotFound, fmt::format("{}: {}", path, reason));
    }
    const StatePtr current = state();
    const bool inRoot = std::any_of(paths_.applicationRoots.begin(), paths_.applicationRoots.end(),
                                    [&](const std::string& root) { return path.starts_with(root + "/"); });
    if (inRoot) {
      // An application provides it: re-read that application.
      WatchedChanges named;
      named.paths.insert(path);
      tn::Result<ScanSummary> scanned = rescanOnQueue(ChangeScope::of(named, paths_, *current));
      if (!scanned) return scanned.error();
      if (!state()->plugIns.contains(path)) {
        return registrarError(RegistrarErrorCode::InvalidBundle, fmt::format("{}: no longer a plug-in", path));
      }
      return {};
    }
    Scanner scanner(*current, paths_, watcher_.get(), true);
    for (const auto& [appPath, app] : current->storedApps) scanner.plan.apps.emplace(appPath, app);
    for (const auto& [plugInPath, plugIn] : current->storedPlugIns) {
      if (plugInPath != path) scanner.plan.plugIns.emplace(plugInPath, plugIn);
    }
    scanner.plan.points = current->storedPoints;
    if (!scanner.scanPlugIn(path, std::nullopt, true)) {
      return scanner.lastError.value_or(registrarError(RegistrarErrorCode::InvalidBundle, path));
    }
    tn::Result<ScanSummary> committed = commit(scanner.plan);
    if (!committed) return committed.error();
    return {};
  });
}

tn::Result<void> Registrar::unregisterPlugIn(const tn::URL& url) {
  if (options_.mode == Mode::ReadOnly) {
    return registrarError(RegistrarErrorCode::ReadOnly, "the registrar was opened read-only");
  }
  const std::string path = normalisedPath(url);
  if (namesNothing(path)) return registrarError(RegistrarErrorCode::NotFound, "a path with a NUL names nothing");
  return queue_->sync([&]() -> tn::Result<void> {
    const StatePtr current = state();
    const auto known = current->storedPlugIns.find(path);
    if (known == current->storedPlugIns.end()) {
      return registrarError(RegistrarErrorCode::NotFound, fmt::format("{}: no plug-in is registered there", path));
    }
    if (!known->second.registeredByURL) {
      return registrarError(RegistrarErrorCode::NotRegistered,
                            fmt::format("{}: provided by application {}; remove the application instead", path,
                                        known->second.appPath.value_or("?")));
    }
    ScanPlan plan;
    plan.apps = current->storedApps;
    plan.plugIns = current->storedPlugIns;
    plan.plugIns.erase(path);
    plan.points = current->storedPoints;
    tn::Result<ScanSummary> committed = commit(plan);
    if (!committed) return committed.error();
    return {};
  });
}

void Registrar::addObserver(const std::shared_ptr<RegistrarObserver>& observer) {
  const std::lock_guard lock(observersMutex_);
  observers_.push_back(observer);
}

void Registrar::removeObserver(const RegistrarObserver* observer) {
  const std::lock_guard lock(observersMutex_);
  std::erase_if(observers_, [&](const std::weak_ptr<RegistrarObserver>& weak) {
    const auto locked = weak.lock();
    return !locked || locked.get() == observer;
  });
}

void Registrar::waitForObservers() {
  queue_->sync([] {});
  observerQueue_->sync([] {});
}

}  // namespace registrar
