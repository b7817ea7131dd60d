// The annotation file joined from each entry's text is exactly what the
// document writer makes of the whole map, for every kind of value an
// annotation may hold, and reads back as the map.

#include <gtest/gtest.h>

#include "platform/value/Document.h"
#include "tenond/database/AnnotationFileText.h"

namespace tnd {
namespace {

using tn::Array;
using tn::Dictionary;
using tn::Value;

std::string writerText(const Dictionary& entries) {
  return *tn::writeXmlDocument(Value(Dictionary{{"version", Value(16)}, {"data", Value(entries)}}));
}

annotationfile::Items itemsOf(const Dictionary& entries) {
  annotationfile::Items items;
  for (const auto& [key, value] : entries) items.emplace(key, *annotationfile::itemFor(key, value));
  return items;
}

TEST(AnnotationFileText, JoinedItemsAreTheWritersTextOfTheWholeMap) {
  const Dictionary entries{
      {"com.example.a", Value(Dictionary{{"election", Value(1)}})},
      {"com.example.<&\"quoted\">", Value(Dictionary{{"election", Value(0u)}, {"extension", Value(Dictionary{})}})},
      {"com.example.b", Value(Dictionary{{"extension", Value(Dictionary{{"text", Value("line 1\n  line 2\r")},
                                                                         {"list", Value(Array{Value(1.5), Value(true)})},
                                                                         {"bytes", Value(tn::Bytes{0, 1, 2})},
                                                                         {"when", Value(tn::Date{1e9})},
                                                                         {"id", Value(tn::UUID::random())}})}})},
      {"com.example.empty", Value(Dictionary{})},
      {"com.example.scalar", Value("not a dictionary")},
  };
  const tn::Result<std::string> joined = annotationfile::document(16, entries, itemsOf(entries));
  ASSERT_TRUE(joined.ok());
  EXPECT_EQ(*joined, writerText(entries));
  EXPECT_TRUE(Value::identical((*tn::readDocument(*joined, "joined"))["data"], Value(entries)));

  EXPECT_EQ(*annotationfile::document(16, Dictionary{}, {}), writerText(Dictionary{}));
}

TEST(AnnotationFileText, AMissingItemFallsBackToTheWriter) {
  const Dictionary entries{{"a", Value(Dictionary{{"election", Value(1)}})},
                           {"b", Value(Dictionary{{"election", Value(2)}})}};
  annotationfile::Items items = itemsOf(entries);
  items.erase("b");
  EXPECT_EQ(*annotationfile::document(16, entries, items), writerText(entries));
  EXPECT_FALSE(annotationfile::itemFor("k", Value(Dictionary{{"when", Value(tn::Date{1e300})}})).ok());
}

}  // namespace
}  // namespace tnd
