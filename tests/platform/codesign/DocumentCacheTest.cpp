// The entitlement document cache: a document is parsed once and reused while
// the file is unchanged; any change of inode, size or times parses it again;
// the number of entries is bounded.

#include "platform/codesign/DocumentCache.h"

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <string>

#include "tests/platform/bundle/BundleTestSupport.h"

namespace codesign {
namespace {

using tn::test::TempDirectory;
using tn::test::writeFile;

class Cache : public ::testing::Test {
 protected:
  // The document at path as the cache gives it.
  tn::Value read(const std::string& path) {
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    EXPECT_GE(fd, 0) << path;
    const DocumentCache::Parsed parsed = cache_.read(fd, path);
    ::close(fd);
    return *parsed ? **parsed : tn::Value();
  }

  TempDirectory root_;
  DocumentCache cache_;
  std::string path_ = root_ / "doc.manifest";
};

TEST_F(Cache, AnUnchangedDocumentIsParsedOnce) {
  writeFile(path_, R"({"k": 1})");
  EXPECT_EQ(read(path_)["k"], tn::Value(1));
  EXPECT_EQ(read(path_)["k"], tn::Value(1));
  EXPECT_EQ(cache_.parseCount(), 1u);
}

TEST_F(Cache, AChangeOfSizeTimeOrInodeParsesAgain) {
  writeFile(path_, R"({"k": 1})");
  read(path_);

  writeFile(path_, R"({"k": 22})");  // rewritten in place, another size
  EXPECT_EQ(read(path_)["k"], tn::Value(22));
  EXPECT_EQ(cache_.parseCount(), 2u);

  // The same size, only the modification time differs (as a write within
  // one clock tick, followed by a touch, would leave it).
  writeFile(path_, R"({"k": 33})");
  const struct timespec times[2] = {{0, UTIME_OMIT}, {12345, 678}};
  ASSERT_EQ(::utimensat(AT_FDCWD, path_.c_str(), times, 0), 0);
  EXPECT_EQ(read(path_)["k"], tn::Value(33));
  EXPECT_EQ(cache_.parseCount(), 3u);

  // Replaced by another file (another inode) with the same size and times.
  const std::string other = root_ / "other";
  writeFile(other, R"({"k": 44})");
  ASSERT_EQ(::utimensat(AT_FDCWD, other.c_str(), times, 0), 0);
  ASSERT_EQ(::rename(other.c_str(), path_.c_str()), 0);
  EXPECT_EQ(read(path_)["k"], tn::Value(44));
  EXPECT_EQ(cache_.parseCount(), 4u);
  EXPECT_EQ(read(path_)["k"], tn::Value(44));
  EXPECT_EQ(cache_.parseCount(), 4u);
}

TEST_F(Cache, ErrorsAreKeptLikeDocuments) {
  writeFile(path_, R"({"k": )");
  const int fd = ::open(path_.c_str(), O_RDONLY | O_CLOEXEC);
  EXPECT_FALSE(*cache_.read(fd, path_));
  EXPECT_FALSE(*cache_.read(fd, path_));  // from the start again, not from the end
  ::close(fd);
  EXPECT_EQ(cache_.parseCount(), 1u);
}

TEST_F(Cache, TheNumberOfEntriesIsBounded) {
  for (std::size_t i = 0; i <= DocumentCache::kMaxEntries; ++i) {
    writeFile(root_ / ("d" + std::to_string(i)), "{}");
    read(root_ / ("d" + std::to_string(i)));
  }
  const std::size_t parses = cache_.parseCount();
  EXPECT_EQ(parses, DocumentCache::kMaxEntries + 1);
  read(root_ / ("d" + std::to_string(DocumentCache::kMaxEntries)));  // the newest is still there
  EXPECT_EQ(cache_.parseCount(), parses);
  read(root_ / "d0");  // the oldest went first
  EXPECT_EQ(cache_.parseCount(), parses + 1);
}

TEST_F(Cache, LargeDocumentsAreNotKept) {
  writeFile(path_, R"({"k": ")" + std::string(DocumentCache::kMaxCachedSize, 'x') + R"("})");
  read(path_);
  read(path_);
  EXPECT_EQ(cache_.parseCount(), 2u);
}

}  // namespace
}  // namespace codesign
