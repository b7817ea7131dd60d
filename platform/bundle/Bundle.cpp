#include "platform/bundle/Bundle.h"

#include <limits.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fmt/format.h>

#include "platform/bundle/BundlePaths.h"
#include "platform/bundle/ManifestFile.h"

namespace bundle {
namespace {

bool isRegularFile(const std::string& path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0 && S_ISREG(status.st_mode);
}

bool isDirectory(const std::string& path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

bool exists(const std::string& path) {
  struct stat status {};
  return ::stat(path.c_str(), &status) == 0;
}

tn::Error bundleError(BundleErrorCode code, std::string message) {
  return tn::Error(std::string(kBundleErrorDomain), static_cast<int64_t>(code), std::move(message));
}

std::optional<std::string> executableOfProcess() {
  char target[PATH_MAX];
  const ssize_t n = ::readlink("/proc/self/exe", target, sizeof target);
  if (n <= 0 || static_cast<size_t>(n) >= sizeof target) return std::nullopt;
  return std::string(target, static_cast<size_t>(n));
}

}  // namespace

Bundle::Bundle(CreateTag, std::optional<std::string> bundlePath, std::string createdFrom, CreateMode mode)
    : bundlePath_(std::move(bundlePath)), createdFrom_(std::move(createdFrom)), mode_(mode) {}

std::shared_ptr<Bundle> Bundle::create(std::string_view path, CreateMode mode) {
  if (path.find('\0') != std::string_view::npos) return nullptr;  // no file has such a path
  std::string absolute = absoluteBundlePath(path);
  if (absolute.empty()) return nullptr;
  switch (mode) {
    case CreateMode::BundlePath:
      if (!exists(absolute)) return nullptr;
      return std::make_shared<Bundle>(CreateTag(), absolute, absolute, mode);
    case CreateMode::ExecutablePath:
      return std::make_shared<Bundle>(CreateTag(), findEnclosingBundle(absolute), absolute, mode);
  }
  return nullptr;
}

std::shared_ptr<Bundle> Bundle::mainBundle() {
  static const std::shared_ptr<Bundle> main = [] {
    const std::optional<std::string> executable = executableOfProcess();
    return executable ? create(*executable, CreateMode::ExecutablePath) : nullptr;
  }();
  return main;
}

tn::Result<tn::Value> Bundle::readInfoDictionary() const {
  if (!bundlePath_) {
    return bundleError(BundleErrorCode::NoBundleDirectory,
                       fmt::format("{}: not inside a bundle", createdFrom_));
  }
  const std::string manifest = joinPath(*bundlePath_, kInfoManifestName);
  tn::Result<tn::Value> document = readManifestFile(manifest);
  if (!document) return document;
  if (!document->isDictionary()) {
    return bundleError(BundleErrorCode::NotADictionary,
                       fmt::format("{}: holds {}, not a dictionary", manifest,
                                   tn::Value::kindName(document->kind())));
  }
  return document;
}

tn::Value Bundle::infoDictionary() const {
  tn::Result<tn::Value> dictionary = readInfoDictionary();
  return dictionary ? std::move(dictionary).value() : tn::Value();
}

std::optional<std::string> Bundle::executablePath() const {
  if (!bundlePath_) return std::nullopt;
  const tn::Value info = infoDictionary();
  const std::string* name = info[kBundleExecutableKey].string();
  if (name == nullptr || !isPlainFileName(*name)) return std::nullopt;
  std::string path = joinPath(joinPath(*bundlePath_, kExecutableDirectoryName), *name);
  if (!isRegularFile(path)) return std::nullopt;
  return path;
}

std::optional<std::string> Bundle::supportFilesDirectory() const {
  if (!bundlePath_) return std::nullopt;
  std::string path = joinPath(*bundlePath_, kSupportDirectoryName);
  if (!isDirectory(path)) return std::nullopt;
  return path;
}

std::optional<std::string> Bundle::property(int32_t number) const {
  switch (number) {
    case kBundlePathProperty: return bundlePath_;
    case kExecutablePathProperty: return executablePath();
    case kSupportFilesDirectoryProperty: return supportFilesDirectory();
    default: return std::nullopt;
  }
}

std::string Bundle::description() const {
  const std::string_view origin = mode_ == CreateMode::ExecutablePath ? "from executable" : "from path";
  if (!bundlePath_) return fmt::format("<Bundle (none), {} {}>", origin, createdFrom_);
  return fmt::format("<Bundle {}, {} {}>", *bundlePath_, origin, createdFrom_);
}

}  // namespace bundle
