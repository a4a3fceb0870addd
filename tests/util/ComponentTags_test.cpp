#include "util/ComponentTags.h"

#include <gtest/gtest.h>

#include <cctype>
#include <set>
#include <string>

using namespace telvane;

TEST(ComponentTagsTest, ThirtyOneDistinctShortUpperCaseTags) {
  std::set<std::string> tags;
  for (std::int64_t type = 0; type < 31; ++type) {
    auto tag = componentTag(type);
    ASSERT_TRUE(tag) << type;
    EXPECT_FALSE(tag->empty());
    EXPECT_LE(tag->size(), 4u);
    for (char c : *tag) EXPECT_TRUE(std::isupper(static_cast<unsigned char>(c))) << *tag;
    tags.insert(std::string(*tag));
  }
  EXPECT_EQ(tags.size(), 31u);
  EXPECT_FALSE(componentTag(-1));
  EXPECT_FALSE(componentTag(31));
}

TEST(ComponentTagsTest, HealthUsesTheTableForClientTypesOnly) {
  EXPECT_EQ(healthComponentTag(4), "Unknown");
  EXPECT_EQ(healthComponentTag(31), "Unknown");
  EXPECT_EQ(healthComponentTag(-5), "Unknown");
  EXPECT_EQ(healthComponentTag(5), *componentTag(5));
  EXPECT_EQ(healthComponentTag(30), *componentTag(30));
  EXPECT_EQ(healthComponentTag(6), "VID");
}
