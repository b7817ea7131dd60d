// The annotation store: what survives in the file, what a bad file does to
// start-up, and that saving never loses a change kept in memory.

#include <gtest/gtest.h>

#include <sys/resource.h>
#include <sys/stat.h>

#include <csignal>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/log/CaptureSink.h"
#include "platform/value/Document.h"
#include "tenond/database/TNDAnnotationStore.h"
#include "tests/support/TempDirectory.h"

namespace tnd {
namespace {

using tn::Dictionary;
using tn::Value;

class AnnotationStore : public ::testing::Test {
 protected:

  void writeFile(const std::string& text) { std::ofstream(path_, std::ofstream::binary) << text; }
  Value readFile() const { return *tn::readDocumentFile(path_); }
  bool logged(const tn::log::ScopedCaptureSink& capture, const std::string& text) const {
    for (const auto& record : capture->records())
      if (record.text.find(text) != std::string::npos) return true;
    return false;
  }

  tn::test::TempDirectory temp_;
  const std::string& directory_ = temp_.path();
  const std::string path_ = temp_ / "Tenon-Annotations";
};

TEST_F(AnnotationStore, FirstStartIsEmptyQuietAndWritesNothingUntilAChange) {
  tn::log::ScopedCaptureSink capture;
  TNDAnnotationStore store(path_);
  EXPECT_TRUE(store.annotations().empty());
  EXPECT_TRUE(capture->records().empty());
  EXPECT_FALSE(std::filesystem::exists(path_));

  store.setAnnotation(Dictionary{{"election", Value(1)}}, "com.example.a");
  const Value file = readFile();
  EXPECT_EQ(file["version"], Value(16));
  EXPECT_EQ(file["data"], Value(Dictionary{{"com.example.a", Value(Dictionary{{"election", Value(1)}})}}));
}

TEST_F(AnnotationStore, ChangesMergeByKeyAndNoneRemovesTheEntry) {
  TNDAnnotationStore store(path_);
  store.setAnnotation(Dictionary{{"election", Value(1)}}, "k");
  store.setAnnotation(Dictionary{{"extension", Value(Dictionary{{"x", Value("y")}})}}, "k");
  store.setAnnotation(Dictionary{}, "empty");
  const Dictionary both{{"election", Value(1)}, {"extension", Value(Dictionary{{"x", Value("y")}})}};
  EXPECT_EQ(Value(*store.annotationForIdentifier("k")), Value(both));
  EXPECT_EQ(Value(*store.annotationForIdentifier("empty")), Value(Dictionary{}));

  // A second store reading the same file sees exactly the map in memory.
  EXPECT_EQ(Value(TNDAnnotationStore(path_).annotations()), Value(store.annotations()));

  store.setAnnotation(std::nullopt, "k");
  EXPECT_FALSE(store.annotationForIdentifier("k"));
  EXPECT_FALSE(readFile()["data"].dictionary()->contains("k"));
}

TEST_F(AnnotationStore, AnotherVersionIsLoggedAsResettingAndOverwrittenAtTheNextSave) {
  writeFile(R"({"version": 15, "data": {"old": {"election": 1}}})");
  tn::log::ScopedCaptureSink capture;
  TNDAnnotationStore store(path_);
  EXPECT_TRUE(store.annotations().empty());
  EXPECT_TRUE(logged(capture, "unable to load annotation database:" + path_ + " error:"));
  EXPECT_TRUE(logged(capture, "found database version 15 needed version 16"));
  EXPECT_TRUE(logged(capture, "(resetting)"));
  // The bad file stays until the next save replaces it.
  EXPECT_NE(readFile()["version"], Value(16));
  store.setAnnotation(Dictionary{{"election", Value(0)}}, "new");
  EXPECT_EQ(readFile()["version"], Value(16));
  EXPECT_FALSE(readFile()["data"].dictionary()->contains("old"));
}

TEST_F(AnnotationStore, UnparsableFilesAndMissingDataStartEmpty) {
  for (const std::string& text : {std::string("{not json"), std::string("<tenon-document version=\"1\"><map>"),
                                  std::string("\x00\x01\x02", 3), std::string(R"({"version": 16})"),
                                  std::string(R"({"version": 16, "data": [1, 2]})")}) {
    writeFile(text);
    TNDAnnotationStore store(path_);
    EXPECT_TRUE(store.annotations().empty()) << text;
  }
}

// Writes larger than `bytes` fail with EFBIG while it lives (as for a full
// disk, and for root too, which read-only directories would not stop).
class FileSizeLimit {
 public:
  explicit FileSizeLimit(rlim_t bytes) {
    ::getrlimit(RLIMIT_FSIZE, &saved_);
    previousHandler_ = ::signal(SIGXFSZ, SIG_IGN);
    rlimit limited = saved_;
    limited.rlim_cur = bytes;
    ::setrlimit(RLIMIT_FSIZE, &limited);
  }
  ~FileSizeLimit() {
    ::setrlimit(RLIMIT_FSIZE, &saved_);
    ::signal(SIGXFSZ, previousHandler_);
  }

 private:
  rlimit saved_{};
  sighandler_t previousHandler_ = SIG_DFL;
};

TEST_F(AnnotationStore, AFailedSaveKeepsTheChangeInMemoryAndTheOldFile) {
  TNDAnnotationStore store(path_);
  store.setAnnotation(Dictionary{{"election", Value(1)}}, "saved");
  tn::log::ScopedCaptureSink capture;
  {
    const FileSizeLimit full(16);
    store.setAnnotation(Dictionary{{"election", Value(1)}}, "unsaved");
  }
  EXPECT_TRUE(logged(capture, "unable to save annotations:" + path_));
  EXPECT_TRUE(store.annotationForIdentifier("unsaved"));
  EXPECT_TRUE(readFile()["data"].dictionary()->contains("saved")) << "the old file is intact";
  EXPECT_FALSE(readFile()["data"].dictionary()->contains("unsaved"));
  store.setAnnotation(Dictionary{}, "later");  // the next save writes both
  EXPECT_TRUE(readFile()["data"].dictionary()->contains("unsaved"));
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(directory_), {}), 1) << "no temporary file left";
}

TEST_F(AnnotationStore, ASaveOverAFileThatIsADirectoryFailsWithoutThrowing) {
  std::filesystem::create_directories(path_);
  TNDAnnotationStore store(path_);
  tn::log::ScopedCaptureSink capture;
  store.setAnnotation(Dictionary{{"election", Value(1)}}, "k");
  EXPECT_TRUE(store.annotationForIdentifier("k"));
  EXPECT_TRUE(logged(capture, "unable to save annotations:"));
}

}  // namespace
}  // namespace tnd
