// Reading documents from files and bytes: the choice of encoding, the size
// limit, unreadable files, and line numbers under every line-end style.

#include <gtest/gtest.h>

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <fstream>

#include "platform/value/Document.h"

namespace tn {
namespace {

namespace fs = std::filesystem;

class DocumentFile : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = fs::temp_directory_path() / ("document-file-test-" + std::to_string(::getpid()));
    fs::create_directories(dir_);
  }
  void TearDown() override { fs::remove_all(dir_); }

  std::string write(const std::string& name, const std::string& contents) {
    const fs::path path = dir_ / name;
    std::ofstream(path, std::ofstream::binary) << contents;
    return path.string();
  }

  fs::path dir_;
};

TEST(DocumentEncodingDetection, FirstSignificantByteDecides) {
  EXPECT_EQ(detectDocumentEncoding("<tenon-document/>"), DocumentEncoding::Xml);
  EXPECT_EQ(detectDocumentEncoding(" \r\n\t<?xml?>"), DocumentEncoding::Xml);
  EXPECT_EQ(detectDocumentEncoding("\xEF\xBB\xBF\n<x/>"), DocumentEncoding::Xml);
  EXPECT_EQ(detectDocumentEncoding("{}"), DocumentEncoding::Json);
  EXPECT_EQ(detectDocumentEncoding("\xEF\xBB\xBF[1]"), DocumentEncoding::Json);
  EXPECT_EQ(detectDocumentEncoding("  \"<not xml>\""), DocumentEncoding::Json);
  EXPECT_EQ(detectDocumentEncoding(""), DocumentEncoding::Json);
}

TEST(DocumentLines, LineNumbersCountLfCrLfAndLoneCr) {
  for (const char* eol : {"\n", "\r\n", "\r"}) {
    const std::string e = eol;
    const std::string xml = "<tenon-document version=\"1\">" + e + "<map>" + e + e + "<item key=\"a\"><strng/></item>" +
                            e + "</map>" + e + "</tenon-document>";
    Result<Value> read = readDocument(xml, "eol.xml");
    ASSERT_FALSE(read);
    EXPECT_EQ(read.error().localizedDescription(), "eol.xml:4: unknown element <strng>");
    const std::string json = "{" + e + "\"a\": 1," + e + e + "\"a\": 2}";
    EXPECT_EQ(readDocument(json, "eol.json").error().localizedDescription(), "eol.json:4: duplicate key \"a\"");
  }
}

TEST(DocumentSize, LargerThanTheLimitIsRefusedBeforeParsing) {
  // Exactly at the limit is read.
  std::string atLimit = "\"" + std::string(kMaxDocumentSize - 2, 'a') + "\"";
  Result<Value> read = readDocument(atLimit, "big.json");
  ASSERT_TRUE(read) << read.error().localizedDescription();
  EXPECT_EQ(read->string()->size(), kMaxDocumentSize - 2);

  // One byte more is refused as too large, not as the syntax error it is.
  atLimit.push_back('x');
  Result<Value> tooLarge = readDocument(atLimit, "big.json");
  ASSERT_FALSE(tooLarge);
  EXPECT_TRUE(isDocumentError(tooLarge.error(), DocumentErrorCode::TooLarge));
  EXPECT_EQ(tooLarge.error().localizedDescription(), "big.json: too large: 16777217 bytes (the limit is 16777216)");
}

TEST_F(DocumentFile, ReadsEitherEncodingFromAFile) {
  const std::string xml = write("a.manifest", "<tenon-document version=\"1\"><int>7</int></tenon-document>");
  const std::string json = write("b.manifest", "{\"x\": [1]}");
  Result<Value> fromXml = readDocumentFile(xml);
  ASSERT_TRUE(fromXml);
  EXPECT_TRUE(Value::identical(*fromXml, Value(int64_t{7})));
  Result<Value> fromJson = readDocumentFile(json);
  ASSERT_TRUE(fromJson);
  EXPECT_TRUE(Value::identical(*fromJson, Value(Dictionary{{"x", Value(Array{1})}})));
  // Errors name the path they were read from.
  const std::string bad = write("bad.manifest", "{\n\"x\": tru}");
  EXPECT_EQ(readDocumentFile(bad).error().localizedDescription().rfind(bad + ":2: ", 0), 0u);
}

TEST_F(DocumentFile, UnreadableFilesAreNamedWithTheReason) {
  const std::string missing = (dir_ / "missing.manifest").string();
  Result<Value> notThere = readDocumentFile(missing);
  ASSERT_FALSE(notThere);
  EXPECT_EQ(notThere.error().localizedDescription(), missing + ": cannot read: No such file or directory");
  EXPECT_TRUE(isDocumentError(notThere.error(), DocumentErrorCode::Unreadable));

  Result<Value> directory = readDocumentFile(dir_.string());
  ASSERT_FALSE(directory);
  EXPECT_EQ(directory.error().localizedDescription(), dir_.string() + ": cannot read: Is a directory");
}

TEST_F(DocumentFile, AnOversizedFileIsRefusedByItsSizeWithoutBeingRead) {
  // A sparse file: reading it would take time and memory; its size alone
  // must decide.
  const std::string path = (dir_ / "huge.manifest").string();
  const int fd = ::open(path.c_str(), O_CREAT | O_WRONLY, 0644);
  ASSERT_GE(fd, 0);
  ASSERT_EQ(::ftruncate(fd, off_t{1} << 40), 0);
  ::close(fd);
  Result<Value> read = readDocumentFile(path);
  ASSERT_FALSE(read);
  EXPECT_EQ(read.error().localizedDescription(), path + ": too large: 1099511627776 bytes (the limit is 16777216)");
}

TEST(DocumentExamples, TheRepositoryExamplesReadAsExpected) {
  const std::string examples = std::string(TENON_SOURCE_DIR "/examples/documents/");
  Result<Value> annotations = readDocumentFile(examples + "annotations.xml");
  ASSERT_TRUE(annotations) << annotations.error().localizedDescription();
  EXPECT_EQ((*annotations)["version"].kind(), Value::Kind::Int);
  EXPECT_EQ((*annotations)["data"]["com.example.photos.filter"]["size"].kind(), Value::Kind::UInt);

  Result<Value> manifest = readDocumentFile(examples + "Info.manifest.json");
  ASSERT_TRUE(manifest) << manifest.error().localizedDescription();
  EXPECT_EQ(*(*manifest)["BNBundleIdentifier"].string(), "com.example.notes.share");

  Result<Value> broken = readDocumentFile(examples + "broken.json");
  ASSERT_FALSE(broken);
  EXPECT_EQ(broken.error().localizedDescription().rfind(examples + "broken.json:6: ", 0), 0u)
      << broken.error().localizedDescription();
}

}  // namespace
}  // namespace tn

namespace tn {
namespace {

TEST(DocumentFileKinds, OnlyRegularFilesAreReadSoAFifoCannotHangTheReader) {
  const std::filesystem::path dir =
      std::filesystem::temp_directory_path() / ("document-fifo-test-" + std::to_string(::getpid()));
  std::filesystem::create_directories(dir);
  const std::string fifo = (dir / "Info.manifest").string();
  ASSERT_EQ(mkfifo(fifo.c_str(), 0600), 0);
  auto fromFifo = readDocumentFile(fifo);
  ASSERT_FALSE(fromFifo);
  EXPECT_EQ(fromFifo.error().localizedDescription(), fifo + ": not a regular file");
  auto fromDirectory = readDocumentFile(dir.string());
  EXPECT_FALSE(fromDirectory);
  std::filesystem::remove_all(dir);
}

}  // namespace
}  // namespace tn
