#pragma once

// platform/registrar: the registry of installed applications, plug-ins and
// extension points (library tn_registrar).
//
// The registrar is the platform service that the daemon's plug-in database
// asks what is installed. It knows nothing of the daemon: it reads bundles
// (platform/bundle), trusts entitlements by the rule of platform/codesign,
// keeps what it found in an SQLite store, and answers with immutable
// records (Records.h).
//
//   auto registrar = registrar::Registrar::open(registrar::RegistrarPaths::fromEnvironment(), {});
//   registrar::PlugInPtr plugIn = (*registrar)->plugInForUUID(uuid);
//
// Sources of installed software:
// - application roots (RegistrarPaths): every directory directly inside a
//   root is an application, its plug-ins are the bundles in its
//   Support/PlugIns (and, nested, in theirs); an application holding a
//   ".installing" file is an install placeholder. Scanned at open (a warm
//   start: in the background, after answering from the store) and, when
//   watching, the application inotify reported a change in, alone;
// - plug-in bundles registered one by one by URL (registerPlugIn), kept
//   until unregistered or gone from disk;
// - extension points: <root>/usr/share/tenon/extension-points/*.manifest.
//
// Two modes: read-write (the daemon: one process at a time; scans, watches,
// writes, tells observers) and read-only (tools: reads the store as it is).
//
// Threads: queries may be called from any thread and never wait for a
// scan; they answer from an in-memory index loaded from the store. Changes
// (scan, registerPlugIn, unregisterPlugIn, setLocale) run on the
// registrar's own serial queue "registrar" and wait for it, so they must
// not be called from an observer callback. Observer callbacks run on the
// queue "registrar-observers", one batch at a time, in the order the
// changes were made.
//
// docs/registrar.md has the store's schema and every rule (what
// "unchanged" means, UUID stability, the query's narrowing, locale
// fallback, corrupt stores).
//
//   Registrar.h        this object
//   Records.h          AppRecord, PlugInRecord, ExtensionPointRecord
//   RegistrarPaths.h   where things are under $TENON_ROOT
//   Locale.h           the current locale and its language chain
//   Store.h            the SQLite store
//   BundleReader.h     reading bundles, fingerprints
//   QueryNarrowing.h   which plug-ins a rules dictionary certainly excludes
//   InstallWatcher.h   inotify over the application roots, changes by application
//   ChangeScope.h      which applications a set of changed paths touches
//   Scanner.h          reading the roots into a plan, whole or in part
//   RegistrarState.h   the in-memory state and a scan's plan
//   ValueInterner.h    one shared copy of equal values at load
//   StringsTables.h    localized strings tables, cached
//   StoredRecords.h    the persisted form of each record

#include <atomic>
#include <chrono>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <set>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/dispatch/SerialQueue.h"
#include "platform/registrar/Records.h"
#include "platform/registrar/RegistrarPaths.h"
#include "platform/registrar/Store.h"
#include "platform/registrar/StringsTables.h"
#include "platform/value/Result.h"
#include "platform/value/URL.h"

namespace registrar {

class InstallWatcher;
struct State;
struct ScanPlan;
struct ChangeScope;

// Told about installs and uninstalls, in batches, on the registrar's
// observer queue. An uninstalled plug-in's records still answer
// plugInForUUID until every observer has seen its uninstall batch.
class RegistrarObserver {
 public:
  virtual ~RegistrarObserver() = default;
  virtual void pluginsDidInstall(const PlugInList& plugIns) = 0;
  virtual void pluginsWillUninstall(const PlugInList& plugIns) = 0;
};

struct ScanSummary {
  size_t applications = 0;  // applications recorded after the scan
  size_t plugIns = 0;       // plug-ins recorded after the scan
  size_t installed = 0;
  size_t uninstalled = 0;
  size_t skipped = 0;       // bundles skipped with a log line
  bool changed = false;     // the knowledge UUID changed
  size_t examined = 0;      // applications and registered bundles looked at
  size_t read = 0;          // bundles read from disk (their fingerprints differed)
  bool incremental = false; // only the changed applications were looked at
};

class Registrar : public std::enable_shared_from_this<Registrar> {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  enum class Mode { ReadWrite, ReadOnly };
  enum class InitialScan {
    Wait,        // open() returns after the roots were scanned
    Background,  // open() returns at once with the stored contents; the scan follows on the queue
    None,        // no scan (tools; benchmarks of the store alone)
    // The daemon: Wait when the store holds nothing yet (a first start, or
    // a store rebuilt), with its progress in the log; else Background, so
    // that a warm start answers from the store at once. Changes found by
    // the background scan are installs and uninstalls like any other.
    Auto,
  };

  struct Options {
    Mode mode = Mode::ReadWrite;
    InitialScan initialScan = InitialScan::Wait;
    bool watch = true;                                 // read-write only: follow the roots with inotify
    // Quiet time after files were created or written under a root (a
    // rename into a root needs none): InstallWatcher.h, docs/registrar.md.
    std::chrono::milliseconds settle{50};
    std::optional<std::string> locale;                 // else currentLocale() of the paths' locale file
    // Added before a background scan starts (so that they hear of what it
    // finds), after a waited one (they are not told of the first contents).
    std::vector<std::shared_ptr<RegistrarObserver>> observers;
  };

  // Opens the store at paths.storeFile (read-write: creates it; a corrupt
  // or foreign file is moved aside and the registry rebuilt by a full
  // scan). Read-only, a missing or unusable store is an error.
  static tn::Result<std::shared_ptr<Registrar>> open(const RegistrarPaths& paths, Options options);

  // Stops watching and waits for the queues' pending work.
  ~Registrar();
  Registrar(const Registrar&) = delete;
  Registrar& operator=(const Registrar&) = delete;

  // --- Queries: any thread. ---

  // A new random UUID on every change of the registry's contents; nil for
  // a registry that never held anything.
  tn::UUID knowledgeUUID() const;

  PlugInPtr plugInForUUID(const tn::UUID& uuid) const;
  // The plug-in whose bundle is at the URL's path (normalised; links
  // resolved when the path as given is not known). Null when none is.
  PlugInPtr plugInForURL(const tn::URL& url) const;
  AppPtr applicationForURL(const tn::URL& url) const;
  // The application's plug-ins in its record's order (by bundle path).
  PlugInList plugInsOfApplication(const AppRecord& app) const;
  // Every installed plug-in, by bundle path.
  PlugInList installedPlugIns() const;
  std::vector<AppPtr> applications() const;
  ExtensionPointPtr extensionPoint(std::string_view identifier) const;
  std::vector<ExtensionPointPtr> extensionPoints() const;

  // The installed plug-ins that may satisfy rules (QueryNarrowing.h: never
  // one that the daemon's own matching would accept is left out) and that
  // filter keeps. filter is called exactly once per candidate, on the
  // calling thread, with the plug-in identifier and entitlements; it may
  // call the registrar's queries. None when rules is neither null nor a
  // dictionary. An empty or null rules dictionary makes every plug-in a
  // candidate.
  using Filter = std::function<bool(const std::string& identifier, const tn::Value& entitlements)>;
  std::optional<PlugInList> queryPlugIns(const tn::Value& rules, const Filter& filter) const;

  // Localized strings of keys from the strings table named table of the
  // bundle at bundlePath, in the current locale (Locale.h for the
  // fallback). Only keys with a string are in the map; none when no table
  // of that name exists in any language of the chain.
  std::optional<LocalizedStrings> localizedStrings(const std::string& bundlePath, std::string_view table,
                                                   const std::set<std::string, std::less<>>& keys) const;

  // Drops cached strings tables, so that the following lookups read them
  // again.
  void clearSchemaCaches();

  // --- Locale. ---
  std::string locale() const;
  // Remakes every record with names for the new locale (same UUIDs, same
  // knowledge). Waits for the registrar queue.
  void setLocale(const std::string& locale);

  // --- Changes: read-write only; they wait for the registrar queue. ---

  // Re-reads the roots, registered bundles and extension points.
  // progress, when given, is called on the registrar queue with (applications
  // read, applications found).
  using Progress = std::function<void(size_t done, size_t total)>;
  tn::Result<ScanSummary> scan(const Progress& progress = {});

  // The summary of the latest scan that ran, whoever asked for it (scan(),
  // the background scan at open, a rescan after the watcher saw changes).
  ScanSummary lastScan() const;

  // Registers the plug-in bundle at url: an error (InvalidBundle naming the
  // reason, NotFound) when it cannot be read. A bundle already registered
  // and unchanged is a success that changes nothing; a bundle inside a
  // recorded application is re-read with its application.
  tn::Result<void> registerPlugIn(const tn::URL& url);
  // Unregisters the plug-in bundle registered at url: NotFound when no
  // plug-in is there, NotRegistered when an application root provides it.
  tn::Result<void> unregisterPlugIn(const tn::URL& url);

  // --- Observers. ---
  // Held weakly; an observer that goes away is dropped.
  void addObserver(const std::shared_ptr<RegistrarObserver>& observer);
  void removeObserver(const RegistrarObserver* observer);
  // Returns once every batch made so far has been delivered. Not from an
  // observer callback.
  void waitForObservers();

  Mode mode() const { return options_.mode; }
  const RegistrarPaths& paths() const { return paths_; }

  Registrar(CreateTag, RegistrarPaths paths, Options options, std::unique_ptr<Store> store);

 private:
  std::shared_ptr<const State> state() const;
  void installState(std::shared_ptr<const State> state);
  std::string normalisedPath(const tn::URL& url) const;

  // On the registrar queue.
  tn::Result<ScanSummary> scanOnQueue(const Progress& progress);
  tn::Result<ScanSummary> rescanOnQueue(const ChangeScope& scope);
  tn::Result<ScanSummary> commit(ScanPlan& plan);
  tn::Result<ScanSummary> firstScan();
  void startWatching();
  // Queues a rescan of scope, joined with any rescan queued and not started.
  void scheduleRescan(const ChangeScope& scope);
  void runPendingRescan();
  void deliver(PlugInList plugIns, bool install);

  const RegistrarPaths paths_;
  const Options options_;
  std::unique_ptr<Store> store_;  // null read-only without a store file
  std::shared_ptr<tn::dispatch::SerialQueue> queue_;
  std::shared_ptr<tn::dispatch::SerialQueue> observerQueue_;
  std::unique_ptr<InstallWatcher> watcher_;
  StringsTables stringsTables_;

  mutable std::mutex stateMutex_;
  std::shared_ptr<const State> state_;  // guarded by stateMutex_; replaced, never changed
  // Uninstalled records that plugInForUUID still answers until their
  // uninstall batch is delivered. Guarded by stateMutex_.
  std::unordered_map<tn::UUID, PlugInPtr> lingering_;

  std::mutex observersMutex_;
  std::vector<std::weak_ptr<RegistrarObserver>> observers_;  // guarded by observersMutex_

  // What the next rescan looks at; a rescan is queued while not empty.
  std::mutex pendingMutex_;
  std::unique_ptr<ChangeScope> pendingScope_;  // guarded by pendingMutex_
  ScanSummary lastScan_;  // guarded by stateMutex_
};

}  // namespace registrar
