#pragma once

// The properties a bundle object answers by number (Bundle::property). The
// numbers are fixed: clients and the daemon exchange them.

#include <cstdint>

namespace bundle {

enum BundleProperty : int32_t {
  kBundlePathProperty = 2,           // the bundle directory
  kExecutablePathProperty = 3,       // bin/<BNBundleExecutable>, when that file exists
  kSupportFilesDirectoryProperty = 9,  // Support/, when it exists
};

// How Bundle::create reads the path it is given.
enum class CreateMode : int32_t {
  BundlePath = 1,      // the path names the bundle directory itself
  ExecutablePath = 2,  // the path names an executable inside a bundle
};

}  // namespace bundle
