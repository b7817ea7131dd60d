// The installed tree of this build, staged for one test: `cmake --install`
// with DESTDIR set to a fresh directory, and the paths inside it.

#pragma once

#include <gtest/gtest.h>

#include <string>
#include <vector>

#include "tests/support/Subprocess.h"
#include "tests/support/TempDirectory.h"

namespace tn::test {

class StagedInstall {
 public:
  StagedInstall() {
    const ProcessResult installed =
        runProcess({TENON_CMAKE_COMMAND, "--install", TENON_BINARY_DIR}, {"DESTDIR=" + stage_.path()});
    EXPECT_EQ(installed.exitStatus, 0) << installed.out << installed.err;
  }

  // The staged path of an installed file, given its installed absolute path.
  std::string operator/(const std::string& installed) const { return stage_.path() + installed; }
  const std::string& stage() const { return stage_.path(); }
  std::string prefix() const { return stage_.path() + TENON_INSTALL_PREFIX; }
  std::string libraryDirectory() const { return stage_.path() + TENON_INSTALL_FULL_LIBDIR; }

 private:
  TempDirectory stage_;
};

}  // namespace tn::test
