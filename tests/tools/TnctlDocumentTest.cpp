// tnctl document, run as a user runs it: the real binary on real files.

#include <gtest/gtest.h>

#include <cstdio>
#include <filesystem>
#include <fstream>

#include "platform/value/Document.h"
#include "tests/support/Subprocess.h"

namespace tn {
namespace {

namespace fs = std::filesystem;

const std::string kTnctl = std::string(TENON_BINARY_DIR "/tools/tnctl/tnctl");
const std::string kExamples = std::string(TENON_SOURCE_DIR "/examples/documents/");

class TnctlDocument : public ::testing::Test {
 protected:
  void SetUp() override {
    dir_ = fs::temp_directory_path() / ("tnctl-document-" + std::to_string(::getpid()));
    fs::create_directories(dir_);
  }
  void TearDown() override { fs::remove_all(dir_); }

  std::string write(const std::string& name, const std::string& contents) {
    const fs::path path = dir_ / name;
    std::ofstream(path) << contents;
    return path.string();
  }

  fs::path dir_;
};

TEST_F(TnctlDocument, ConvertsBetweenEncodingsWithoutLosingAnyKind) {
  const auto xml = test::runProcess({kTnctl, "document", kExamples + "annotations.xml"});
  ASSERT_EQ(xml.exitStatus, 0) << xml.err;
  const auto json = test::runProcess({kTnctl, "document", kExamples + "Info.manifest.json", "--to", "json"});
  ASSERT_EQ(json.exitStatus, 0) << json.err;

  // XML out of tnctl reads back identical to the file it came from.
  auto original = readDocumentFile(kExamples + "annotations.xml");
  ASSERT_TRUE(original);
  auto reread = readDocument(xml.out, "stdout");
  ASSERT_TRUE(reread) << reread.error().localizedDescription();
  EXPECT_TRUE(Value::identical(*original, *reread));

  // JSON to XML to JSON keeps the manifest.
  const std::string viaXml = write("manifest.xml", test::runProcess({kTnctl, "document", kExamples + "Info.manifest.json"}).out);
  const auto back = test::runProcess({kTnctl, "document", viaXml, "--to", "json"});
  ASSERT_EQ(back.exitStatus, 0) << back.err;
  EXPECT_EQ(back.out, json.out);
}

TEST_F(TnctlDocument, ABadFileGivesOneLineWithFileLineAndReason) {
  const std::string path = write("bad.xml",
                                 "<?xml version=\"1.0\"?>\n<tenon-document version=\"1\">\n<map>\n"
                                 "  <item key=\"a\"><strng>x</strng></item>\n</map>\n</tenon-document>\n");
  const auto r = test::runProcess({kTnctl, "document", path});
  EXPECT_EQ(r.exitStatus, 1);
  EXPECT_EQ(r.out, "");
  EXPECT_EQ(r.err, "tnctl: " + path + ":4: unknown element <strng>\n");

  const auto json = test::runProcess({kTnctl, "document", kExamples + "broken.json"});
  EXPECT_EQ(json.exitStatus, 1);
  EXPECT_NE(json.err.find("broken.json:6:"), std::string::npos) << json.err;
  EXPECT_EQ(std::count(json.err.begin(), json.err.end(), '\n'), 1) << json.err;
}

TEST_F(TnctlDocument, MissingFilesAndBadOptionsAreRefused) {
  const auto missing = test::runProcess({kTnctl, "document", (dir_ / "nope.xml").string()});
  EXPECT_EQ(missing.exitStatus, 1);
  EXPECT_NE(missing.err.find("nope.xml"), std::string::npos);

  const auto badEncoding = test::runProcess({kTnctl, "document", kExamples + "annotations.xml", "--to", "yaml"});
  EXPECT_EQ(badEncoding.exitStatus, 2);
  EXPECT_EQ(badEncoding.out, "");
  EXPECT_EQ(badEncoding.err.rfind("tnctl: tnctl document: --to: ", 0), 0u) << badEncoding.err;
}

}  // namespace
}  // namespace tn
