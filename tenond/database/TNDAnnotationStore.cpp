#include "tenond/database/TNDAnnotationStore.h"

#include <sys/stat.h>

#include <cerrno>
#include <cstdlib>
#include <utility>

#include "platform/log/Log.h"
#include "platform/log/Probes.h"
#include "platform/value/AtomicFile.h"
#include "platform/value/Document.h"

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

}  // namespace

std::string TNDAnnotationStore::defaultDatabasePath() {
  const char* root = std::getenv("TENON_ROOT");
  return std::string(root ? root : "") + "/var/db/Tenon-Annotations";
}

TNDAnnotationStore::TNDAnnotationStore(const std::optional<std::string>& path)
    : annotationsPath_(path ? *path : defaultDatabasePath()) {
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

void TNDAnnotationStore::setAnnotation(const std::optional<tn::Dictionary>& annotation, const std::string& key) {
  if (!annotation) {
    annotations_.erase(key);
  } else {
    tn::Dictionary entry = annotationForIdentifier(key).value_or(tn::Dictionary());
    for (const auto& [name, value] : *annotation) entry.set(name, value);
    annotations_.set(key, tn::Value(std::move(entry)));
  }
  if (const tn::Result<void> saved = saveDb(); !saved.ok()) {
    TN_LOG_ERROR(tn::log::ops(), "unable to save annotations:{} error:{}", annotationsPath_,
                 saved.error().description());
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
  return {};
}

tn::Result<void> TNDAnnotationStore::saveDb() const {
  const tn::Value document(tn::Dictionary{{"version", tn::Value(kDatabaseVersion)}, {"data", tn::Value(annotations_)}});
  tn::Result<std::string> text = tn::writeXmlDocument(document);
  if (!text.ok()) return text.error();
  return tn::writeFileAtomically(annotationsPath_, *text);
}

}  // namespace tnd
