#include "libtenon/model/SmallDictionaryChanges.h"

#include <gtest/gtest.h>

namespace tn {
namespace {

TEST(DictionaryChanging, SetsAddsAndRemovesWithoutTouchingTheReceiver) {
  const Dictionary receiver{{"election", 1}, {"extension", Dictionary{{"a", 1}}}};
  const Dictionary before = receiver;

  Dictionary removed = dictionaryChanging(receiver, "election", std::nullopt);
  EXPECT_EQ(removed, (Dictionary{{"extension", Dictionary{{"a", 1}}}}));

  Dictionary removedByNull = dictionaryChanging(receiver, "election", Value());
  EXPECT_EQ(removedByNull, removed);

  Dictionary added = dictionaryChanging(receiver, "note", "x");
  EXPECT_EQ(added.size(), 3u);
  EXPECT_EQ(added.get("note"), Value("x"));

  Dictionary replaced = dictionaryChanging(receiver, "election", 0);
  EXPECT_EQ(replaced.get("election"), Value(0));
  EXPECT_EQ(replaced.size(), 2u);

  Dictionary missingRemoved = dictionaryChanging(receiver, "absent", std::nullopt);
  EXPECT_EQ(missingRemoved, receiver);

  EXPECT_EQ(receiver, before);
  EXPECT_EQ(receiver.get("election"), Value(1));
}

TEST(DictionaryChanging, StartsFromAnEmptyDictionary) {
  Dictionary d = dictionaryChanging(Dictionary{}, "election", 1);
  EXPECT_EQ(d, (Dictionary{{"election", 1}}));
}

}  // namespace
}  // namespace tn
