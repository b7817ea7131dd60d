#include "tenond/database/TNDAnnotationStore.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <utility>

#include "platform/log/Log.h"
#include "platform/log/Probes.h"
#include "platform/value/AtomicFile.h"
#include "platform/value/Document.h"
#include "platform/paths/InstancePaths.h"

namespace tnd {
namespace {

bool isMissingFile(const tn::Error& error) {
  return error.domain() == tn::kFileErrorDomain && error.code() == ENOENT;
}

// A missing file is told apart from other read failures before reading, so
// that the first start of a machine logs nothing.
tn::Result<tn::Value> readAnnotationFile(const std::string& path) {
  struct stat status {};
  if (::lstat(path.c_str(), &status) != 0 && errno == ENOENT) {
    return tn::Error(std::string(tn::kFileErrorDomain), ENOENT, path + ": No such file or directory");
  }
  return tn::readDocumentFile(path);
}

int64_t versionOf(const tn::Value& document) {
  const tn::Value& version = document["version"];
  if (auto signedVersion = version.int64()) return *signedVersion;
  if (auto unsignedVersion = version.uint64()) return static_cast<int64_t>(*unsignedVersion);
  return 0;
}

// Removes what saves interrupted by a crash or a kill left beside the file
// (writers still alive keep theirs; see removeStaleTemporaryFiles).
void removeStaleTemporariesBeside(const std::string& path) {
  const std::string directory = std::filesystem::path(path).parent_path().string();
  const tn::Result<size_t> removed = tn::removeStaleTemporaryFiles(directory.empty() ? "." : directory);
  if (!removed) {
    if (removed.error().code() != ENOENT)
      TN_LOG_ERROR(tn::log::ops(), "cannot clean up temporary files: {}", removed.error().localizedDescription());
    return;
  }
  if (*removed != 0) TN_LOG_DEFAULT(tn::log::ops(), "removed {} stale temporary files in {}", *removed, directory);
}

// Containers nested inside `value`, counting itself: 0 for a scalar.
int depthOf(const tn::Value& value) {
  int deepest = 0;
  if (const tn::Array* array = value.array()) {
    for (const tn::Value& element : *array) deepest = std::max(deepest, depthOf(element));
    return deepest + 1;
  }
  if (const tn::Dictionary* dictionary = value.dictionary()) {
    for (const auto& [key, element] : *dictionary) deepest = std::max(deepest, depthOf(element));
    return deepest + 1;
  }
  return 0;
}

// The entry's text in the file, unless it nests deeper than `depth` or the
// writer cannot write it.
tn::Result<std::string> checkedItem(const std::string& key, const tn::Value& entry, int depth) {
  if (depthOf(entry) > depth) return tn::TNMakeErrorWithFormat(4, "nested deeper than {} levels", depth);
  return annotationfile::itemFor(key, entry);
}

std::optional<tn::Error> refused(const std::string& key, const std::string& reason) {
  return tn::TNMakeErrorWithFormat(4, "annotation for {} refused: {}", key, reason);
}

}  // namespace

std::string TNDAnnotationStore::defaultDatabasePath() {
  return paths::currentLayout().annotationFile;
}

TNDAnnotationStore::TNDAnnotationStore(const std::optional<std::string>& path)
    : annotationsPath_(path ? *path : defaultDatabasePath()) {
  removeStaleTemporariesBeside(annotationsPath_);
  const tn::Result<void> loaded = loadDb(annotationsPath_);
  if (loaded.ok()) return;
  if (!isMissingFile(loaded.error())) {
    TN_LOG_ERROR(tn::log::ops(), "unable to load annotation database:{} error:{} (resetting)", annotationsPath_,
                 loaded.error().description());
  }
  // There is no per-user container service to migrate older annotations
  // from (docs/decisions.md): the store starts empty.
  annotations_ = tn::Dictionary();
}

std::optional<tn::Dictionary> TNDAnnotationStore::annotationForIdentifier(const std::string& key) const {
  const tn::Value* entry = annotations_.find(key);
  if (entry == nullptr || !entry->isDictionary()) return std::nullopt;
  return *entry->dictionary();
}

std::optional<tn::Error> TNDAnnotationStore::setAnnotation(const std::optional<tn::Dictionary>& annotation,
                                                           const std::string& key, Save save) {
  const auto existing = items_.find(key);
  const size_t oldSize = existing == items_.end() ? 0 : existing->second.size();
  if (!annotation) {
    annotations_.erase(key);
    storedSize_ -= oldSize;
    items_.erase(key);
  } else {
    tn::Dictionary entry = annotationForIdentifier(key).value_or(tn::Dictionary());
    for (const auto& [name, value] : *annotation) entry.set(name, value);
    const tn::Value value(std::move(entry));
    tn::Result<std::string> item = checkedItem(key, value, kMaxEntryDepth);
    if (!item) return refused(key, item.error().localizedDescription());
    const size_t newSize = item->size();
    if (newSize > kMaxEntrySize) return refused(key, fmt::format("{} bytes, more than {}", newSize, kMaxEntrySize));
    // An entry may always shrink, even in a store that is over its bound.
    if (newSize > oldSize && storedSize_ - oldSize + newSize > kMaxStoreSize) {
      return refused(key, fmt::format("the annotations would take more than {} bytes", kMaxStoreSize));
    }
    annotations_.set(key, value);
    items_[key] = std::move(*item);
    storedSize_ = storedSize_ - oldSize + newSize;
  }
  unsaved_ = true;
  if (save == Save::Now) this->save();
  return std::nullopt;
}

void TNDAnnotationStore::saveIfNeeded() {
  if (unsaved_) save();
}

void TNDAnnotationStore::save() {
  if (const tn::Result<void> saved = saveDb(); !saved.ok()) {
    TN_LOG_ERROR(tn::log::ops(), "unable to save annotations:{} error:{}", annotationsPath_,
                 saved.error().description());
  }
}

tn::Result<size_t> TNDAnnotationStore::encodedEntrySize(const tn::Dictionary& entry) {
  const tn::Result<std::string> item = checkedItem("", tn::Value(entry), kMaxEntryDepth);
  if (!item) return item.error();
  return item->size();
}

void TNDAnnotationStore::makeItems() {
  items_.clear();
  storedSize_ = 0;
  for (const auto& [key, value] : annotations_) {
    tn::Result<std::string> item = annotationfile::itemFor(key, value);
    if (!item) continue;  // saves then write the whole map with the writer
    storedSize_ += item->size();
    items_.emplace(key, std::move(*item));
  }
}

tn::Result<void> TNDAnnotationStore::loadDb(const std::string& path) {
  auto fail = [](tn::Error error) -> tn::Result<void> {
    TN_PROBE_DB_LOAD(error.domain().c_str(), static_cast<uint64_t>(error.code()));
    return error;
  };
  tn::Result<tn::Value> document = readAnnotationFile(path);
  if (!document.ok()) return fail(document.error());
  const int64_t version = versionOf(*document);
  if (version != kDatabaseVersion) {
    return fail(tn::TNMakeErrorWithFormat(7, "found database version {} needed version {}", version,
                                          kDatabaseVersion));
  }
  const tn::Value& data = (*document)["data"];
  annotations_ = data.isDictionary() ? *data.dictionary() : tn::Dictionary();
  makeItems();
  return {};
}

tn::Result<std::string> TNDAnnotationStore::fileText() const {
  return annotationfile::document(kDatabaseVersion, annotations_, items_);
}

tn::Result<void> TNDAnnotationStore::saveDb() {
  tn::Result<std::string> text = fileText();
  if (!text.ok()) return text.error();
  tn::Result<void> written = tn::writeFileAtomically(annotationsPath_, *text);
  if (written.ok()) unsaved_ = false;
  return written;
}

}  // namespace tnd
