// The published hierarchy: loading from a private root, following changes
// of its files, and readers on other threads while it reloads.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>

#include "platform/types/TypeHierarchy.h"
#include "tests/platform/bundle/BundleTestSupport.h"

namespace types {
namespace {

using namespace std::chrono_literals;

class Hierarchy : public ::testing::Test {
 protected:
  TypePaths paths() const { return TypePaths::forRoot(root_.path(), "/usr/local/share:/usr/share"); }
  void write(const std::string& relative, std::string_view contents) {
    tn::test::writeFile(root_.path() + "/" + relative, contents);
  }
  // Polls (bounded) until the hierarchy answers yes.
  static bool eventually(const TypeHierarchy& hierarchy, std::string_view type, std::string_view to) {
    for (auto deadline = std::chrono::steady_clock::now() + 10s; std::chrono::steady_clock::now() < deadline;) {
      if (hierarchy.conforms(type, to)) return true;
      std::this_thread::sleep_for(10ms);
    }
    return false;
  }

  tn::test::TempDirectory root_;
};

TEST_F(Hierarchy, ReadsEveryDataDirectoryAndTheDeclarations) {
  write("usr/local/share/mime/subclasses", "image/x-local image/x-base\n");
  write("usr/share/mime/subclasses", "image/x-base image/x-root\n");
  write("usr/share/mime/aliases", "image/x-old image/x-local\n");
  write("usr/share/tenon/types/b.manifest", R"({"types": [{"identifier": "org.example.b", "parents": ["image/x-old"]}]})");
  write("usr/share/tenon/types/broken.manifest", "{");
  write("usr/share/tenon/types/ignored.txt", R"({"types": [{"identifier": "org.example.txt"}]})");
  const TypeHierarchy hierarchy(paths());
  EXPECT_TRUE(hierarchy.conforms("image/x-old", "image/x-root"));
  EXPECT_TRUE(hierarchy.conforms("org.example.b", "image/x-root"));
  EXPECT_EQ(hierarchy.snapshot()->canonicalName("org.example.txt"), "org.example.txt");
  EXPECT_EQ(hierarchy.snapshot()->problems().size(), 1u);
  EXPECT_NE(hierarchy.snapshot()->problems().front().find("broken.manifest"), std::string::npos);
}

TEST_F(Hierarchy, AFileTooLargeIsLeftOut) {
  std::string large = "image/x-a image/x-b\n";
  large.resize(kMaxFileSize + 1, '#');
  write("usr/share/mime/subclasses", large);
  const TypeHierarchy hierarchy(paths());
  EXPECT_FALSE(hierarchy.conforms("image/x-a", "image/x-b"));
  ASSERT_EQ(hierarchy.snapshot()->problems().size(), 1u);
  EXPECT_NE(hierarchy.snapshot()->problems().front().find("larger than"), std::string::npos);
}

TEST_F(Hierarchy, FollowsChangesOfFilesAndOfDirectoriesThatAppearLater) {
  tn::test::makeDirectory(root_.path() + "/usr/share");
  TypeHierarchy hierarchy(paths());
  ASSERT_TRUE(hierarchy.watch().ok());
  EXPECT_FALSE(hierarchy.conforms("image/x-new", "image/x-parent"));

  // The mime directory did not exist when the watch began.
  tn::test::makeDirectory(root_.path() + "/usr/share/mime");
  write("usr/share/mime/subclasses.new", "image/x-new image/x-parent\n");
  std::filesystem::rename(root_.path() + "/usr/share/mime/subclasses.new", root_.path() + "/usr/share/mime/subclasses");
  EXPECT_TRUE(eventually(hierarchy, "image/x-new", "image/x-parent"));

  write("usr/share/tenon/types/own.manifest", R"({"types": [{"identifier": "org.example.own", "parents": ["image/x-new"]}]})");
  EXPECT_TRUE(eventually(hierarchy, "org.example.own", "image/x-parent"));

  std::filesystem::remove(root_.path() + "/usr/share/tenon/types/own.manifest");
  for (auto deadline = std::chrono::steady_clock::now() + 10s;
       hierarchy.conforms("org.example.own", "image/x-parent") && std::chrono::steady_clock::now() < deadline;) {
    std::this_thread::sleep_for(10ms);
  }
  EXPECT_FALSE(hierarchy.conforms("org.example.own", "image/x-parent"));
}

TEST_F(Hierarchy, ReadersOnOtherThreadsSeeWholeTablesWhileItReloads) {
  write("usr/share/mime/subclasses", "image/x-a image/x-b\n");
  TypeHierarchy hierarchy(paths());
  std::atomic<bool> stop{false};
  std::atomic<uint64_t> answers{0};
  std::vector<std::thread> readers;
  for (int i = 0; i < 2; ++i) {
    readers.emplace_back([&] {
      while (!stop.load()) {
        // Every table published holds the link: no reader sees half of one.
        EXPECT_TRUE(hierarchy.conforms("image/x-a", "image/x-b"));
        answers.fetch_add(1);
      }
    });
  }
  for (int i = 0; i < 20; ++i) hierarchy.reload();
  while (answers.load() < 100) std::this_thread::yield();
  stop.store(true);
  for (std::thread& reader : readers) reader.join();
  EXPECT_EQ(hierarchy.loadCount(), 21u);
}

}  // namespace
}  // namespace types
