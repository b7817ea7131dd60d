#include "libtenon/model/TNBundle.h"

#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"

namespace tn {
namespace {

std::shared_ptr<bundle::Bundle> bundleForExecutable(std::string_view path) {
  std::shared_ptr<bundle::Bundle> found = bundle::Bundle::create(path, bundle::CreateMode::ExecutablePath);
  if (found && !found->bundlePath()) found = bundle::Bundle::create(path, bundle::CreateMode::BundlePath);
  return found;
}

}  // namespace

TNBundle::TNBundle(CreateTag, std::shared_ptr<const bundle::Bundle> bundle) : bundle_(std::move(bundle)) {}

std::shared_ptr<TNBundle> TNBundle::withRelayBundle(std::shared_ptr<const bundle::Bundle> bundle) {
  if (!bundle) return nullptr;
  return std::make_shared<TNBundle>(CreateTag(), std::move(bundle));
}

std::shared_ptr<TNBundle> TNBundle::forMainBundle() { return withRelayBundle(bundle::Bundle::mainBundle()); }

std::shared_ptr<TNBundle> TNBundle::withPath(std::string_view path) {
  return withRelayBundle(bundle::Bundle::create(path, bundle::CreateMode::BundlePath));
}

std::shared_ptr<TNBundle> TNBundle::withURL(const URL& url) {
  if (!url.isFileURL()) return nullptr;
  return withPath(url.path());
}

std::shared_ptr<TNBundle> TNBundle::withExecutablePath(std::string_view path) {
  return withRelayBundle(bundleForExecutable(path));
}

std::shared_ptr<TNBundle> TNBundle::withExecutableURL(const URL& url) {
  if (!url.isFileURL()) return nullptr;
  return withExecutablePath(url.path());
}

std::optional<std::string> TNBundle::stringProperty(int32_t number) const { return bundle_->property(number); }

std::optional<std::string> TNBundle::path() const { return stringProperty(bundle::kBundlePathProperty); }

std::optional<URL> TNBundle::url() const {
  const std::optional<std::string> directory = path();
  if (!directory) return std::nullopt;
  return URL::fileURLWithPath(*directory);
}

std::optional<std::string> TNBundle::executablePath() const {
  std::optional<std::string> executable = stringProperty(bundle::kExecutablePathProperty);
  return executable ? executable : path();
}

std::optional<std::string> TNBundle::supportPath() const {
  {
    const std::lock_guard lock(supportPathMutex_);
    if (supportPath_) return supportPath_;
  }
  std::optional<std::string> found = stringProperty(bundle::kSupportFilesDirectoryProperty);
  if (found) {
    const std::lock_guard lock(supportPathMutex_);
    if (!supportPath_) supportPath_ = found;
    return supportPath_;
  }
  return found;
}

std::optional<std::string> TNBundle::bundleDirectory(std::string_view name) const {
  std::optional<std::string> support = supportPath();
  if (!support) return std::nullopt;
  return *support + "/" + std::string(name);
}

std::optional<std::string> TNBundle::plugInsPath() const {
  return bundleDirectory(bundle::kPlugInsDirectoryName);
}

Value TNBundle::infoDictionary() const {
  const Value source = bundle_->infoDictionary();
  if (source.isNull()) {
    TN_LOG_INFO(log::ops(), "failed to retrieve Info.manifest for {} through {}", path().value_or("(null)"),
                bundle_->description());
    return Value();
  }
  Value converted = convertMessageToMemory(source);
  if (!converted.isDictionary()) {
    TN_LOG_INFO(log::ops(), "failed to convert Info.manifest to dictionary: {} source={}",
                path().value_or("(null)"), source.description());
    return Value();
  }
  return converted;
}

std::optional<std::string> TNBundle::bundleIdentifier() const {
  const Value info = bundle_->infoDictionary();
  const std::string* identifier = info[bundle::kBundleIdentifierKey].string();
  if (identifier == nullptr) return std::nullopt;
  return *identifier;
}

}  // namespace tn
