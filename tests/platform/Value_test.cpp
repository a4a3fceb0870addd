#include "telvane/Value.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdint>
#include <limits>
#include <string>
#include <utility>
#include <vector>

using namespace telvane;

namespace {

constexpr std::int64_t kInt64Max = std::numeric_limits<std::int64_t>::max();
constexpr std::int64_t kInt64Min = std::numeric_limits<std::int64_t>::min();
constexpr std::uint64_t kUInt64Max = std::numeric_limits<std::uint64_t>::max();

// ---- integer value ----

TEST(ValueTest, IntegerValueOfStrings) {
  const std::vector<std::pair<const char*, std::int64_t>> cases = {
      {"42", 42},
      {"  42", 42},
      {"+7", 7},
      {"-13abc", -13},
      {"abc", 0},
      {"", 0},
      {"   ", 0},
      {"-", 0},
      {"- 5", 0},
      {"4 2", 4},
      {"12.9", 12},
      {" \t-0012", -12},
      {"\n7", 7},
      {"9223372036854775807", kInt64Max},
      {"9223372036854775808", kInt64Max},
      {"-9223372036854775808", kInt64Min},
      {"-9223372036854775809", kInt64Min},
      {"99999999999999999999", kInt64Max},
      {"-99999999999999999999", kInt64Min},
      {"000000000000000000000000042", 42},
  };
  for (const auto& [text, expected] : cases) {
    EXPECT_EQ(Value(text).integerValue(), expected) << "text '" << text << "'";
    EXPECT_EQ(integerFromText(text), expected) << "text '" << text << "'";
  }
}

TEST(ValueTest, IntegerValueOfNumbers) {
  EXPECT_EQ(Value(3.9).integerValue(), 3);
  EXPECT_EQ(Value(-3.9).integerValue(), -3);
  EXPECT_EQ(Value(-0.5).integerValue(), 0);
  EXPECT_EQ(Value(std::nan("")).integerValue(), 0);
  EXPECT_EQ(Value(1e300).integerValue(), kInt64Max);
  EXPECT_EQ(Value(-1e300).integerValue(), kInt64Min);
  EXPECT_EQ(Value(std::numeric_limits<double>::infinity()).integerValue(), kInt64Max);
  EXPECT_EQ(Value(9223372036854775807.0).integerValue(), kInt64Max);  // 2^63 as a double
  EXPECT_EQ(Value(true).integerValue(), 1);
  EXPECT_EQ(Value(false).integerValue(), 0);
  EXPECT_EQ(Value(-17).integerValue(), -17);
  EXPECT_EQ(Value(kUInt64Max).integerValue(), kInt64Max);  // saturates
  EXPECT_EQ(Value(static_cast<std::uint64_t>(kInt64Max)).integerValue(), kInt64Max);
}

TEST(ValueTest, IntegerValueOfOtherTypesIsZero) {
  EXPECT_EQ(Value().integerValue(), 0);
  EXPECT_EQ(Value::date(1000.0).integerValue(), 0);
  EXPECT_EQ(Value(Bytes{1, 2}).integerValue(), 0);
  EXPECT_EQ(Value(Array{5}).integerValue(), 0);
  EXPECT_EQ(Value(Dictionary{{"a", 5}}).integerValue(), 0);
}

TEST(ValueTest, NarrowIntegerViewsTruncateTheIntegerValue) {
  EXPECT_EQ(Value(0x100000005LL).intValue(), 5);
  EXPECT_EQ(Value(-1).unsignedIntValue(), 0xFFFFFFFFu);
  EXPECT_EQ(Value(70000).unsignedShortValue(), 70000 - 65536);
  EXPECT_EQ(Value("65537").unsignedShortValue(), 1);
  EXPECT_EQ(Value(kUInt64Max).unsignedLongLongValue(), kUInt64Max);
  EXPECT_EQ(Value(1.8e19).unsignedLongLongValue(), 18000000000000000000ULL);
  EXPECT_EQ(Value(-1).unsignedLongLongValue(), kUInt64Max);
  EXPECT_EQ(Value("42").unsignedLongLongValue(), 42u);
}

// ---- double value ----

TEST(ValueTest, DoubleValueOfStrings) {
  const std::vector<std::pair<const char*, double>> cases = {
      {"3.5xyz", 3.5}, {" -2e3", -2000.0}, {"abc", 0.0},   {".5", 0.5},     {"1e", 1.0},
      {"0x10", 0.0},   {"-.25", -0.25},    {"+1.5e+2x", 150.0}, {"1.5.3", 1.5}, {"", 0.0},
      {".", 0.0},      {"-", 0.0},         {"inf", 0.0},   {"nan", 0.0},    {"  42", 42.0},
      {"1e-2", 0.01},  {"0X1P3", 0.0},     {".e1", 0.0},
  };
  for (const auto& [text, expected] : cases) {
    EXPECT_EQ(Value(text).doubleValue(), expected) << "text '" << text << "'";
    EXPECT_EQ(doubleFromText(text), expected) << "text '" << text << "'";
  }
}

TEST(ValueTest, DoubleValueOfOtherTypes) {
  EXPECT_EQ(Value(true).doubleValue(), 1.0);
  EXPECT_EQ(Value(false).doubleValue(), 0.0);
  EXPECT_EQ(Value(-7).doubleValue(), -7.0);
  EXPECT_EQ(Value(kUInt64Max).doubleValue(), 18446744073709551616.0);
  EXPECT_EQ(Value(2.25).doubleValue(), 2.25);
  EXPECT_EQ(Value().doubleValue(), 0.0);
  EXPECT_EQ(Value::date(99.5).doubleValue(), 0.0);
}

// ---- boolean value ----

TEST(ValueTest, BoolValueOfStrings) {
  const std::vector<std::pair<const char*, bool>> cases = {
      {"YES", true}, {"yes", true}, {"no", false},  {"NO", false},   {"0", false},    {"t", true},
      {"true", true}, {"T", true},  {"false", false}, {"  7", true},  {"-1", true},    {"+9", true},
      {"00", false}, {"0001", true}, {"Y", true},    {"n", false},   {"", false},     {"   ", false},
      {"0.5", false}, {"-0", false}, {"0y", true},   {" \t0t", true}, {"x1", false},
  };
  for (const auto& [text, expected] : cases) {
    EXPECT_EQ(Value(text).boolValue(), expected) << "text '" << text << "'";
    EXPECT_EQ(boolFromText(text), expected) << "text '" << text << "'";
  }
}

TEST(ValueTest, BoolValueOfNumbersAndOthers) {
  EXPECT_TRUE(Value(1).boolValue());
  EXPECT_TRUE(Value(-1).boolValue());
  EXPECT_FALSE(Value(0).boolValue());
  EXPECT_TRUE(Value(2u).boolValue());
  EXPECT_FALSE(Value(0u).boolValue());
  EXPECT_TRUE(Value(0.1).boolValue());
  EXPECT_FALSE(Value(0.0).boolValue());
  EXPECT_FALSE(Value(-0.0).boolValue());
  EXPECT_TRUE(Value(true).boolValue());
  EXPECT_FALSE(Value(false).boolValue());
  EXPECT_FALSE(Value().boolValue());
  EXPECT_FALSE(Value(Array{true}).boolValue());
  EXPECT_FALSE(Value(Dictionary{{"a", true}}).boolValue());
}

// ---- types ----

TEST(ValueTest, TypesAndIsNumber) {
  EXPECT_EQ(Value().type(), Value::Type::Null);
  EXPECT_EQ(Value(nullptr).type(), Value::Type::Null);
  EXPECT_EQ(Value(true).type(), Value::Type::Boolean);
  EXPECT_EQ(Value(1).type(), Value::Type::Integer);
  EXPECT_EQ(Value(1L).type(), Value::Type::Integer);
  EXPECT_EQ(Value(1LL).type(), Value::Type::Integer);
  EXPECT_EQ(Value(1u).type(), Value::Type::Unsigned);
  EXPECT_EQ(Value(1UL).type(), Value::Type::Unsigned);
  EXPECT_EQ(Value(1.0).type(), Value::Type::Double);
  EXPECT_EQ(Value("s").type(), Value::Type::String);
  EXPECT_EQ(Value(std::string_view("s")).type(), Value::Type::String);
  EXPECT_EQ(Value(Bytes{}).type(), Value::Type::Bytes);
  EXPECT_EQ(Value::date(0).type(), Value::Type::Date);
  EXPECT_EQ(Value::array().type(), Value::Type::Array);
  EXPECT_EQ(Value::dictionary().type(), Value::Type::Dictionary);

  for (const Value& v : {Value(true), Value(0), Value(5u), Value(2.5)}) EXPECT_TRUE(v.isNumber()) << v.description();
  for (const Value& v : {Value(), Value("5"), Value(Bytes{5}), Value::date(5), Value(Array{5}), Value::dictionary()}) {
    EXPECT_FALSE(v.isNumber()) << v.description();
  }
  EXPECT_TRUE(Value(5u).isInteger());
  EXPECT_FALSE(Value(true).isInteger());
}

TEST(ValueTest, TypedAccess) {
  Value s("text");
  ASSERT_NE(s.asString(), nullptr);
  EXPECT_EQ(*s.asString(), "text");
  EXPECT_EQ(s.stringOrEmpty(), "text");
  EXPECT_EQ(Value(5).asString(), nullptr);
  EXPECT_EQ(Value(5).stringOrEmpty(), "");
  EXPECT_EQ(Value(5).asArray(), nullptr);
  EXPECT_EQ(Value(5).asDictionary(), nullptr);
  EXPECT_EQ(Value(5).asBytes(), nullptr);
  EXPECT_EQ(Value(5).asDate(), nullptr);
  EXPECT_EQ(Value::date(12.5).asDate()->secondsSince1970, 12.5);
  EXPECT_EQ(*Value(Bytes{1, 2}).asBytes(), (Bytes{1, 2}));
  EXPECT_TRUE(Value(5)["key"].isNull());
  Value d(Dictionary{{"key", "v"}});
  EXPECT_EQ(d["key"], Value("v"));
  EXPECT_TRUE(d["other"].isNull());
}

// ---- containers: copies and the live map ----

TEST(ValueTest, CopyingAValueSharesTheLiveContainer) {
  Value original(Dictionary{{"a", 1}});
  Value alias = original;
  EXPECT_TRUE(alias.sharesContainerWith(original));
  alias.asDictionary()->set("b", 2);
  EXPECT_EQ(original.asDictionary()->size(), 2u);
  EXPECT_EQ(original["b"], Value(2));

  Value list(Array{1});
  Value listAlias = list;
  listAlias.asArray()->push_back(2);
  EXPECT_EQ(list.asArray()->size(), 2u);
  EXPECT_TRUE(list.sharesContainerWith(listAlias));
}

TEST(ValueTest, CopyMakesANewContainerOneLevelDeep) {
  Value inner(Dictionary{{"x", 1}});
  Value original(Dictionary{{"a", 1}, {"inner", inner}, {"list", Array{1, 2}}});
  Value copy = original.copy();
  EXPECT_FALSE(copy.sharesContainerWith(original));
  EXPECT_EQ(copy, original);
  copy.asDictionary()->set("a", 99);
  copy.asDictionary()->erase("list");
  EXPECT_EQ(original["a"], Value(1));
  EXPECT_TRUE(original.asDictionary()->contains("list"));
  // One level only: nested containers are still the same.
  EXPECT_TRUE(copy["inner"].sharesContainerWith(original["inner"]));

  Value array(Array{inner, 3});
  Value arrayCopy = array.copy();
  EXPECT_FALSE(arrayCopy.sharesContainerWith(array));
  arrayCopy.asArray()->push_back(4);
  EXPECT_EQ(array.asArray()->size(), 2u);
  EXPECT_TRUE((*arrayCopy.asArray())[0].sharesContainerWith(inner));

  // Scalars copy as they are.
  EXPECT_EQ(Value("s").copy(), Value("s"));
  EXPECT_FALSE(Value("s").sharesContainerWith(Value("s")));
}

TEST(ValueTest, DeepCopyCopiesEveryLevel) {
  Value inner(Dictionary{{"x", Array{1, Dictionary{{"y", 2}}}}});
  Value original(Array{inner, "s"});
  Value deep = original.deepCopy();
  EXPECT_EQ(deep, original);
  EXPECT_FALSE(deep.sharesContainerWith(original));
  const Value& deepInner = (*deep.asArray())[0];
  EXPECT_FALSE(deepInner.sharesContainerWith(inner));
  EXPECT_FALSE(deepInner["x"].sharesContainerWith(inner["x"]));
  EXPECT_FALSE((*deepInner["x"].asArray())[1].sharesContainerWith((*inner["x"].asArray())[1]));
  (*inner.asDictionary()->find("x")->asArray())[1].asDictionary()->set("y", 3);
  EXPECT_EQ((*inner["x"].asArray())[1]["y"], Value(3));
  EXPECT_EQ((*deepInner["x"].asArray())[1]["y"], Value(2));
}

TEST(ValueTest, TwoEmptyContainersAreEqualButNotShared) {
  Value a = Value::dictionary();
  Value b = Value::dictionary();
  EXPECT_EQ(a, b);
  EXPECT_FALSE(a.sharesContainerWith(b));
  EXPECT_FALSE(Value::array().sharesContainerWith(Value::dictionary()));
}

// ---- dictionary ----

TEST(DictionaryTest, KeepsKeysSortedBytewise) {
  Dictionary d;
  for (const char* key : {"beta", "alpha", "Zeta", "_x", "alphabet", ""}) d.set(key, key);
  std::vector<std::string> keys;
  for (const auto& [k, v] : d) keys.push_back(k);
  EXPECT_EQ(keys, (std::vector<std::string>{"", "Zeta", "_x", "alpha", "alphabet", "beta"}));
}

TEST(DictionaryTest, SetReplacesFindEraseAndGet) {
  Dictionary d{{"a", 1}, {"b", 2}, {"a", 3}};  // a later duplicate replaces
  EXPECT_EQ(d.size(), 2u);
  EXPECT_EQ(d.get("a"), Value(3));
  d.set("b", "two");
  EXPECT_EQ(d.size(), 2u);
  EXPECT_EQ(d.get("b"), Value("two"));
  ASSERT_NE(d.find("b"), nullptr);
  *d.find("b") = Value(22);
  EXPECT_EQ(d.get("b"), Value(22));
  EXPECT_EQ(d.find("c"), nullptr);
  EXPECT_FALSE(d.contains("c"));
  EXPECT_TRUE(d.get("c").isNull());
  EXPECT_TRUE(d.erase("a"));
  EXPECT_FALSE(d.erase("a"));
  EXPECT_FALSE(d.contains("a"));
  EXPECT_EQ(d.size(), 1u);
  d.clear();
  EXPECT_TRUE(d.empty());
  EXPECT_TRUE(d.get("b").isNull());
}

TEST(DictionaryTest, NullValueIsPresent) {
  Dictionary d{{"none", nullptr}};
  EXPECT_TRUE(d.contains("none"));
  EXPECT_TRUE(d.get("none").isNull());
}

// ---- equality ----

TEST(ValueTest, EqualityAcrossSignedness) {
  EXPECT_EQ(Value(5), Value(5u));
  EXPECT_EQ(Value(5u), Value(5));
  EXPECT_EQ(Value(0), Value(0u));
  EXPECT_EQ(Value(kInt64Max), Value(static_cast<std::uint64_t>(kInt64Max)));
  EXPECT_NE(Value(-1), Value(kUInt64Max));
  EXPECT_NE(Value(kUInt64Max), Value(-1));
  EXPECT_NE(Value(kInt64Max), Value(static_cast<std::uint64_t>(kInt64Max) + 1));
  EXPECT_NE(Value(5), Value(6u));
}

TEST(ValueTest, EqualityOfOtherTypes) {
  // Only integers compare across types: a boolean, an integer and a double are apart.
  EXPECT_NE(Value(1), Value(1.0));
  EXPECT_NE(Value(true), Value(1));
  EXPECT_NE(Value("1"), Value(1));
  EXPECT_NE(Value(), Value(0));
  EXPECT_EQ(Value(), Value(nullptr));
  EXPECT_EQ(Value(2.5), Value(2.5));
  EXPECT_NE(Value(std::nan("")), Value(std::nan("")));
  EXPECT_EQ(Value("a"), Value(std::string("a")));
  EXPECT_EQ(Value(Bytes{1, 2}), Value(Bytes{1, 2}));
  EXPECT_NE(Value(Bytes{1, 2}), Value(Bytes{1, 3}));
  EXPECT_EQ(Value::date(5), Value::date(5));
  EXPECT_NE(Value::date(5), Value(5.0));
  EXPECT_EQ(Value(Array{1, "a"}), Value(Array{1u, "a"}));
  EXPECT_NE(Value(Array{1, "a"}), Value(Array{"a", 1}));
  EXPECT_EQ(Value(Dictionary{{"k", 1}, {"j", Array{}}}), Value(Dictionary{{"j", Array{}}, {"k", 1u}}));
  EXPECT_NE(Value(Dictionary{{"k", 1}}), Value(Dictionary{{"k", 2}}));
  EXPECT_NE(Value(Dictionary{{"k", 1}}), Value(Dictionary{{"k2", 1}}));
  EXPECT_NE(Value(Array{}), Value(Dictionary{}));
}

// ---- description ----

TEST(ValueTest, DescriptionOfANestedExample) {
  Value v(Dictionary{
      {"name", "Zed \"Q\"\n\\"},
      {"count", 3},
      {"ratio", 0.5},
      {"ok", true},
      {"off", false},
      {"none", nullptr},
      {"big", Value(kUInt64Max)},
      {"neg", -42},
      {"data", Bytes{0x00, 0xab, 0x10}},
      {"when", Value::date(86400.75)},
      {"list", Array{1, "two", Array{}, Dictionary{}, Array{Dictionary{{"z", 0.1}}}}},
      {"tab", "a\tb\x01\r"},
  });
  EXPECT_EQ(v.description(),
            "{\"big\": 18446744073709551615, \"count\": 3, \"data\": <00ab10>, "
            "\"list\": [1, \"two\", [], {}, [{\"z\": 0.10000000000000001}]], "
            "\"name\": \"Zed \\\"Q\\\"\\n\\\\\", \"neg\": -42, \"none\": null, \"off\": false, \"ok\": true, "
            "\"ratio\": 0.5, \"tab\": \"a\\tb\\u0001\\r\", \"when\": 1970-01-02 00:00:00 +0000}");
}

TEST(ValueTest, DescriptionOfScalars) {
  EXPECT_EQ(Value().description(), "null");
  EXPECT_EQ(Value(3.0).description(), "3");
  EXPECT_EQ(Value(-0.0).description(), "-0");
  EXPECT_EQ(Value(1e21).description(), "1e+21");
  EXPECT_EQ(Value(kInt64Min).description(), "-9223372036854775808");
  EXPECT_EQ(Value(Bytes{}).description(), "<>");
  EXPECT_EQ(Value("").description(), "\"\"");
  EXPECT_EQ(Value(Dictionary{{"k\"", "v"}}).description(), "{\"k\\\"\": \"v\"}");
  EXPECT_EQ(Value::date(0).description(), "1970-01-01 00:00:00 +0000");
  EXPECT_EQ(Value::date(-0.5).description(), "1969-12-31 23:59:59 +0000");
  EXPECT_EQ(Value::date(1700000000).description(), "2023-11-14 22:13:20 +0000");
  // Beyond the calendar, and not-a-number, print the seconds.
  EXPECT_EQ(Value::date(1e300).description(), "1.0000000000000001e+300");
  EXPECT_EQ(Value::date(-1e18).description(), "-1e+18");
  EXPECT_EQ(Value::date(std::nan("")).description(), "nan");
}

// ---- size estimate ----
//
// The figures below hold for LP64 with libstdc++ (x86-64 and arm64 Linux): a Value is
// 40 bytes and a dictionary entry (a string key and a Value) 72.
static_assert(sizeof(Value) == 40);
static_assert(sizeof(Dictionary::Entry) == 72);

TEST(ValueSizeTest, AllocationSizes) {
  EXPECT_EQ(Value().allocationSize(), 16);
  EXPECT_EQ(Value(true).allocationSize(), 16);
  EXPECT_EQ(Value(7).allocationSize(), 16);
  EXPECT_EQ(Value(7u).allocationSize(), 16);
  EXPECT_EQ(Value(7.5).allocationSize(), 16);
  EXPECT_EQ(Value::date(7).allocationSize(), 16);
  // Strings: 32 for the object; from 16 characters on, the text in 16-byte granules
  // including its terminating zero.
  EXPECT_EQ(Value("").allocationSize(), 32);
  EXPECT_EQ(Value(std::string(15, 'x')).allocationSize(), 32);
  EXPECT_EQ(Value(std::string(16, 'x')).allocationSize(), 32 + 32);
  EXPECT_EQ(Value(std::string(31, 'x')).allocationSize(), 32 + 32);
  EXPECT_EQ(Value(std::string(32, 'x')).allocationSize(), 32 + 48);
  // Bytes: 32 plus the data in granules.
  EXPECT_EQ(Value(Bytes{}).allocationSize(), 32);
  EXPECT_EQ(Value(Bytes(1)).allocationSize(), 48);
  EXPECT_EQ(Value(Bytes(16)).allocationSize(), 48);
  EXPECT_EQ(Value(Bytes(17)).allocationSize(), 64);
  // Containers: 48 plus their element storage in granules (capacity for arrays,
  // entries for dictionaries).
  EXPECT_EQ(Value::array().allocationSize(), 48);
  EXPECT_EQ(Value::dictionary().allocationSize(), 48);
  EXPECT_EQ(Value(Array{1, 2}).allocationSize(), 48 + 80);
  Array reserved;
  reserved.reserve(10);
  EXPECT_EQ(Value(std::move(reserved)).allocationSize(), 48 + 400);
  EXPECT_EQ(Value(Dictionary{{"a", 1}}).allocationSize(), 48 + 80);
  EXPECT_EQ(Value(Dictionary{{"a", 1}, {"b", 2}, {"c", 3}}).allocationSize(), 48 + 224);
}

TEST(ValueSizeTest, EstimateOfScalarsIsTheirAllocation) {
  EXPECT_EQ(Value(7).sizeEstimate(), 16);
  EXPECT_EQ(Value(std::string(20, 'x')).sizeEstimate(), 64);
  EXPECT_EQ(Value::array().sizeEstimate(), 48);
}

TEST(ValueSizeTest, EstimateCountsValuesTwice) {
  // {"k": "v"}: the dictionary (48 + 80), the key (32), and the value's estimate (32)
  // plus its allocation (32) again.
  EXPECT_EQ(Value(Dictionary{{"k", "v"}}).sizeEstimate(), 128 + 32 + 32 + 32);

  // {"a": 1, "list": [true, 2.5], "name": <18 characters>}
  //   dictionary: 48 + granules(3 * 72) = 272
  //   keys: 3 * 32 = 96
  //   1: 16 + 16 = 32
  //   "telemetry-client-x": 64 + 64 = 128
  //   [true, 2.5]: the array 48 + 80 = 128, its estimate 128 + 2 * (16 + 16) = 192,
  //                so 192 + 128 = 320
  //   total 272 + 96 + 32 + 128 + 320 = 848
  Value v(Dictionary{{"a", 1}, {"name", "telemetry-client-x"}, {"list", Array{true, 2.5}}});
  EXPECT_EQ(v.sizeEstimate(), 848);

  // Nesting doubles again at each level: [[7]] = 48+48 + (48+48 + (16+16) + 48+48).
  Value nested(Array{Value(Array{7})});
  EXPECT_EQ(nested.sizeEstimate(), 96 + (96 + 32) + 96);
}

TEST(ValueSizeTest, EstimateWrapsIn32Bits) {
  // Bytes are shared between copies, so sixteen elements can name one 64 MiB buffer:
  // each element counts 2 * (32 + 64 MiB) = 134217792, sixteen of them 2147484672,
  // plus the array 48 + 16 * 40 = 688: 2147485360, past INT32_MAX by 1713, which
  // wraps to -2147481936.
  Value big(Bytes(64 * 1024 * 1024));
  Value array(Array(16, big));
  EXPECT_EQ(array.allocationSize(), 688);
  EXPECT_EQ(big.sizeEstimate(), 32 + 64 * 1024 * 1024);
  EXPECT_EQ(array.sizeEstimate(), -2147481936);
  // Fifteen stay below the limit: 15 * 134217792 + 48 + 15 * 40 (in granules: 608).
  Value fifteen(Array(15, big));
  EXPECT_EQ(fifteen.sizeEstimate(), 15 * 134217792 + 48 + 608);
}

}  // namespace

TEST(Dictionary, AppendInOrderAddsAfterTheLastKeyAndReplacesAnEqualLastKey) {
  telvane::Dictionary d;
  d.appendInOrder("a", telvane::Value(1));
  d.appendInOrder("b", telvane::Value(2));
  d.appendInOrder("b", telvane::Value(3));
  ASSERT_EQ(d.size(), 2u);
  EXPECT_EQ(d.get("a").integerValue(), 1);
  EXPECT_EQ(d.get("b").integerValue(), 3);
  d.set("ab", telvane::Value(4));
  std::vector<std::string> keys;
  for (const auto& [k, v] : d) keys.push_back(k);
  EXPECT_EQ(keys, (std::vector<std::string>{"a", "ab", "b"}));
}
