// Installing what a test needs trusted into its private root with the modes
// the trust rule wants (docs/bundles-and-trust.md), whatever the umask the
// checkout and the build directory were made with: files 0644 (programs
// 0755) and directories 0755, owned by the test's user (root in CI).

#pragma once

#include <gtest/gtest.h>

#include <sys/stat.h>

#include <filesystem>
#include <string>

#include "tests/platform/bundle/BundleTestSupport.h"

namespace tn::test {

// Gives every directory from root down to the one holding path mode 0755,
// making those that are missing: directories that were already there (the
// daemon makes some at start-up, with the umask's modes) are fixed too.
inline void trustDirectoriesBetween(const std::string& root, const std::string& path) {
  makeDirectory(root);
  std::filesystem::path directory = root;
  const std::filesystem::path relative =
      std::filesystem::path(path).parent_path().lexically_relative(root);
  for (const std::filesystem::path& part : relative) {
    if (part == ".") continue;
    directory /= part;
    makeDirectory(directory.string());
  }
}

// Copies the file source to root/relative with exactly mode; returns that
// path. The directories from root down get 0755.
inline std::string installFile(const std::string& source, const std::string& root, const std::string& relative,
                               mode_t mode = 0755) {
  const std::string destination = root + "/" + relative;
  trustDirectoriesBetween(root, destination);
  std::filesystem::copy_file(source, destination, std::filesystem::copy_options::overwrite_existing);
  EXPECT_EQ(::chmod(destination.c_str(), mode), 0) << destination;
  return destination;
}

// Copies the tree at source to root/relative (which must not exist yet);
// returns that path. The directories from root down and in the tree get
// 0755, files 0755 when the source file is executable by its owner and 0644
// otherwise: a checkout made with umask 002 has group-writable files, which
// the daemon rightly refuses to trust.
inline std::string installTree(const std::string& source, const std::string& root, const std::string& relative) {
  const std::string destination = root + "/" + relative;
  trustDirectoriesBetween(root, destination);
  std::filesystem::copy(source, destination, std::filesystem::copy_options::recursive);
  makeDirectory(destination);
  for (const auto& entry : std::filesystem::recursive_directory_iterator(destination)) {
    if (entry.is_symlink()) continue;
    mode_t mode = 0644;
    if (entry.is_directory()) {
      mode = 0755;
    } else if ((entry.status().permissions() & std::filesystem::perms::owner_exec) != std::filesystem::perms::none) {
      mode = 0755;
    }
    EXPECT_EQ(::chmod(entry.path().c_str(), mode), 0) << entry.path();
  }
  return destination;
}

}  // namespace tn::test
