#pragma once

// TNDAnnotationStore: the user's choices about plug-ins (chiefly the
// election), kept as one map from annotation key to annotation dictionary
// and persisted as a structured-value document:
//
//   {"version": 16, "data": {<annotation key>: {"election": 1, ...}, ...}}
//
// The map in memory is the authority. The file is read once, at creation,
// and rewritten whole after every change by an atomic replace (a temporary
// file, fsync, rename, fsync of the directory), so a crash at any instant
// leaves either the old file or the new one. A file that is missing starts
// an empty map silently; one that cannot be read, parsed, or has another
// version is logged "(resetting)", left in place, and overwritten at the
// next save. A failed save is logged and the change stays in memory.
//
// Not thread-safe: the database calls it only from tasks on its own queue
// ("TNDatabase"). The store does not interpret annotations; the request
// handlers validate "election" and "extension" before they get here.
//
// Annotation keys come from the plug-in (TNDPlugIn::annotationKey); the
// store itself works on the keys, so plug-ins that share a key share one
// entry.

#include <optional>
#include <string>

#include "platform/value/Error.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace tnd {

class TNDAnnotationStore {
 public:
  // The format version this store reads and writes.
  static constexpr int64_t kDatabaseVersion = 16;

  // Chooses the file (`path` as given, else defaultDatabasePath()) and loads
  // it as described above. Never fails: the worst case is an empty map.
  explicit TNDAnnotationStore(const std::optional<std::string>& path);

  // $TENON_ROOT/var/db/Tenon-Annotations.
  static std::string defaultDatabasePath();
  static std::string globalPath() { return defaultDatabasePath(); }

  const std::string& annotationsPath() const { return annotationsPath_; }
  const tn::Dictionary& annotations() const { return annotations_; }

  // The entry under `key`, or none.
  std::optional<tn::Dictionary> annotationForIdentifier(const std::string& key) const;

  // With an annotation: merges its keys into the entry under `key` (values
  // replace, other keys stay; an empty annotation creates an empty entry or
  // leaves one unchanged). With none: removes the entry. Then saves, whether
  // or not anything changed; a failed save is logged and not reported.
  void setAnnotation(const std::optional<tn::Dictionary>& annotation, const std::string& key);

  // Reads and validates the file at `path`; on success the map becomes its
  // "data" dictionary (an absent or non-dictionary "data" is an empty map).
  // Errors: the file error (domain "File", code ENOENT for a missing file),
  // the document parse error, or Tenon error 7 "found database version 15
  // needed version 16". The "db-load" probe fires on every failure.
  tn::Result<void> loadDb(const std::string& path);

  // Writes {"version": 16, "data": map} as XML to annotationsPath()
  // atomically.
  tn::Result<void> saveDb() const;

 private:
  std::string annotationsPath_;
  tn::Dictionary annotations_;
};

}  // namespace tnd
