// Temporary directory trees for the bundle, TNBundle and entitlement tests.

#pragma once

#include <gtest/gtest.h>

#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

#include "tests/support/TempDirectory.h"

namespace tn::test {

// Creates path and the missing directories above it; those it creates get
// mode 0755 whatever the umask, and path itself gets mode.
inline void makeDirectory(const std::string& path, mode_t mode = 0755) {
  const std::filesystem::path directory(path);
  if (!std::filesystem::exists(directory)) {
    const std::filesystem::path parent = directory.parent_path();
    if (!parent.empty() && !std::filesystem::exists(parent)) makeDirectory(parent.string());
    std::filesystem::create_directory(directory);
  }
  ASSERT_EQ(::chmod(path.c_str(), mode), 0) << path;
}

// Writes contents to path, creating the directories above it (0755), and
// gives the file exactly mode.
inline void writeFile(const std::string& path, std::string_view contents, mode_t mode = 0644) {
  const std::filesystem::path parent = std::filesystem::path(path).parent_path();
  if (!std::filesystem::exists(parent)) makeDirectory(parent.string());
  std::ofstream(path, std::ofstream::binary | std::ofstream::trunc) << contents;
  ASSERT_EQ(::chmod(path.c_str(), mode), 0) << path;
}

// A bundle at directory with an Info.manifest (JSON) holding manifest and,
// when executable is not empty, the file bin/<executable> (0755).
inline void makeBundle(const std::string& directory, std::string_view manifest,
                       std::string_view executable = "") {
  makeDirectory(directory);
  writeFile(directory + "/Info.manifest", manifest);
  if (!executable.empty()) writeFile(directory + "/bin/" + std::string(executable), "#!/bin/true\n", 0755);
}

}  // namespace tn::test
