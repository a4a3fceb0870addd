// The member-by-member JSON object writer that the HTTPS post backend writes its
// records with.
#include <gtest/gtest.h>

#include <cmath>

#include "platform/Json.h"

namespace telvane {
namespace {

TEST(JsonObjectWriterTest, WritesMembersInTheOrderGiven) {
  std::string out = "prefix:";
  json::ObjectWriter writer(out);
  EXPECT_TRUE(writer.member("b", Value(1)));
  EXPECT_TRUE(writer.member("a", Value("x\"y")));
  EXPECT_TRUE(writer.rawMember("raw", "[1,2]"));
  EXPECT_TRUE(writer.member("d", Value::date(2.5)));
  writer.finish();
  EXPECT_EQ(out, "prefix:{\"b\":1,\"a\":\"x\\\"y\",\"raw\":[1,2],\"d\":2.5}");
}

TEST(JsonObjectWriterTest, ARefusedMemberLeavesNoTrace) {
  std::string out;
  json::ObjectWriter writer(out);
  EXPECT_FALSE(writer.member("first", Value(std::nan(""))));
  EXPECT_TRUE(writer.member("ok", Value(true)));
  EXPECT_FALSE(writer.member("bad", Value(std::string("\xff"))));
  EXPECT_FALSE(writer.member(std::string("\xc3"), Value(1)));
  EXPECT_FALSE(writer.member("deep", Value(Array{Value(1), Value(INFINITY)})));
  EXPECT_FALSE(writer.rawMember(std::string("\xff"), "1"));
  EXPECT_TRUE(writer.member("last", Value(Dictionary{{"k", Value::array()}})));
  writer.finish();
  EXPECT_EQ(out, "{\"ok\":true,\"last\":{\"k\":[]}}");
  EXPECT_TRUE(json::parse(out).ok());
}

TEST(JsonObjectWriterTest, AnEmptyObject) {
  std::string out;
  json::ObjectWriter writer(out);
  writer.finish();
  EXPECT_EQ(out, "{}");
}

TEST(JsonObjectWriterTest, ValuesAreWrittenAsTheDocumentWriterWritesThem) {
  Value value(Dictionary{{"a", Value(1e300)}, {"b", Value(-0.5)}, {"c", Value(18446744073709551615ULL)},
                         {"d", Value(Bytes{1, 2})}, {"e", Value()}, {"f", Value("\u00e9")}});
  std::string out;
  json::ObjectWriter writer(out);
  for (const auto& [key, item] : *value.asDictionary()) ASSERT_TRUE(writer.member(key, item));
  writer.finish();
  EXPECT_EQ(out, *json::write(value));
}

}  // namespace
}  // namespace telvane
