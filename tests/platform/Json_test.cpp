#include "platform/Json.h"

#include <gtest/gtest.h>
#include <rapidjson/document.h>

#include <cmath>
#include <limits>
#include <atomic>
#include <random>
#include <thread>
#include <vector>

using namespace telvane;

namespace {

std::string written(const Value& v, bool pretty = false) {
  auto r = json::write(v, pretty);
  EXPECT_TRUE(r.ok()) << r.error();
  return r.ok() ? r.value() : std::string();
}

// Reads JSON text with RapidJSON's own document parser, at full precision.
rapidjson::Document document(const std::string& text) {
  rapidjson::Document d;
  d.Parse<rapidjson::kParseFullPrecisionFlag>(text.c_str(), text.size());
  EXPECT_FALSE(d.HasParseError()) << text;
  return d;
}

Value nestedArrays(int depth) {
  Value v = Value::array();
  for (int i = 1; i < depth; ++i) v = Value(Array{v});
  return v;
}

// A value made only of types that JSON carries unchanged.
Value randomValue(std::mt19937& rng, int depth) {
  switch (rng() % (depth > 3 ? 6 : 8)) {
    case 0: return Value();
    case 1: return Value(rng() % 2 == 0);
    case 2: return Value(static_cast<long long>(rng()) - (1LL << 31));
    case 3: return Value(std::ldexp(static_cast<double>(rng()) + 0.5, static_cast<int>(rng() % 200) - 100));
    case 4: return Value(std::string("s\"\\\n") + std::to_string(rng()) + "é");
    case 5: return Value(static_cast<unsigned long long>(rng()) << 33 | (1ULL << 63));
    case 6: {
      Array a;
      for (int n = rng() % 5; n > 0; --n) a.push_back(randomValue(rng, depth + 1));
      return Value(std::move(a));
    }
    default: {
      Dictionary d;
      for (int n = rng() % 5; n > 0; --n) d.set("k" + std::to_string(rng() % 10), randomValue(rng, depth + 1));
      return Value(std::move(d));
    }
  }
}

}  // namespace

TEST(Json, WritesCompactTextWithSortedKeys) {
  Value v(Dictionary{{"b", Value(Array{true, false, nullptr})}, {"a", 1}, {"c", "x"}, {"d", -7}});
  EXPECT_EQ(written(v), R"({"a":1,"b":[true,false,null],"c":"x","d":-7})");
  EXPECT_EQ(written(Value(std::numeric_limits<unsigned long long>::max())), "18446744073709551615");
  EXPECT_EQ(written(Value(std::numeric_limits<long long>::min())), "-9223372036854775808");
  EXPECT_EQ(written(Value::dictionary()), "{}");
  EXPECT_EQ(written(Value::array()), "[]");
  EXPECT_EQ(written(Value("top")), R"("top")");
}

TEST(Json, BytesBecomeBase64AndDatesSecondsSince1970) {
  EXPECT_EQ(written(Value(Bytes{0, 1, 2, 255})), R"("AAEC/w==")");
  EXPECT_EQ(written(Value(Bytes{})), R"("")");
  EXPECT_EQ(written(Value::date(1700000000.25)), "1700000000.25");
  EXPECT_EQ(written(Value::date(-1.5)), "-1.5");
}

TEST(Json, DoublesUseTheShortestTextThatReadsBackExactly) {
  EXPECT_EQ(written(Value(0.1)), "0.1");
  EXPECT_EQ(written(Value(-0.0)), "-0.0");
  EXPECT_EQ(written(Value(1.0)), "1.0");
  EXPECT_EQ(written(Value(1e300)), "1e300");
  EXPECT_EQ(written(Value(0.75)), "0.75");
  for (double d : {0.1, -0.0, 1e300, 123456789.123456789, 5e-324, 2.2250738585072014e-308,
                   std::numeric_limits<double>::max(), 1.0 / 3.0, -2.5e-7, 9007199254740993.0}) {
    std::string text = written(Value(d));
    rapidjson::Document doc = document(text);
    ASSERT_TRUE(doc.IsDouble()) << text;
    EXPECT_EQ(doc.GetDouble(), d) << text;
    EXPECT_EQ(std::signbit(doc.GetDouble()), std::signbit(d)) << text;
    auto ours = json::parse(text);
    ASSERT_TRUE(ours.ok());
    EXPECT_EQ(ours.value().doubleValue(), d) << text;
  }
}

TEST(Json, NaNAndInfinityAreRefusedAsAWhole) {
  auto nan = json::write(Value(std::nan("")));
  ASSERT_FALSE(nan.ok());
  EXPECT_EQ(nan.error(), "value not representable in JSON: " + Value(std::nan("")).description());
  auto inf = json::write(Value(Dictionary{{"ok", 1}, {"x", Value(Array{1, INFINITY})}}));
  ASSERT_FALSE(inf.ok());
  EXPECT_EQ(inf.error(), "value not representable in JSON: inf");
  EXPECT_FALSE(json::write(Value::date(-INFINITY)).ok());
  std::string out = "[1,";
  EXPECT_FALSE(json::writeTo(out, Value(Array{1, 2, -INFINITY})));
  EXPECT_EQ(out, "[1,");
}

TEST(Json, EscapesStringsSoThatAParserReadsThemBack) {
  const std::string tricky = std::string("quote\" backslash\\ slash/ \b\f\n\r\t \x01\x1f\x7f ") + '\0' +
                             " é 中文 🙂 end";
  std::string text = written(Value(Dictionary{{tricky, tricky}}));
  EXPECT_NE(text.find(R"(quote\" backslash\\ slash/ \b\f\n\r\t \u0001\u001F)"), std::string::npos) << text;
  EXPECT_NE(text.find(R"(\u0000)"), std::string::npos);
  EXPECT_NE(text.find("é 中文 🙂"), std::string::npos);  // UTF-8 goes out as it is
  rapidjson::Document doc = document(text);
  ASSERT_TRUE(doc.IsObject());
  const auto& member = *doc.MemberBegin();
  EXPECT_EQ(std::string(member.name.GetString(), member.name.GetStringLength()), tricky);
  EXPECT_EQ(std::string(member.value.GetString(), member.value.GetStringLength()), tricky);
}

TEST(Json, InvalidUtf8IsRefusedInValuesAndKeys) {
  const std::string bad[] = {"\xff", "abc\xe2\x82", "\xc0\xaf", "\xed\xa0\x80", "\xf4\x90\x80\x80", "\x80",
                             "ok\xf0\x9f\x99", "\xe0\x80\xaf"};
  for (const auto& s : bad) {
    EXPECT_FALSE(json::isValidUtf8(s)) << Value(s).description();
    auto r = json::write(Value(Array{Value(s)}));
    ASSERT_FALSE(r.ok());
    EXPECT_EQ(r.error(), "value not representable in JSON: " + Value(s).description());
    EXPECT_FALSE(json::write(Value(Dictionary{{s, 1}})).ok());
  }
  for (const std::string good : {"", "plain ascii text longer than eight", "é", "\xef\xbf\xbf", "\xf4\x8f\xbf\xbf",
                                 "🙂🙂🙂🙂🙂🙂", "\xed\x9f\xbf"}) {
    EXPECT_TRUE(json::isValidUtf8(good)) << good;
  }
}

TEST(Json, PrettyOutputIndentsAndReadsBackTheSame) {
  Value v(Dictionary{{"list", Value(Array{1, 2})}, {"name", "x"}});
  std::string pretty = written(v, true);
  EXPECT_EQ(pretty, "{\n    \"list\": [\n        1,\n        2\n    ],\n    \"name\": \"x\"\n}");
  auto back = json::parse(pretty);
  ASSERT_TRUE(back.ok());
  EXPECT_EQ(back.value(), v);
}

TEST(Json, WriteToAppendsForBatches) {
  std::string batch = "[";
  ASSERT_TRUE(json::writeTo(batch, Value(Dictionary{{"n", 1}})));
  batch += ',';
  ASSERT_TRUE(json::writeTo(batch, Value(Dictionary{{"n", 2}})));
  batch += ']';
  EXPECT_EQ(batch, R"([{"n":1},{"n":2}])");
  EXPECT_TRUE(document(batch).IsArray());
}

TEST(Json, AFailedWriteLeavesNothingBehindForTheNextOne) {
  EXPECT_FALSE(json::write(Value(Dictionary{{"a", Value(Array{1, Value(Dictionary{{"b", NAN}})})}})).ok());
  EXPECT_EQ(written(Value(Array{1, 2})), "[1,2]");
  std::string big(3 << 20, 'x');
  EXPECT_EQ(written(Value(big)).size(), big.size() + 2);
  EXPECT_EQ(written(Value("small")), R"("small")");
  EXPECT_FALSE(json::write(Value("\xc3")).ok());
  EXPECT_EQ(written(Value(Dictionary{{"k", "v"}}), true), "{\n    \"k\": \"v\"\n}");
}

TEST(Json, ThreadsWriteConcurrently) {
  std::vector<std::thread> threads;
  std::atomic<int> mismatches{0};
  for (int t = 0; t < 4; ++t) {
    threads.emplace_back([t, &mismatches] {
      for (int i = 0; i < 500; ++i) {
        Value v(Dictionary{{"thread", t}, {"i", i}, {"bad", i % 7 == 0 ? Value(NAN) : Value(1)}});
        auto r = json::write(v);
        std::string expected = R"({"bad":1,"i":)" + std::to_string(i) + R"(,"thread":)" + std::to_string(t) + "}";
        if (i % 7 == 0 ? r.ok() : (!r.ok() || r.value() != expected)) ++mismatches;
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(mismatches.load(), 0);
}

TEST(Json, NestingIsBoundedBothWays) {
  EXPECT_TRUE(json::write(nestedArrays(json::kMaxNestingDepth)).ok());
  auto tooDeep = json::write(nestedArrays(json::kMaxNestingDepth + 1));
  ASSERT_FALSE(tooDeep.ok());
  EXPECT_EQ(tooDeep.error(), "value not representable in JSON: nesting deeper than 512 levels");

  std::string ok = std::string(json::kMaxNestingDepth, '[') + std::string(json::kMaxNestingDepth, ']');
  EXPECT_TRUE(json::parse(ok).ok());
  std::string deep = std::string(json::kMaxNestingDepth + 1, '[') + std::string(json::kMaxNestingDepth + 1, ']');
  EXPECT_EQ(json::parse(deep).error(), "JSON nested deeper than 512 levels at offset 513");
  std::string hostile;
  for (int i = 0; i < 200000; ++i) hostile += "{\"a\":";
  EXPECT_FALSE(json::parse(hostile).ok());
}

TEST(Json, ParsesNumbersIntoTheNarrowestFittingType) {
  auto r = json::parse(R"([1, -1, 9223372036854775807, 9223372036854775808, 18446744073709551615,
                          -9223372036854775808, 18446744073709551616, 1.5, 1e2, 0.1, -0.0])");
  ASSERT_TRUE(r.ok()) << r.error();
  const Array& a = *r.value().asArray();
  ASSERT_EQ(a.size(), 11u);
  EXPECT_EQ(a[0].type(), Value::Type::Integer);
  EXPECT_EQ(a[1].integerValue(), -1);
  EXPECT_EQ(a[2].type(), Value::Type::Integer);
  EXPECT_EQ(a[3].type(), Value::Type::Unsigned);
  EXPECT_EQ(a[3].unsignedLongLongValue(), 9223372036854775808ULL);
  EXPECT_EQ(a[4].unsignedLongLongValue(), 18446744073709551615ULL);
  EXPECT_EQ(a[5].integerValue(), std::numeric_limits<long long>::min());
  EXPECT_EQ(a[6].type(), Value::Type::Double);
  EXPECT_EQ(a[6].doubleValue(), 18446744073709551616.0);
  EXPECT_EQ(a[7], Value(1.5));
  EXPECT_EQ(a[8].type(), Value::Type::Double);
  EXPECT_EQ(a[9].doubleValue(), 0.1);
  EXPECT_TRUE(std::signbit(a[10].doubleValue()));
}

TEST(Json, NumbersBeyondADoubleBecomeZeroWhenTinyAndAreRefusedWhenHuge) {
  const std::vector<std::string> tinyNumbers = {"1e-400", "0.0000000001e-320", "0." + std::string(400, '0') + "1",
                                                "0e47", "0e-5"};
  for (const auto& tiny : tinyNumbers) {
    auto r = json::parse(tiny);
    ASSERT_TRUE(r.ok()) << tiny << ": " << r.error();
    EXPECT_TRUE(r.value().isDouble()) << tiny;
    EXPECT_EQ(r.value().doubleValue(), 0.0) << tiny;
  }
  auto negative = json::parse("-1e-400");
  ASSERT_TRUE(negative.ok());
  EXPECT_TRUE(std::signbit(negative.value().doubleValue()));
  EXPECT_EQ(json::parse("5e-324").value().doubleValue(), 5e-324);
  const std::string huge = "1" + std::string(400, '0');
  EXPECT_EQ(json::parse("[" + huge + "]").error(), "JSON parse error at offset 1: Number too big to be stored in double.");
  EXPECT_FALSE(json::parse("17976931348623159e292").ok());
  EXPECT_FALSE(json::parse("-17976931348623159e292").ok());
  EXPECT_EQ(json::parse("17976931348623157e292").value().doubleValue(), std::numeric_limits<double>::max());
  EXPECT_EQ(json::parse("-0").value(), Value(0));
  EXPECT_EQ(json::parse("-9223372036854775809").value().type(), Value::Type::Double);
}

TEST(Json, ParsesObjectsIntoSortedDictionariesWithTheLastRepeatWinning) {
  auto r = json::parse(R"( {"z": "\u00e9\ud83d\ude42", "a": {"x": [true, null]}, "z": "last"} )");
  ASSERT_TRUE(r.ok()) << r.error();
  EXPECT_EQ(r.value(), Value(Dictionary{{"a", Value(Dictionary{{"x", Value(Array{true, nullptr})}})}, {"z", "last"}}));
  auto escaped = json::parse(R"("\u00e9\ud83d\ude42\u0000x")");
  ASSERT_TRUE(escaped.ok());
  EXPECT_EQ(escaped.value(), Value(std::string("é🙂\0x", 8)));
}

TEST(Json, RefusesMalformedTextWithTheReadersMessage) {
  EXPECT_EQ(json::parse("").error(), "JSON parse error at offset 0: The document is empty.");
  EXPECT_EQ(json::parse("[1,]").error(), "JSON parse error at offset 3: Invalid value.");
  EXPECT_EQ(json::parse("1 2").error(),
            "JSON parse error at offset 2: The document root must not be followed by other values.");
  EXPECT_EQ(json::parse(std::string("1\0{", 3)).error(), "JSON parse error at offset 1: zero byte after the document");
  for (const char* bad : {"{", "{\"a\"}", "tru", "\"abc", "[1 2]", "{1:2}", "1e400", "\"\\x\"", "\"\xff\"", "nan",
                          "'a'", "[1,2", "01"}) {
    auto r = json::parse(bad);
    EXPECT_FALSE(r.ok()) << bad;
    EXPECT_EQ(r.error().rfind("JSON parse error at offset ", 0), 0u) << r.error();
  }
}

TEST(Json, RandomValuesRoundTripThroughTheText) {
  std::mt19937 rng(7);
  for (int i = 0; i < 500; ++i) {
    Value v = randomValue(rng, 0);
    std::string text = written(v, i % 2 == 1);
    auto back = json::parse(text);
    ASSERT_TRUE(back.ok()) << back.error() << " in " << text;
    EXPECT_EQ(back.value(), v) << text;
    document(text);  // RapidJSON's own parser accepts it too
  }
}

TEST(Json, RandomBytesNeverCrashTheReader) {
  std::mt19937 rng(99);
  const std::string alphabet = "{}[]\":,0123456789.eE+-truefalsnl \\u\x80\xff";
  std::size_t parsed = 0;
  for (int i = 0; i < 20000; ++i) {
    std::string text(rng() % 40, ' ');
    for (auto& c : text) c = alphabet[rng() % alphabet.size()];
    auto r = json::parse(text);
    if (r.ok()) {
      ++parsed;
      EXPECT_TRUE(json::write(r.value()).ok()) << text;
    }
  }
  EXPECT_GT(parsed, 0u);
}
