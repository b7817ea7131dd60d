// The type table: conformance over the system's shared MIME database, and
// over hand-made sources for aliases, declarations, cycles and bounds.

#include <gtest/gtest.h>

#include "platform/types/TypeSources.h"
#include "platform/types/TypeTable.h"
#include "platform/value/Document.h"

namespace types {
namespace {

std::shared_ptr<const TypeTable> systemTable() {
  static const std::shared_ptr<const TypeTable> table = loadTypeTable(TypePaths::forRoot("", "/usr/share"));
  return table;
}

std::shared_ptr<const TypeTable> tableOf(std::string_view subclasses, std::string_view aliases = "",
                                         std::string_view declarations = "") {
  TypeTableBuilder builder;
  addAliasLines(builder, aliases, "aliases");
  addSubclassLines(builder, subclasses, "subclasses");
  if (!declarations.empty()) {
    tn::Result<tn::Value> document = tn::readDocument(declarations, "own.manifest");
    EXPECT_TRUE(document.ok());
    if (document.ok()) addDeclarations(builder, *document, "own.manifest");
  }
  return builder.build();
}

bool mentions(const TypeTable& table, std::string_view text) {
  for (const std::string& problem : table.problems()) {
    if (problem.find(text) != std::string::npos) return true;
  }
  return false;
}

TEST(SharedMimeDatabase, SubclassesAliasesAndImplicitParents) {
  const auto table = systemTable();
  ASSERT_GT(table->size(), 100u) << "the shared MIME database (shared-mime-info) is missing";
  EXPECT_TRUE(table->conforms("image/svg+xml", "application/xml"));
  EXPECT_TRUE(table->conforms("image/svg+xml", "text/plain"));  // application/xml is text
  EXPECT_TRUE(table->conforms("image/svg+xml", "application/octet-stream"));
  EXPECT_FALSE(table->conforms("application/xml", "image/svg+xml"));
  EXPECT_FALSE(table->conforms("image/png", "text/plain"));
  // An alias is the same type, both ways and for its descendants.
  EXPECT_TRUE(table->conforms("text/xml", "application/xml"));
  EXPECT_TRUE(table->conforms("application/xml", "text/xml"));
  EXPECT_TRUE(table->conforms("image/svg+xml", "text/xml"));
  EXPECT_EQ(table->canonicalName("Text/XML"), "application/xml");
  // Case does not matter.
  EXPECT_TRUE(table->conforms("IMAGE/SVG+XML", "Application/Xml"));
  // Implicit parents, also of types the database does not know.
  EXPECT_TRUE(table->conforms("text/x-never-registered", "text/plain"));
  EXPECT_TRUE(table->conforms("example/never-registered", "application/octet-stream"));
  EXPECT_FALSE(table->conforms("example/never-registered", "text/plain"));
  EXPECT_FALSE(table->conforms("inode/directory", "application/octet-stream"));
  EXPECT_TRUE(table->conforms("application/octet-stream", "application/octet-stream"));
}

TEST(SharedMimeDatabase, MediaRangesAndNamesThatAreNoTypes) {
  const auto table = systemTable();
  EXPECT_TRUE(table->conforms("image/png", "image/*"));
  EXPECT_TRUE(table->conforms("image/svg+xml", "text/*"));  // through application/xml and text/plain
  EXPECT_FALSE(table->conforms("image/png", "text/*"));
  EXPECT_TRUE(table->conforms("text/x-never-registered", "text/*"));
  EXPECT_FALSE(table->conforms("image/*", "image/*"));  // a range is never the type asked about
  for (const char* bad : {"", "/", "text/", "/plain", "text plain", "te\x01xt/plain", "a/b/c"}) {
    EXPECT_FALSE(table->conforms(bad, bad)) << bad;
    EXPECT_FALSE(table->conforms(bad, "application/octet-stream")) << bad;
  }
  EXPECT_FALSE(table->conforms("text/plain", "*/*"));
}

TEST(TypeTable, OwnDeclarationsJoinTheMimeHierarchy) {
  const auto table = tableOf("image/x-dcraw image/x-raw\n", "",
                             R"({"types": [
      {"identifier": "org.example.raw-photo", "parents": ["image/x-dcraw", "org.example.photo"]},
      {"identifier": "org.example.photo"},
      {"identifier": "text/x-own", "parents": ["text/plain"]},
      {"identifier": "org.example.odd", "parents": ["not a type", 7]},
      {"parents": ["text/plain"]}]})");
  EXPECT_TRUE(table->conforms("org.example.raw-photo", "image/x-raw"));
  EXPECT_TRUE(table->conforms("org.example.raw-photo", "org.example.photo"));
  EXPECT_TRUE(table->conforms("ORG.EXAMPLE.RAW-PHOTO", "application/octet-stream"));
  EXPECT_TRUE(table->conforms("org.example.raw-photo", "image/*"));
  EXPECT_FALSE(table->conforms("org.example.photo", "application/octet-stream"));  // not a MIME type
  EXPECT_TRUE(table->conforms("org.example.photo", "org.example.photo"));
  EXPECT_TRUE(mentions(*table, "own.manifest: types[2]: a declaration needs an identifier that is not a MIME type"));
  EXPECT_TRUE(mentions(*table, "a parent of org.example.odd is not a type name"));
  EXPECT_TRUE(mentions(*table, "types[4]"));
}

TEST(TypeTable, ACycleIsBrokenAtTheLinkThatClosesItAndReported) {
  const auto table = tableOf("", "",
                             R"({"types": [
      {"identifier": "org.example.a", "parents": ["org.example.b"]},
      {"identifier": "org.example.b", "parents": ["org.example.c"]},
      {"identifier": "org.example.c", "parents": ["org.example.a", "org.example.root"]},
      {"identifier": "org.example.self", "parents": ["org.example.self"]}]})");
  EXPECT_TRUE(mentions(*table, "the types form a cycle: org.example.a -> org.example.b -> org.example.c -> "
                               "org.example.a; the last link is ignored"));
  EXPECT_TRUE(mentions(*table, "org.example.self cannot be its own parent"));
  EXPECT_TRUE(table->conforms("org.example.a", "org.example.c"));
  EXPECT_TRUE(table->conforms("org.example.a", "org.example.root"));
  EXPECT_FALSE(table->conforms("org.example.c", "org.example.a"));  // the closing link is gone
}

TEST(TypeTable, AliasesOfEarlierSourcesWinAndMalformedLinesAreReported) {
  TypeTableBuilder builder;
  addAliasLines(builder, "image/x-first image/png\n", "first/aliases");
  addAliasLines(builder, "image/x-first image/gif\n# a comment\n\nonly-one-word\nimage/jpeg\n", "second/aliases");
  addSubclassLines(builder, "image/png image/x-bitmap\n" + std::string(600, 'a') + "/b c/d\n", "first/subclasses");
  const auto table = builder.build();
  EXPECT_TRUE(table->conforms("image/x-first", "image/png"));
  EXPECT_TRUE(table->conforms("image/x-first", "image/x-bitmap"));
  EXPECT_FALSE(table->conforms("image/x-first", "image/gif"));
  EXPECT_TRUE(mentions(*table, "second/aliases:1: image/x-first is already an alias"));
  EXPECT_TRUE(mentions(*table, "second/aliases:4: not two MIME types"));
  EXPECT_TRUE(mentions(*table, "second/aliases:5: not two MIME types"));
  EXPECT_TRUE(mentions(*table, "first/subclasses:2: not two MIME types"));
}

TEST(TypeTable, BoundsKeepAHostileTableSmall) {
  std::string chain;
  for (size_t i = 0; i < TypeTable::kMaxAncestors + 10; ++i) chain += fmt::format("x/t{} x/t{}\n", i, i + 1);
  const auto table = tableOf(chain);
  EXPECT_TRUE(mentions(*table, "ancestors; the rest are ignored"));
  EXPECT_TRUE(table->conforms("x/t0", "x/t1"));
  EXPECT_LE(table->ancestors("x/t0").size(), TypeTable::kMaxAncestors);

  std::string wide;
  for (size_t i = 0; i < TypeTable::kMaxParents + 1; ++i) wide += fmt::format("x/child x/p{}\n", i);
  EXPECT_TRUE(mentions(*tableOf(wide), "has more than 64 parents"));
}

TEST(TypePaths, DataDirectoriesUnderTheRoot) {
  const TypePaths paths = TypePaths::forRoot("/r", "/opt/share/:relative:/usr/share:/usr/share/:/");
  EXPECT_EQ(paths.mimeDirectories, (std::vector<std::string>{"/r/opt/share/mime", "/r/usr/share/mime", "/r/mime"}));
  EXPECT_EQ(paths.declarationsDirectory, "/r/usr/share/tenon/types");
  EXPECT_EQ(TypePaths::forRoot("", "").mimeDirectories,
            (std::vector<std::string>{"/usr/local/share/mime", "/usr/share/mime"}));
}

}  // namespace
}  // namespace types
