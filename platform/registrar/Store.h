#pragma once

// Store: the registrar's SQLite database (WAL mode) at
// $TENON_ROOT/var/lib/tenon/registrar.sqlite3.
//
// The file carries the application id kApplicationId and the schema version
// in user_version; opening migrates an older schema step by step inside one
// transaction. docs/registrar.md lists the tables.
//
// A file that is not an SQLite database, belongs to something else, has a
// schema newer than this code knows, or fails to load is, when opened
// read-write, moved aside to "<file>.corrupt-<seconds since 1970>" (with its
// -wal and -shm files) and replaced by an empty store, with an error line on
// the "rg" log category; the caller then rebuilds the contents by a full
// scan. Opened read-only, the same file is an error and left alone.
//
// Not thread-safe: the registrar uses it from its own queue (writes) or
// from the opening thread only (loads).

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/registrar/StoredRecords.h"
#include "platform/value/Result.h"

struct sqlite3;

namespace registrar {

inline constexpr std::string_view kRegistrarErrorDomain = "Registrar";

enum class RegistrarErrorCode : int64_t {
  Store = 1,          // the database failed; the message has SQLite's reason
  StaleKnowledge = 2, // another process changed the store since it was loaded
  NotFound = 3,       // no bundle, or no record, at the path
  InvalidBundle = 4,  // the bundle cannot be registered; the message says why
  ReadOnly = 5,       // a change asked of a registrar opened read-only
  NotRegistered = 6,  // unregistering a plug-in that an application root provides
};

tn::Error registrarError(RegistrarErrorCode code, std::string message);

class Store {
 public:
  enum class Mode { ReadWrite, ReadOnly };

  // "TNRG" as a big-endian integer.
  static constexpr int32_t kApplicationId = 0x544E5247;
  static constexpr int kSchemaVersion = 1;

  struct Contents {
    tn::UUID knowledge;  // nil for a new store
    std::vector<StoredApp> apps;
    std::vector<StoredPlugIn> plugIns;
    std::vector<StoredExtensionPoint> extensionPoints;
  };

  struct Opened;

  // Opens (read-write: creating it and its directories, mode 0755) and loads
  // the store at path. Read-only, a missing file is a NotFound error.
  static tn::Result<Opened> open(const std::string& path, Mode mode);

  ~Store();
  Store(const Store&) = delete;
  Store& operator=(const Store&) = delete;

  // One write, all or nothing. expectedKnowledge is the knowledge the
  // writer's view was loaded with: when the store's differs (another process
  // wrote), nothing is written and the error is StaleKnowledge.
  struct Changes {
    tn::UUID expectedKnowledge;
    std::optional<tn::UUID> newKnowledge;
    std::vector<StoredApp> putApps;
    std::vector<std::string> removedApps;
    std::vector<StoredPlugIn> putPlugIns;
    std::vector<tn::UUID> removedPlugIns;
    std::vector<StoredExtensionPoint> putExtensionPoints;
    std::vector<std::string> removedExtensionPoints;

    bool empty() const {
      return !newKnowledge && putApps.empty() && removedApps.empty() && putPlugIns.empty() &&
             removedPlugIns.empty() && putExtensionPoints.empty() && removedExtensionPoints.empty();
    }
  };
  // Every value is bound with its full 64-bit size and every bind and step
  // is checked: a failure (a value over the size limit, a full disk, a
  // damaged page) is a Store error naming the record and SQLite's reason,
  // and nothing of the write is kept.
  tn::Result<void> apply(const Changes& changes);

  // The largest text or blob a write may store, in bytes (SQLite's length
  // limit, 1,000,000,000 unless lowered). A larger value fails its write.
  void limitValueSize(int bytes);

  // Reads everything again (after StaleKnowledge). A read that fails
  // part-way is an error, never a shorter answer.
  tn::Result<Contents> load();

  const std::string& path() const { return path_; }

  Store(std::string path, sqlite3* db);

 private:
  std::string path_;
  sqlite3* db_;
};

struct Store::Opened {
  std::unique_ptr<Store> store;
  Contents contents;
  bool rebuilt = false;  // a bad file was moved aside
};

}  // namespace registrar
