#pragma once

// platform/bundle: bundle objects (library tn_bundle).
//
// A bundle is a directory with an Info.manifest (BundleLayout.h has the whole
// layout). This folder stands in for the platform's bundle service: it makes
// bundle objects from a bundle directory or from an executable inside one,
// answers their properties by number (BundleProperty.h), and reads their
// information dictionary. The daemon and libtenon's TNBundle build on it.
//
//   Bundle.h          the bundle object
//   BundleProperty.h  property numbers and creation modes
//   BundleLayout.h    names of the files and directories of a bundle
//   BundlePaths.h     absolute paths; the walk from an executable to its bundle
//   ManifestFile.h    reading a manifest without trusting the file system
//
// Bundles are untrusted input: a manifest that is unreadable, malformed, not a
// dictionary, a dangling link or a FIFO, or a BNBundleExecutable that would
// leave the bundle ("../x", "a/b"), makes the property it feeds absent; it
// never crashes or blocks the caller. Depends on platform/value only.

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "platform/bundle/BundleLayout.h"
#include "platform/bundle/BundleProperty.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace bundle {

inline constexpr std::string_view kBundleErrorDomain = "Bundle";

enum class BundleErrorCode : int64_t {
  NoBundleDirectory = 1,  // made from an executable that is in no bundle
  NotADictionary = 2,     // Info.manifest holds something other than a dictionary
};

// A bundle object. Immutable, and it keeps nothing but paths: every query
// looks at the file system when it is asked, so an object sees its bundle
// change on disk. Safe to share between threads.
class Bundle {
  struct CreateTag {
    explicit CreateTag() = default;
  };

 public:
  // A bundle object for path, read as mode says:
  // - BundlePath: path names the bundle. Null when path is empty or nothing
  //   exists there (following links), or when it holds a NUL. Anything that
  //   exists is taken, also a
  //   plain file: that is how a loose executable is given a bundle object of
  //   its own, whose bundle path is the file and which has no manifest.
  // - ExecutablePath: path names an executable inside a bundle
  //   (<bundle>/bin/<exe>); the bundle is the nearest directory above it with
  //   an Info.manifest (findEnclosingBundle). Null only for an empty path or
  //   one holding a NUL; when no directory has a manifest the object has no
  //   bundle path.
  // Relative paths are taken against the current directory; paths are
  // normalised lexically (absoluteBundlePath), links are not resolved.
  static std::shared_ptr<Bundle> create(std::string_view path, CreateMode mode);

  // The bundle of the running process: ExecutablePath mode on the file
  // /proc/self/exe links to. Made once; null when that link cannot be read.
  static std::shared_ptr<Bundle> mainBundle();

  Bundle(CreateTag, std::optional<std::string> bundlePath, std::string createdFrom, CreateMode mode);

  // The bundle directory; none for an executable found in no bundle.
  const std::optional<std::string>& bundlePath() const { return bundlePath_; }

  // <bundle>/bin/<BNBundleExecutable> when the information dictionary names
  // a plain file name there and that path is a regular file (following
  // links); otherwise none.
  std::optional<std::string> executablePath() const;

  // <bundle>/Support when it is a directory (following links); otherwise none.
  std::optional<std::string> supportFilesDirectory() const;

  // The property of that number (BundleProperty.h) as a string; none for a
  // number this layer does not know and for an absent property.
  std::optional<std::string> property(int32_t number) const;

  // The information dictionary, freshly read from <bundle>/Info.manifest, or
  // why there is none: a NoBundleDirectory or NotADictionary error of
  // kBundleErrorDomain, or the document error of reading the file.
  tn::Result<tn::Value> readInfoDictionary() const;

  // readInfoDictionary() as a dictionary value, or null when there is none.
  tn::Value infoDictionary() const;

  // One line for logs: "<Bundle /opt/A, from executable /opt/A/bin/a>".
  std::string description() const;

 private:
  std::optional<std::string> bundlePath_;
  std::string createdFrom_;  // the absolute path create() was given
  CreateMode mode_;
};

}  // namespace bundle
