// Temporary directory trees for the bundle, TNBundle and entitlement tests.

#pragma once

#include <gtest/gtest.h>

#include <stdlib.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>
#include <string>

namespace tn::test {

// A fresh directory under /tmp (mode 0700, owned by the test's user),
// removed with everything in it at the end of the test.
class TempDirectory {
 public:
  TempDirectory() {
    std::string pattern = (std::filesystem::temp_directory_path() / "tenon-test-XXXXXX").string();
    const char* made = ::mkdtemp(pattern.data());
    EXPECT_NE(made, nullptr);
    path_ = pattern;
  }
  ~TempDirectory() {
    std::error_code ignored;
    std::filesystem::remove_all(path_, ignored);
  }
  TempDirectory(const TempDirectory&) = delete;
  TempDirectory& operator=(const TempDirectory&) = delete;

  const std::string& path() const { return path_; }
  std::string operator/(std::string_view relative) const { return path_ + "/" + std::string(relative); }

 private:
  std::string path_;
};

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
