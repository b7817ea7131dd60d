#pragma once

// TNDAnnotationStore: the user's choices about plug-ins (chiefly the
// election), kept as one map from annotation key to annotation dictionary
// and persisted as a structured-value document:
//
//   {"version": 16, "data": {<annotation key>: {"election": 1, ...}, ...}}
//
// The map in memory is the authority. The file is read once, at creation,
// and rewritten whole (from each entry's text, kept ready: see
// AnnotationFileText.h) after every change by an atomic replace (a temporary
// file, fsync, rename, fsync of the directory), so a crash at any instant
// leaves either the old file or the new one. A file that is missing starts
// an empty map silently; one that cannot be read, parsed, or has another
// version is logged "(resetting)", left in place, and overwritten at the
// next save. A failed save is logged and the change stays in memory.
//
// A request that changes many entries may defer the saves of its changes
// (Save::Deferred) and then call saveIfNeeded() once, after its last change
// and before it answers: the file is then written once per request instead
// of once per entry, and still holds every change before anyone is told of
// it.
//
// Clients choose what is stored, so the store bounds it: an entry whose
// document encoding would exceed kMaxEntrySize bytes or nest deeper than
// kMaxEntryDepth, or a change that would take the whole map past
// kMaxStoreSize bytes, is refused with nothing changed. The file therefore
// always stays far below the size and depth any reader accepts.
//
// Not thread-safe: the database calls it only from tasks on its own queue
// ("TNDatabase"). The store does not interpret annotations; the request
// handlers validate "election" and "extension" before they get here.
//
// Annotation keys come from the plug-in (TNDPlugIn::annotationKey); the
// store itself works on the keys, so plug-ins that share a key share one
// entry.

#include <cstddef>
#include <optional>
#include <string>
#include <unordered_map>

#include "platform/value/Error.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"
#include "tenond/database/AnnotationFileText.h"

namespace tnd {

class TNDAnnotationStore {
 public:
  // The format version this store reads and writes.
  static constexpr int64_t kDatabaseVersion = 16;
  // Bounds on what clients can make the store hold (see above). Sizes are
  // of the XML encoding, the file's own.
  static constexpr size_t kMaxEntrySize = 64 * 1024;
  static constexpr size_t kMaxStoreSize = 8 * 1024 * 1024;
  static constexpr int kMaxEntryDepth = 32;

  // When a change reaches the file: at once, or at the next saveIfNeeded()
  // (or any other save).
  enum class Save { Now, Deferred };

  // Chooses the file (`path` as given, else defaultDatabasePath()), removes
  // the temporary files interrupted saves left in its directory (logged
  // "removed N stale temporary files in <dir>"), and loads it as described
  // above. Never fails: the worst case is an empty map.
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
  // leaves one unchanged). With none: removes the entry. Then saves (or, with
  // Save::Deferred, leaves the save to saveIfNeeded()), whether or not
  // anything changed; a failed save is logged and not reported.
  //
  // The one error: a merged entry beyond the bounds above (Tenon error 4,
  // "annotation for <key> refused: ..."); nothing changes and nothing is
  // saved then.
  std::optional<tn::Error> setAnnotation(const std::optional<tn::Dictionary>& annotation, const std::string& key,
                                         Save save = Save::Now);

  // Saves when a change has not reached the file yet (a deferred one, or one
  // whose save failed). A failed save is logged as setAnnotation's.
  void saveIfNeeded();
  bool hasUnsavedChanges() const { return unsaved_; }

  // The size of an entry's text in the file (without its key), or the
  // reason it cannot be stored: nested deeper than kMaxEntryDepth, or
  // holding a value the file cannot carry (a date without an ISO 8601 form).
  static tn::Result<size_t> encodedEntrySize(const tn::Dictionary& entry);
  // The size of the entries' text in the file, what kMaxStoreSize bounds.
  size_t storedSize() const { return storedSize_; }

  // Reads and validates the file at `path`; on success the map becomes its
  // "data" dictionary (an absent or non-dictionary "data" is an empty map).
  // Errors: the file error (domain "File", code ENOENT for a missing file),
  // the document parse error, or Tenon error 7 "found database version 15
  // needed version 16". The "db-load" probe fires on every failure.
  tn::Result<void> loadDb(const std::string& path);

  // The text a save writes: {"version": 16, "data": map} as XML. Fails
  // only as the document writer does, which the bounds keep from happening
  // for anything setAnnotation stored.
  tn::Result<std::string> fileText() const;

  // Writes fileText() to annotationsPath() atomically.
  // Clears hasUnsavedChanges() when it succeeds.
  tn::Result<void> saveDb();

 private:
  void makeItems();
  void save();

  std::string annotationsPath_;
  tn::Dictionary annotations_;
  // Each entry's text in the file, made when the entry changes, so that a
  // save joins them instead of writing the whole map anew.
  annotationfile::Items items_;
  size_t storedSize_ = 0;  // of items_
  bool unsaved_ = false;
};

}  // namespace tnd
