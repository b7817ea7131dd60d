// Temporary directories for tests: a fresh directory removed at the end, and
// a private platform root ($TENON_ROOT) made of one.

#pragma once

#include <gtest/gtest.h>

#include <stdlib.h>

#include <filesystem>
#include <string>
#include <string_view>

namespace tn::test {

// A fresh directory under /tmp (mode 0700, owned by the test's user),
// removed with everything in it at the end of the test. The name is short,
// so that socket paths under it fit a sockaddr_un.
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

// A TempDirectory that is this process's TENON_ROOT for its lifetime: the
// sockets, stores and documents of everything the test runs live in it.
class TempRoot : public TempDirectory {
 public:
  TempRoot() { ::setenv("TENON_ROOT", path().c_str(), 1); }
  ~TempRoot() { ::unsetenv("TENON_ROOT"); }
};

}  // namespace tn::test
