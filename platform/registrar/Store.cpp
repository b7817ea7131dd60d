#include "platform/registrar/Store.h"

#include <sqlite3.h>
#include <sys/stat.h>

#include <cerrno>
#include <cstdio>
#include <cstring>
#include <ctime>
#include <filesystem>
#include <functional>

#include <fmt/format.h>

#include "platform/log/Log.h"
#include "platform/registrar/ValueInterner.h"
#include "platform/value/Cbor.h"

namespace registrar {
namespace {

// Step N of the list turns a store of schema version N into one of N + 1.
const std::vector<const char*> kMigrations = {
    // 0 -> 1: the first schema.
    R"sql(
      CREATE TABLE meta(key TEXT PRIMARY KEY, value BLOB) WITHOUT ROWID;
      CREATE TABLE applications(
        path TEXT PRIMARY KEY, placeholder INTEGER NOT NULL, info BLOB NOT NULL,
        localizations BLOB NOT NULL, fingerprint TEXT NOT NULL);
      CREATE TABLE plugins(
        uuid BLOB PRIMARY KEY, path TEXT NOT NULL UNIQUE, app_path TEXT, registered_by_url INTEGER NOT NULL,
        identifier TEXT NOT NULL, info BLOB NOT NULL, entitlements BLOB NOT NULL,
        localizations BLOB NOT NULL, container TEXT, registered REAL NOT NULL, fingerprint TEXT NOT NULL);
      CREATE TABLE extension_points(
        identifier TEXT PRIMARY KEY, path TEXT NOT NULL, sdk BLOB NOT NULL, fingerprint TEXT NOT NULL);
    )sql",
};

tn::Error storeError(sqlite3* db, std::string_view what) {
  return registrarError(RegistrarErrorCode::Store,
                        fmt::format("{}: {}", what, db != nullptr ? sqlite3_errmsg(db) : "out of memory"));
}

// A prepared statement, finalized when it goes.
class Statement {
 public:
  Statement(sqlite3* db, const char* sql) : db_(db) {
    if (sqlite3_prepare_v2(db, sql, -1, &statement_, nullptr) != SQLITE_OK) statement_ = nullptr;
  }
  ~Statement() { sqlite3_finalize(statement_); }
  Statement(const Statement&) = delete;
  Statement& operator=(const Statement&) = delete;

  bool ok() const { return statement_ != nullptr; }
  sqlite3_stmt* get() const { return statement_; }

  // Every bind goes through the 64-bit variants (a size is never narrowed)
  // and is checked: the first failure is kept, and run() then refuses to
  // step, so a row is never written with a parameter missing.
  void bindText(int index, std::string_view text) {
    // A null pointer would bind NULL, not an empty text.
    const char* bytes = text.data() != nullptr ? text.data() : "";
    check(sqlite3_bind_text64(statement_, index, bytes, text.size(), SQLITE_TRANSIENT, SQLITE_UTF8));
  }
  void bindOptionalText(int index, const std::optional<std::string>& text) {
    if (text) {
      bindText(index, *text);
    } else {
      check(sqlite3_bind_null(statement_, index));
    }
  }
  void bindBlob(int index, const void* bytes, size_t size) {
    check(sqlite3_bind_blob64(statement_, index, bytes, size, SQLITE_TRANSIENT));
  }
  void bindValue(int index, const tn::Value& value) {
    const tn::Bytes bytes = tn::encodeCbor(value, tn::CborDialect::Typed);
    bindBlob(index, bytes.data(), bytes.size());
  }
  void bindUUID(int index, const tn::UUID& uuid) { bindBlob(index, uuid.bytes().data(), uuid.bytes().size()); }
  void bindInt(int index, int64_t value) { check(sqlite3_bind_int64(statement_, index, value)); }
  void bindReal(int index, double value) { check(sqlite3_bind_double(statement_, index, value)); }

  // Runs a statement that returns no rows; false on failure (of a bind or
  // of the step), with the reason in the database's error message.
  bool run() {
    const int result = bound_ == SQLITE_OK ? sqlite3_step(statement_) : bound_;
    sqlite3_reset(statement_);
    sqlite3_clear_bindings(statement_);
    bound_ = SQLITE_OK;
    return result == SQLITE_DONE;
  }

 private:
  void check(int result) {
    if (bound_ == SQLITE_OK && result != SQLITE_OK) bound_ = result;
  }

 private:
  sqlite3* db_;
  sqlite3_stmt* statement_ = nullptr;
  int bound_ = SQLITE_OK;  // the first bind failure since the last run
};

// Steps a query to its end, calling row for each row while row answers
// true. True when the query ran to its end (SQLITE_DONE): a step that fails
// part-way (a damaged page, a full disk) is an error, never a shorter
// answer.
template <typename Row>
bool eachRow(Statement& statement, Row row) {
  if (!statement.ok()) return false;
  int result;
  while ((result = sqlite3_step(statement.get())) == SQLITE_ROW) {
    if (!row(statement.get())) return false;
  }
  return result == SQLITE_DONE;
}

std::string columnText(sqlite3_stmt* statement, int column) {
  const unsigned char* text = sqlite3_column_text(statement, column);
  return text != nullptr ? std::string(reinterpret_cast<const char*>(text),
                                       static_cast<size_t>(sqlite3_column_bytes(statement, column)))
                         : std::string();
}

std::optional<std::string> columnOptionalText(sqlite3_stmt* statement, int column) {
  if (sqlite3_column_type(statement, column) == SQLITE_NULL) return std::nullopt;
  return columnText(statement, column);
}

// Values are stored as typed CBOR. A blob that does not decode means the
// file was damaged: the load fails and the store is rebuilt. Decoded values
// go through the load's interner, so that equal ones share their storage.
bool columnValue(sqlite3_stmt* statement, int column, tn::Value& into, ValueInterner& interner) {
  const auto* bytes = static_cast<const uint8_t*>(sqlite3_column_blob(statement, column));
  const auto size = static_cast<size_t>(sqlite3_column_bytes(statement, column));
  tn::Result<tn::Value> decoded = tn::decodeCbor(std::span<const uint8_t>(bytes, size), tn::CborDialect::Typed);
  if (!decoded) return false;
  into = interner.intern(*decoded);
  return true;
}

std::optional<tn::UUID> columnUUID(sqlite3_stmt* statement, int column) {
  if (sqlite3_column_bytes(statement, column) != 16) return std::nullopt;
  tn::UUID::Bytes bytes;
  std::memcpy(bytes.data(), sqlite3_column_blob(statement, column), bytes.size());
  return tn::UUID(bytes);
}

bool execute(sqlite3* db, const char* sql) { return sqlite3_exec(db, sql, nullptr, nullptr, nullptr) == SQLITE_OK; }

std::optional<int64_t> pragmaInteger(sqlite3* db, const char* sql) {
  Statement statement(db, sql);
  if (!statement.ok() || sqlite3_step(statement.get()) != SQLITE_ROW) return std::nullopt;
  return sqlite3_column_int64(statement.get(), 0);
}

tn::Result<void> migrate(sqlite3* db, int64_t from) {
  if (!execute(db, "BEGIN IMMEDIATE")) return storeError(db, "cannot begin the migration");
  for (int64_t version = from; version < Store::kSchemaVersion; ++version) {
    if (!execute(db, kMigrations[static_cast<size_t>(version)])) {
      tn::Error error = storeError(db, fmt::format("migration from schema {} failed", version));
      execute(db, "ROLLBACK");
      return error;
    }
  }
  const std::string stamp = fmt::format("PRAGMA application_id = {}; PRAGMA user_version = {};",
                                        Store::kApplicationId, Store::kSchemaVersion);
  if (!execute(db, stamp.c_str()) || !execute(db, "COMMIT")) {
    tn::Error error = storeError(db, "cannot finish the migration");
    execute(db, "ROLLBACK");
    return error;
  }
  if (from != 0) TN_LOG_DEFAULT(tn::log::rg(), "migrated the store from schema {} to {}", from, Store::kSchemaVersion);
  return {};
}

// Checks that db is ours and brings its schema up to date (read-write only).
tn::Result<void> prepareSchema(sqlite3* db, Store::Mode mode) {
  const std::optional<int64_t> applicationId = pragmaInteger(db, "PRAGMA application_id");
  const std::optional<int64_t> version = pragmaInteger(db, "PRAGMA user_version");
  const std::optional<int64_t> tables = pragmaInteger(db, "SELECT count(*) FROM sqlite_master");
  if (!applicationId || !version || !tables) return storeError(db, "not a readable database");
  const bool blank = *applicationId == 0 && *version == 0 && *tables == 0;
  if (!blank && *applicationId != Store::kApplicationId) {
    return registrarError(RegistrarErrorCode::Store,
                          fmt::format("not a registrar store (application id {})", *applicationId));
  }
  if (*version > Store::kSchemaVersion) {
    return registrarError(RegistrarErrorCode::Store,
                          fmt::format("schema version {} is newer than this registrar's {}", *version,
                                      Store::kSchemaVersion));
  }
  if (*version == Store::kSchemaVersion) return {};
  if (mode == Store::Mode::ReadOnly) {
    if (blank) return {};  // an empty file: nothing registered yet
    return registrarError(RegistrarErrorCode::Store,
                          fmt::format("schema version {} needs migrating; open read-write", *version));
  }
  return migrate(db, *version);
}

tn::Result<sqlite3*> openDatabase(const std::string& path, Store::Mode mode) {
  sqlite3* db = nullptr;
  const int flags = mode == Store::Mode::ReadOnly ? SQLITE_OPEN_READONLY
                                                  : SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE;
  if (sqlite3_open_v2(path.c_str(), &db, flags | SQLITE_OPEN_NOMUTEX, nullptr) != SQLITE_OK) {
    tn::Error error = storeError(db, fmt::format("{}: cannot open", path));
    sqlite3_close(db);
    return error;
  }
  sqlite3_busy_timeout(db, 5000);
  if (mode == Store::Mode::ReadWrite) {
    // Checks the header before anything is written: journal_mode reads it.
    if (!execute(db, "PRAGMA journal_mode = WAL") || !execute(db, "PRAGMA synchronous = NORMAL")) {
      tn::Error error = storeError(db, fmt::format("{}: cannot set up", path));
      sqlite3_close(db);
      return error;
    }
  }
  return db;
}

void moveAside(const std::string& path, const tn::Error& why) {
  const std::string aside = fmt::format("{}.corrupt-{}", path, static_cast<long long>(std::time(nullptr)));
  if (std::rename(path.c_str(), aside.c_str()) != 0) {
    TN_LOG_ERROR(tn::log::rg(), "registrar store {} is unusable ({}); cannot move it aside: {}; removing it", path,
                 why.message().value_or(why.description()), std::strerror(errno));
    std::remove(path.c_str());
  } else {
    TN_LOG_ERROR(tn::log::rg(), "registrar store {} is unusable ({}); moved it to {} and rebuilding by a full scan",
                 path, why.message().value_or(why.description()), aside);
  }
  for (const char* suffix : {"-wal", "-shm"}) {
    const std::string companion = path + suffix;
    if (std::rename(companion.c_str(), (aside + suffix).c_str()) != 0) std::remove(companion.c_str());
  }
}

tn::Result<Store::Opened> openOnce(const std::string& path, Store::Mode mode) {
  tn::Result<sqlite3*> db = openDatabase(path, mode);
  if (!db) return db.error();
  auto store = std::make_unique<Store>(path, *db);
  if (tn::Result<void> schema = prepareSchema(*db, mode); !schema) return schema.error();
  tn::Result<Store::Contents> contents = store->load();
  if (!contents) return contents.error();
  return Store::Opened{std::move(store), std::move(*contents), false};
}

}  // namespace

tn::Error registrarError(RegistrarErrorCode code, std::string message) {
  return tn::Error(std::string(kRegistrarErrorDomain), static_cast<int64_t>(code), std::move(message));
}

Store::Store(std::string path, sqlite3* db) : path_(std::move(path)), db_(db) {}

Store::~Store() { sqlite3_close(db_); }

void Store::limitValueSize(int bytes) { sqlite3_limit(db_, SQLITE_LIMIT_LENGTH, bytes); }

tn::Result<Store::Opened> Store::open(const std::string& path, Mode mode) {
  if (mode == Mode::ReadOnly) {
    struct stat info {};
    if (::stat(path.c_str(), &info) != 0) {
      return registrarError(RegistrarErrorCode::NotFound, fmt::format("{}: no registrar store", path));
    }
    return openOnce(path, mode);
  }
  std::error_code ignored;
  std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ignored);
  tn::Result<Opened> opened = openOnce(path, mode);
  if (opened) return opened;
  moveAside(path, opened.error());
  tn::Result<Opened> rebuilt = openOnce(path, mode);
  if (rebuilt) rebuilt->rebuilt = true;
  return rebuilt;
}

// One row of the plug-ins query, or none when its values do not decode.
static std::optional<StoredPlugIn> plugInOfRow(sqlite3_stmt* row, ValueInterner& interner) {
  StoredPlugIn plugIn;
  plugIn.path = columnText(row, 1);
  const std::optional<tn::UUID> uuid = columnUUID(row, 0);
  if (!uuid || !columnValue(row, 5, plugIn.info, interner) || !columnValue(row, 6, plugIn.entitlements, interner) ||
      !columnValue(row, 7, plugIn.localizations, interner)) {
    return std::nullopt;
  }
  plugIn.uuid = *uuid;
  plugIn.appPath = columnOptionalText(row, 2);
  plugIn.registeredByURL = sqlite3_column_int(row, 3) != 0;
  plugIn.identifier = columnText(row, 4);
  plugIn.container = columnOptionalText(row, 8);
  plugIn.registered = tn::Date{sqlite3_column_double(row, 9)};
  plugIn.fingerprint = columnText(row, 10);
  return plugIn;
}

tn::Result<Store::Contents> Store::load() {
  Contents contents;
  ValueInterner interner;
  if (!execute(db_, "BEGIN")) return storeError(db_, "cannot read the store");
  const auto fail = [&](std::string_view what) {
    tn::Error error = storeError(db_, what);
    execute(db_, "ROLLBACK");
    return error;
  };
  Statement knowledge(db_, "SELECT value FROM meta WHERE key = 'knowledge'");
  const bool readKnowledge = eachRow(knowledge, [&](sqlite3_stmt* row) {
    contents.knowledge = columnUUID(row, 0).value_or(tn::UUID());
    return true;
  });
  if (!readKnowledge) return fail("cannot read the knowledge");

  std::string damaged;  // the record that did not decode
  Statement apps(db_, "SELECT path, placeholder, info, localizations, fingerprint FROM applications");
  const bool readApps = eachRow(apps, [&](sqlite3_stmt* row) {
    StoredApp app;
    app.path = columnText(row, 0);
    app.placeholder = sqlite3_column_int(row, 1) != 0;
    app.fingerprint = columnText(row, 4);
    if (!columnValue(row, 2, app.info, interner) || !columnValue(row, 3, app.localizations, interner)) {
      damaged = fmt::format("damaged record of application {}", app.path);
      return false;
    }
    contents.apps.push_back(std::move(app));
    return true;
  });
  if (!readApps) return fail(damaged.empty() ? "cannot read applications" : damaged);

  Statement plugIns(db_,
                    "SELECT uuid, path, app_path, registered_by_url, identifier, info, entitlements, "
                    "localizations, container, registered, fingerprint FROM plugins");
  contents.plugIns.reserve(16384);
  const bool readPlugIns = eachRow(plugIns, [&](sqlite3_stmt* row) {
    std::optional<StoredPlugIn> plugIn = plugInOfRow(row, interner);
    if (!plugIn) {
      damaged = fmt::format("damaged record of plug-in {}", columnText(row, 1));
      return false;
    }
    contents.plugIns.push_back(std::move(*plugIn));
    return true;
  });
  if (!readPlugIns) return fail(damaged.empty() ? "cannot read plug-ins" : damaged);

  Statement points(db_, "SELECT identifier, path, sdk, fingerprint FROM extension_points");
  const bool readPoints = eachRow(points, [&](sqlite3_stmt* row) {
    StoredExtensionPoint point;
    point.identifier = columnText(row, 0);
    point.path = columnText(row, 1);
    point.fingerprint = columnText(row, 3);
    if (!columnValue(row, 2, point.sdk, interner)) {
      damaged = fmt::format("damaged record of extension point {}", point.identifier);
      return false;
    }
    contents.extensionPoints.push_back(std::move(point));
    return true;
  });
  if (!readPoints) return fail(damaged.empty() ? "cannot read extension points" : damaged);
  if (!execute(db_, "COMMIT")) return fail("cannot finish reading the store");
  // Everything is in memory now: the pages SQLite cached while reading are
  // not needed until the next write.
  sqlite3_db_release_memory(db_);
  return contents;
}

tn::Result<void> Store::apply(const Changes& changes) {
  if (changes.empty()) return {};
  if (!execute(db_, "BEGIN IMMEDIATE")) return storeError(db_, "cannot begin a write");
  const auto fail = [&](std::string_view what) -> tn::Result<void> {
    tn::Error error = storeError(db_, what);
    execute(db_, "ROLLBACK");
    return error;
  };
  {
    Statement knowledge(db_, "SELECT value FROM meta WHERE key = 'knowledge'");
    tn::UUID current;
    const bool readKnowledge = eachRow(knowledge, [&](sqlite3_stmt* row) {
      current = columnUUID(row, 0).value_or(tn::UUID());
      return true;
    });
    if (!readKnowledge) return fail("cannot read the knowledge");
    if (current != changes.expectedKnowledge) {
      execute(db_, "ROLLBACK");
      return registrarError(RegistrarErrorCode::StaleKnowledge,
                            fmt::format("{} was changed by another process", path_));
    }
  }
  Statement removePlugIn(db_, "DELETE FROM plugins WHERE uuid = ?1");
  Statement putPlugIn(db_,
                      "INSERT OR REPLACE INTO plugins(uuid, path, app_path, registered_by_url, identifier, info, "
                      "entitlements, localizations, container, registered, fingerprint) "
                      "VALUES (?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9, ?10, ?11)");
  Statement removeApp(db_, "DELETE FROM applications WHERE path = ?1");
  Statement putApp(db_,
                   "INSERT OR REPLACE INTO applications(path, placeholder, info, localizations, fingerprint) "
                   "VALUES (?1, ?2, ?3, ?4, ?5)");
  Statement removePoint(db_, "DELETE FROM extension_points WHERE identifier = ?1");
  Statement putPoint(db_,
                     "INSERT OR REPLACE INTO extension_points(identifier, path, sdk, fingerprint) "
                     "VALUES (?1, ?2, ?3, ?4)");
  Statement putKnowledge(db_, "INSERT OR REPLACE INTO meta(key, value) VALUES ('knowledge', ?1)");
  if (!removePlugIn.ok() || !putPlugIn.ok() || !removeApp.ok() || !putApp.ok() || !removePoint.ok() ||
      !putPoint.ok() || !putKnowledge.ok()) {
    return fail("cannot prepare the write");
  }
  // Removals first: a changed bundle keeps its path under a new UUID.
  for (const tn::UUID& uuid : changes.removedPlugIns) {
    removePlugIn.bindUUID(1, uuid);
    if (!removePlugIn.run()) return fail("cannot remove a plug-in");
  }
  for (const std::string& path : changes.removedApps) {
    removeApp.bindText(1, path);
    if (!removeApp.run()) return fail("cannot remove an application");
  }
  for (const std::string& identifier : changes.removedExtensionPoints) {
    removePoint.bindText(1, identifier);
    if (!removePoint.run()) return fail("cannot remove an extension point");
  }
  for (const StoredApp& app : changes.putApps) {
    putApp.bindText(1, app.path);
    putApp.bindInt(2, app.placeholder ? 1 : 0);
    putApp.bindValue(3, app.info);
    putApp.bindValue(4, app.localizations);
    putApp.bindText(5, app.fingerprint);
    if (!putApp.run()) return fail(fmt::format("cannot store application {}", app.path));
  }
  for (const StoredPlugIn& plugIn : changes.putPlugIns) {
    putPlugIn.bindUUID(1, plugIn.uuid);
    putPlugIn.bindText(2, plugIn.path);
    putPlugIn.bindOptionalText(3, plugIn.appPath);
    putPlugIn.bindInt(4, plugIn.registeredByURL ? 1 : 0);
    putPlugIn.bindText(5, plugIn.identifier);
    putPlugIn.bindValue(6, plugIn.info);
    putPlugIn.bindValue(7, plugIn.entitlements);
    putPlugIn.bindValue(8, plugIn.localizations);
    putPlugIn.bindOptionalText(9, plugIn.container);
    putPlugIn.bindReal(10, plugIn.registered.secondsSince1970);
    putPlugIn.bindText(11, plugIn.fingerprint);
    if (!putPlugIn.run()) return fail(fmt::format("cannot store plug-in {}", plugIn.path));
  }
  for (const StoredExtensionPoint& point : changes.putExtensionPoints) {
    putPoint.bindText(1, point.identifier);
    putPoint.bindText(2, point.path);
    putPoint.bindValue(3, point.sdk);
    putPoint.bindText(4, point.fingerprint);
    if (!putPoint.run()) return fail(fmt::format("cannot store extension point {}", point.identifier));
  }
  if (changes.newKnowledge) {
    putKnowledge.bindUUID(1, *changes.newKnowledge);
    if (!putKnowledge.run()) return fail("cannot store the knowledge");
  }
  if (!execute(db_, "COMMIT")) return fail("cannot commit");
  return {};
}

}  // namespace registrar
