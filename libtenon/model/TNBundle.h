#pragma once

// TNBundle: a read-only view over a bundle object (platform/bundle), the way
// the daemon and its clients look at application and plug-in bundles: paths,
// the support-files directory and its PlugIns/, the information dictionary
// and the bundle identifier.
//
// Every creator returns an empty pointer when there is no bundle object to
// view. Queries go to the file system each time, except supportPath(), which
// is remembered once it has been found. Safe to use from several queues.

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "platform/bundle/Bundle.h"
#include "platform/value/URL.h"
#include "platform/value/Value.h"

namespace tn {

class TNBundle {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  // The bundle of the running process (bundle::Bundle::mainBundle()).
  static std::shared_ptr<TNBundle> forMainBundle();

  // The bundle at a directory (or a loose file): bundle::CreateMode::BundlePath.
  // withURL takes file URLs only.
  static std::shared_ptr<TNBundle> withURL(const URL& url);
  static std::shared_ptr<TNBundle> withPath(std::string_view path);

  // The bundle an executable lies in (bundle::CreateMode::ExecutablePath).
  // When the executable is in no bundle, the view is over a bundle object
  // made from the executable's own path (BundlePath mode), so a loose
  // executable still has a path and an executablePath(). withExecutableURL
  // takes file URLs only.
  static std::shared_ptr<TNBundle> withExecutableURL(const URL& url);
  static std::shared_ptr<TNBundle> withExecutablePath(std::string_view path);

  // The view over bundle; empty when bundle is. Every other creator ends here.
  static std::shared_ptr<TNBundle> withRelayBundle(std::shared_ptr<const bundle::Bundle> bundle);

  TNBundle(CreateTag, std::shared_ptr<const bundle::Bundle> bundle);

  // The bundle object viewed; never null.
  const std::shared_ptr<const bundle::Bundle>& relayBundle() const { return bundle_; }

  // The bundle object's property of that number (bundle::BundleProperty).
  std::optional<std::string> stringProperty(int32_t number) const;

  // Property 2, the bundle directory, and its file URL.
  std::optional<std::string> path() const;
  std::optional<URL> url() const;

  // Property 3 (the executable named by BNBundleExecutable), or else the
  // bundle path, which for a loose executable is the executable itself.
  std::optional<std::string> executablePath() const;

  // Property 9, the support-files directory. Once found it is remembered for
  // the life of this object; while it is absent every call looks again.
  std::optional<std::string> supportPath() const;

  // supportPath() + "/" + name, or none without a support-files directory.
  std::optional<std::string> bundleDirectory(std::string_view name) const;

  // bundleDirectory("PlugIns").
  std::optional<std::string> plugInsPath() const;

  // The information dictionary, read and converted anew on every call (no
  // cache): a dictionary value, or null. A missing or unconvertible
  // dictionary is logged at info level on the "ops" category.
  Value infoDictionary() const;

  // The BNBundleIdentifier string of the bundle object's information
  // dictionary, read directly (no conversion, nothing logged); none when
  // there is no dictionary or the value is not a string.
  std::optional<std::string> bundleIdentifier() const;

 private:
  std::shared_ptr<const bundle::Bundle> bundle_;
  mutable std::mutex supportPathMutex_;
  mutable std::optional<std::string> supportPath_;  // guarded by supportPathMutex_
};

}  // namespace tn
