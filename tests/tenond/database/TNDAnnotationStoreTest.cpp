// The annotation store: what survives in the file, what a bad file does to
// start-up, and that saving never loses a change kept in memory.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/file.h>
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

TEST_F(AnnotationStore, StartUpRemovesTemporariesOfInterruptedSavesOnly) {
  {
    TNDAnnotationStore store(path_);
    store.setAnnotation(Dictionary{{"election", Value(1)}}, "com.example.a");
  }
  const auto temporary = [&](const std::string& random) {
    const std::string path = temp_ / (".Tenon-Annotations.tenon-tmp." + random);
    std::ofstream(path) << "<half";
    return path;
  };
  const std::string dead1 = temporary("k1ll3d");
  const std::string dead2 = temporary("Zz9Yy8");
  const std::string live = temporary("aL1ve0");
  const int liveFd = ::open(live.c_str(), O_RDONLY | O_CLOEXEC);
  ASSERT_GE(liveFd, 0);
  ASSERT_EQ(::flock(liveFd, LOCK_EX), 0);

  tn::log::ScopedCaptureSink capture;
  const TNDAnnotationStore store(path_);
  ::close(liveFd);
  EXPECT_FALSE(std::filesystem::exists(dead1));
  EXPECT_FALSE(std::filesystem::exists(dead2));
  EXPECT_TRUE(std::filesystem::exists(live));
  EXPECT_TRUE(logged(capture, "removed 2 stale temporary files in " + directory_));
  EXPECT_EQ(Value(*store.annotationForIdentifier("com.example.a")), Value(Dictionary{{"election", Value(1)}}));
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

// A request that changes many entries writes the file once, when it asks.
TEST_F(AnnotationStore, DeferredChangesReachTheFileAtTheNextSaveOnly) {
  TNDAnnotationStore store(path_);
  using Save = TNDAnnotationStore::Save;
  EXPECT_FALSE(store.setAnnotation(Dictionary{{"election", Value(1)}}, "a", Save::Deferred));
  EXPECT_FALSE(store.setAnnotation(Dictionary{{"election", Value(0)}}, "b", Save::Deferred));
  EXPECT_FALSE(std::filesystem::exists(path_));
  EXPECT_TRUE(store.hasUnsavedChanges());
  store.saveIfNeeded();
  EXPECT_FALSE(store.hasUnsavedChanges());
  EXPECT_EQ(readFile()["data"], Value(store.annotations()));

  std::filesystem::remove(path_);
  store.saveIfNeeded();
  EXPECT_FALSE(std::filesystem::exists(path_)) << "nothing to save, nothing written";
  // A save that fails leaves the change unsaved, for the next one to write.
  {
    const FileSizeLimit full(16);
    EXPECT_FALSE(store.setAnnotation(Dictionary{{"election", Value(2)}}, "a", Save::Now));
  }
  EXPECT_TRUE(store.hasUnsavedChanges());
  store.saveIfNeeded();
  EXPECT_EQ(readFile()["data"]["a"]["election"], Value(2));
}

// Whatever clients store, the file stays one that the store reads back.
TEST_F(AnnotationStore, EntriesBeyondTheBoundsAreRefusedWithNothingChanged) {
  TNDAnnotationStore store(path_);
  const Value big(std::string(TNDAnnotationStore::kMaxEntrySize, 'x'));
  const std::optional<tn::Error> tooLarge = store.setAnnotation(Dictionary{{"extension", Value(Dictionary{{"b", big}})}}, "k");
  ASSERT_TRUE(tooLarge);
  EXPECT_EQ(tooLarge->code(), 4);
  EXPECT_NE(tooLarge->localizedDescription().find("annotation for k refused: "), std::string::npos);
  Value deep(1);
  for (int level = 0; level < TNDAnnotationStore::kMaxEntryDepth; ++level) deep = Value(tn::Array{deep});
  EXPECT_TRUE(store.setAnnotation(Dictionary{{"extension", deep}}, "k"));
  EXPECT_TRUE(store.setAnnotation(Dictionary{{"when", Value(tn::Date{1e300})}}, "k")) << "a date with no written form";
  EXPECT_TRUE(store.annotations().empty());
  EXPECT_FALSE(std::filesystem::exists(path_));

  // The whole map is bounded too; an entry may still shrink or go.
  const Dictionary chunk{{"extension", Value(Dictionary{{"b", Value(std::string(60 * 1024, 'x'))}})}};
  int stored = 0;
  while (!store.setAnnotation(chunk, "k" + std::to_string(stored), TNDAnnotationStore::Save::Deferred)) ++stored;
  EXPECT_GT(stored, 100);
  EXPECT_LE(store.storedSize(), TNDAnnotationStore::kMaxStoreSize);
  EXPECT_FALSE(store.setAnnotation(Dictionary{{"extension", Value(Dictionary{})}}, "k0", TNDAnnotationStore::Save::Deferred));
  EXPECT_FALSE(store.setAnnotation(std::nullopt, "k1"));
  EXPECT_FALSE(store.setAnnotation(chunk, "again"));
  EXPECT_EQ(TNDAnnotationStore(path_).storedSize(), store.storedSize()) << "measured again when loaded";
  EXPECT_EQ(Value(TNDAnnotationStore(path_).annotations()), Value(store.annotations()));
}

}  // namespace
}  // namespace tnd
