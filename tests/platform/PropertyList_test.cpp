#include "platform/PropertyList.h"

#include <gtest/gtest.h>
#include <plist/plist.h>

#include <cmath>
#include <cstdlib>
#include <limits>
#include <random>

using namespace telvane;

namespace {

const double kSecondsFrom1970To2001 = 978307200.0;

Value sample() {
  return Value(Dictionary{
      {"string", "héllo <&> \"q\" 'a' 🙂"},
      {"empty", ""},
      {"zero", 0},
      {"negative", -42},
      {"min", std::numeric_limits<long long>::min()},
      {"max", std::numeric_limits<long long>::max()},
      {"unsignedMax", std::numeric_limits<unsigned long long>::max()},
      {"unsignedHalf", 9223372036854775808ULL},
      {"real", 0.1},
      {"big", 1e300},
      {"yes", true},
      {"no", false},
      {"data", Value(Bytes{0, 1, 2, 0xfe, 0xff})},
      {"noData", Value(Bytes{})},
      {"list", Value(Array{1, "two", Value(Array{}), Value(Dictionary{{"deep", Value(Array{3.5})}})})},
      {"dict", Value::dictionary()},
      {"when", Value::date(1700000000.0)},
  });
}

Value nestedArrays(int depth) {
  Value v = Value::array();
  for (int i = 1; i < depth; ++i) v = Value(Array{v});
  return v;
}

// ---- a small writer of binary lists, for shapes the library would never write ----

void appendBigEndian(Bytes& out, std::uint64_t v, int width) {
  for (int i = width - 1; i >= 0; --i) out.push_back(static_cast<std::uint8_t>(v >> (8 * i)));
}

// An array object referencing the given objects, with 4-byte references.
Bytes arrayObject(const std::vector<std::uint64_t>& refs) {
  Bytes o;
  if (refs.size() < 15) {
    o.push_back(static_cast<std::uint8_t>(0xA0 | refs.size()));
  } else {
    o.push_back(0xAF);
    o.push_back(0x12);
    appendBigEndian(o, refs.size(), 4);
  }
  for (auto r : refs) appendBigEndian(o, r, 4);
  return o;
}

// A dictionary object of up to 14 entries: key references, then value references.
Bytes dictObject(const std::vector<std::uint64_t>& keys, const std::vector<std::uint64_t>& values) {
  Bytes o{static_cast<std::uint8_t>(0xD0 | keys.size())};
  for (auto r : keys) appendBigEndian(o, r, 4);
  for (auto r : values) appendBigEndian(o, r, 4);
  return o;
}

Bytes asciiObject(const std::string& s) {
  Bytes o{static_cast<std::uint8_t>(0x50 | s.size())};
  o.insert(o.end(), s.begin(), s.end());
  return o;
}

Bytes binaryList(const std::vector<Bytes>& objects) {
  Bytes out{'b', 'p', 'l', 'i', 's', 't', '0', '0'};
  std::vector<std::uint64_t> offsets;
  for (const auto& o : objects) {
    offsets.push_back(out.size());
    out.insert(out.end(), o.begin(), o.end());
  }
  std::uint64_t table = out.size();
  for (auto offset : offsets) appendBigEndian(out, offset, 4);
  for (int i = 0; i < 6; ++i) out.push_back(0);
  out.push_back(4);  // offset width
  out.push_back(4);  // reference width
  appendBigEndian(out, objects.size(), 8);
  appendBigEndian(out, 0, 8);  // root: object 0
  appendBigEndian(out, table, 8);
  return out;
}

}  // namespace

TEST(PropertyList, BinaryRoundTripKeepsEveryType) {
  auto bytes = plist::encodeBinary(sample());
  ASSERT_TRUE(bytes.ok()) << bytes.error();
  EXPECT_EQ(std::string(bytes.value().begin(), bytes.value().begin() + 8), "bplist00");
  auto back = plist::decode(bytes.value());
  ASSERT_TRUE(back.ok()) << back.error();
  EXPECT_EQ(back.value(), sample());
  EXPECT_EQ(back.value()["unsignedMax"].type(), Value::Type::Unsigned);
  EXPECT_EQ(back.value()["min"].type(), Value::Type::Integer);
}

TEST(PropertyList, XmlRoundTripKeepsEveryType) {
  auto xml = plist::encodeXml(sample());
  ASSERT_TRUE(xml.ok()) << xml.error();
  EXPECT_NE(xml.value().find("<integer>-9223372036854775808</integer>"), std::string::npos);
  EXPECT_NE(xml.value().find("<integer>18446744073709551615</integer>"), std::string::npos);
  EXPECT_NE(xml.value().find("<date>2023-11-14T22:13:20Z</date>"), std::string::npos);
  auto back = plist::decode(xml.value());
  ASSERT_TRUE(back.ok()) << back.error();
  EXPECT_EQ(back.value(), sample());
}

TEST(PropertyList, TopLevelScalarsAndEmptyContainers) {
  for (const Value& v : {Value("alone"), Value(7), Value(2.5), Value(true), Value::array(), Value::dictionary()}) {
    auto bin = plist::encodeBinary(v);
    ASSERT_TRUE(bin.ok()) << bin.error();
    EXPECT_EQ(plist::decode(bin.value()).value(), v);
    auto xml = plist::encodeXml(v);
    ASSERT_TRUE(xml.ok()) << xml.error();
    EXPECT_EQ(plist::decode(xml.value()).value(), v);
  }
}

TEST(PropertyList, DatesConvertBetweenThe2001And1970Epochs) {
  auto epoch2001 = plist::decode(std::string_view(
      "<?xml version=\"1.0\"?><plist version=\"1.0\"><array><date>2001-01-01T00:00:00Z</date>"
      "<date>1970-01-01T00:00:00Z</date><date>2023-11-14T22:13:20Z</date></array></plist>"));
  ASSERT_TRUE(epoch2001.ok()) << epoch2001.error();
  EXPECT_EQ(epoch2001.value(), Value(Array{Value::date(kSecondsFrom1970To2001), Value::date(0), Value::date(1700000000)}));

  // Binary lists keep the exact double, also just before 2001 and far from it.
  for (double t : {1700000000.123456, kSecondsFrom1970To2001 - 0.5, kSecondsFrom1970To2001 + 0.25, -1.5,
                   -2208988800.0 /* 1900 */, 7258118400.75 /* 2200 */}) {
    auto bin = plist::encodeBinary(Value::date(t));
    ASSERT_TRUE(bin.ok()) << bin.error();
    auto back = plist::decode(bin.value());
    ASSERT_TRUE(back.ok()) << back.error();
    ASSERT_TRUE(back.value().isDate());
    EXPECT_EQ(back.value().asDate()->secondsSince1970, t);
  }
  // XML keeps whole seconds.
  auto xml = plist::encodeXml(Value::date(7258118400.75));
  ASSERT_TRUE(xml.ok());
  EXPECT_NE(xml.value().find("<date>2200-01-01T00:00:00Z</date>"), std::string::npos) << xml.value();
  EXPECT_EQ(plist::decode(xml.value()).value(), Value::date(7258118400.0));
}

TEST(PropertyList, IntegersAboveInt64MaxKeepTheirSignedness) {
  auto xml = plist::decode(std::string_view(
      "<plist><array><integer>-1</integer><integer>18446744073709551615</integer>"
      "<integer>9223372036854775808</integer><integer>42</integer></array></plist>"));
  ASSERT_TRUE(xml.ok()) << xml.error();
  const Array& a = *xml.value().asArray();
  EXPECT_EQ(a[0].type(), Value::Type::Integer);
  EXPECT_EQ(a[0].integerValue(), -1);
  EXPECT_EQ(a[1].type(), Value::Type::Unsigned);
  EXPECT_EQ(a[1].unsignedLongLongValue(), 18446744073709551615ULL);
  EXPECT_EQ(a[2].unsignedLongLongValue(), 9223372036854775808ULL);
  EXPECT_EQ(a[3], Value(42));
  // The same through a binary list.
  auto bin = plist::encodeBinary(xml.value());
  ASSERT_TRUE(bin.ok());
  EXPECT_EQ(plist::decode(bin.value()).value(), xml.value());
  EXPECT_EQ(plist::decode(bin.value()).value().asArray()->at(0).integerValue(), -1);
}

TEST(PropertyList, UidsDecodeAsIntegers) {
  plist_t array = plist_new_array();
  plist_array_append_item(array, plist_new_uid(7));
  char* buffer = nullptr;
  std::uint32_t length = 0;
  plist_to_bin(array, &buffer, &length);
  plist_free(array);
  ASSERT_NE(buffer, nullptr);
  auto r = plist::decode(reinterpret_cast<const std::uint8_t*>(buffer), length);
  std::free(buffer);
  ASSERT_TRUE(r.ok()) << r.error();
  EXPECT_EQ(r.value(), Value(Array{7}));
}

TEST(PropertyList, ValuesWithoutAPropertyListFormAreRefused) {
  EXPECT_EQ(plist::encodeBinary(Value()).error(), "null cannot be encoded in a property list");
  EXPECT_EQ(plist::encodeXml(Value(Dictionary{{"a", Value(Array{1, nullptr})}})).error(),
            "null cannot be encoded in a property list");
  EXPECT_EQ(plist::encodeBinary(Value(std::string("a\0b", 3))).error(),
            "a string with a zero byte cannot be encoded in a property list");
  EXPECT_EQ(plist::encodeXml(Value(Dictionary{{std::string("k\0", 2), 1}})).error(),
            "a string with a zero byte cannot be encoded in a property list");
  EXPECT_EQ(plist::encodeBinary(Value("bad \xff")).error(),
            "a string that is not valid UTF-8 cannot be encoded in a property list");
  EXPECT_FALSE(plist::encodeBinary(Value::date(std::nan(""))).ok());
  EXPECT_FALSE(plist::encodeXml(Value::date(1e15)).ok());
  EXPECT_TRUE(plist::encodeBinary(nestedArrays(plist::kMaxNestingDepth)).ok());
  EXPECT_EQ(plist::encodeBinary(nestedArrays(plist::kMaxNestingDepth + 1)).error(),
            "value nested too deeply for a property list");
}

TEST(PropertyList, MalformedInputFails) {
  EXPECT_EQ(plist::decode(std::string_view("")).error(), "empty property list");
  EXPECT_EQ(plist::decode(std::string_view("garbage")).error(), "malformed XML property list");
  EXPECT_EQ(plist::decode(std::string_view("bplist00")).error(), "binary property list is truncated");
  EXPECT_FALSE(plist::decode(std::string_view("<plist><dict><key>a</key></plist>")).ok());
  EXPECT_FALSE(plist::decode(std::string_view("<plist><integer>1</string></plist>")).ok());

  auto valid = plist::encodeBinary(sample());
  ASSERT_TRUE(valid.ok());
  const Bytes& bin = valid.value();
  for (std::size_t n = 0; n < bin.size(); ++n) {
    EXPECT_FALSE(plist::decode(bin.data(), n).ok()) << "binary cut at " << n;
  }
  auto xml = plist::encodeXml(sample());
  ASSERT_TRUE(xml.ok());
  for (std::size_t n = 0; n + 10 < xml.value().size(); ++n) {
    plist::decode(std::string_view(xml.value()).substr(0, n));  // must not crash
  }
  // Trailer fields that point outside the data.
  Bytes wrongTable = bin;
  wrongTable[wrongTable.size() - 1] ^= 0x80;
  EXPECT_FALSE(plist::decode(wrongTable).ok());
  Bytes hugeCount = bin;
  hugeCount[hugeCount.size() - 20] = 0x7f;
  EXPECT_EQ(plist::decode(hugeCount).error(), "binary property list has a malformed trailer");
}

TEST(PropertyList, HandBuiltBinaryListsDecode) {
  // Object 0 is [object 1, object 2, object 1]: shared objects are fine.
  auto r = plist::decode(binaryList({arrayObject({1, 2, 1}), asciiObject("a"), asciiObject("bc")}));
  ASSERT_TRUE(r.ok()) << r.error();
  EXPECT_EQ(r.value(), Value(Array{"a", "bc", "a"}));
}

TEST(PropertyList, HandBuiltObjectsTheLibraryWouldAssertOnAreRefused) {
  // A key with a zero byte makes the library abort instead of failing.
  auto keyWithZero = plist::decode(binaryList({dictObject({1}, {2}), asciiObject(std::string("a\0b", 3)), Bytes{0x09}}));
  EXPECT_EQ(keyWithZero.error(), "binary property list has a string with a zero byte");
  Bytes utf16Zero{0x62, 0x00, 0x41, 0x00, 0x00};  // "A", then U+0000
  EXPECT_EQ(plist::decode(binaryList({dictObject({1}, {2}), utf16Zero, Bytes{0x09}})).error(),
            "binary property list has a string with a zero byte");
  EXPECT_EQ(plist::decode(binaryList({dictObject({1}, {2}), Bytes{0x10, 0x01}, Bytes{0x09}})).error(),
            "binary property list has a key that is not a string");
  EXPECT_EQ(plist::decode(binaryList({arrayObject({1}), Bytes{0x70}})).error(),
            "binary property list has an object of an unsupported type");
  EXPECT_EQ(plist::decode(binaryList({arrayObject({1}), Bytes{0x14, 0x00}})).error(),
            "binary property list has an object running past its end");
  // Well-formed objects of the other widths are read.
  auto others = plist::decode(binaryList({dictObject({1, 2, 3}, {4, 5, 6}), asciiObject("f"), asciiObject("u"),
                                          Bytes{0x61, 0x00, 0xe9},  // "é" in UTF-16
                                          Bytes{0x22, 0x3f, 0x00, 0x00, 0x00},  // float 0.5
                                          Bytes{0x10, 0xff}, Bytes{0x08}}));
  ASSERT_TRUE(others.ok()) << others.error();
  EXPECT_EQ(others.value(), Value(Dictionary{{"f", 0.5}, {"u", 255}, {"é", false}}));
}

TEST(PropertyList, DeepNestingIsRefusedBeforeTheLibraryRecurses) {
  std::string xml = "<plist version=\"1.0\">";
  for (int i = 0; i < 200000; ++i) xml += "<array>";
  for (int i = 0; i < 200000; ++i) xml += "</array>";
  xml += "</plist>";
  EXPECT_EQ(plist::decode(xml).error(), "property list nested too deeply");

  std::vector<Bytes> chain;
  const int kDepth = 100000;
  for (int i = 0; i < kDepth; ++i) chain.push_back(arrayObject({static_cast<std::uint64_t>(i + 1)}));
  chain.push_back(arrayObject({}));
  EXPECT_EQ(plist::decode(binaryList(chain)).error(), "property list nested too deeply");

  std::vector<Bytes> fine;
  for (int i = 0; i < plist::kMaxNestingDepth - 1; ++i) fine.push_back(arrayObject({static_cast<std::uint64_t>(i + 1)}));
  fine.push_back(arrayObject({}));
  auto r = plist::decode(binaryList(fine));
  ASSERT_TRUE(r.ok()) << r.error();
  EXPECT_EQ(r.value(), nestedArrays(plist::kMaxNestingDepth));
}

TEST(PropertyList, SharedObjectBombsAndCyclesAreRefused) {
  // Each array references the next one twice: 2^60 nodes once expanded.
  std::vector<Bytes> bomb;
  for (int i = 0; i < 60; ++i) bomb.push_back(arrayObject({static_cast<std::uint64_t>(i + 1), static_cast<std::uint64_t>(i + 1)}));
  bomb.push_back(asciiObject("x"));
  EXPECT_EQ(plist::decode(binaryList(bomb)).error(), "binary property list expands to too many objects");

  EXPECT_EQ(plist::decode(binaryList({arrayObject({0})})).error(), "binary property list contains a reference cycle");
  EXPECT_EQ(plist::decode(binaryList({arrayObject({1}), arrayObject({0})})).error(),
            "binary property list contains a reference cycle");
  EXPECT_EQ(plist::decode(binaryList({arrayObject({5})})).error(), "binary property list has a bad object reference");
  Bytes claimsMore = binaryList({arrayObject({1}), asciiObject("x")});
  claimsMore[8] = 0xAF;  // count follows as an integer...
  claimsMore[9] = 0x12;  // ...of four bytes: 0x00000001 then the reference is cut short
  EXPECT_FALSE(plist::decode(claimsMore).ok());
}

TEST(PropertyList, XmlWhoseTagsParsersCouldSplitDifferentlyIsRefused) {
  const std::string refused = "XML property list uses constructs that are not supported";
  EXPECT_EQ(plist::decode(std::string_view("<plist><array a=\"x></array>\"></array></plist>")).error(), refused);
  EXPECT_EQ(plist::decode(std::string_view("<plist><array a='\"'></array></plist>")).error(), refused);
  EXPECT_EQ(plist::decode(std::string_view("<!-- \" --><plist><true/></plist>")).error(), refused);
  EXPECT_EQ(plist::decode(std::string_view("<!DOCTYPE plist [ <!ENTITY a \"b\"> ]><plist><true/></plist>")).error(),
            refused);
  // The usual header, doctype, comments and CDATA are fine.
  auto r = plist::decode(std::string_view(
      "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n"
      "<!DOCTYPE plist PUBLIC \"-//Example//DTD PLIST 1.0//EN\" \"http://www.example.com/DTDs/PropertyList-1.0.dtd\">\n"
      "<!-- a comment -->\n<plist version=\"1.0\"><dict><key>k</key><string><![CDATA[<a>\"]]></string>"
      "<key>q</key><string>it's \"quoted\" &lt;b&gt;</string><key>t</key><true/></dict></plist>\n"));
  ASSERT_TRUE(r.ok()) << r.error();
  EXPECT_EQ(r.value()["t"], Value(true));
  EXPECT_EQ(r.value()["k"], Value("<a>\""));
  EXPECT_EQ(r.value()["q"], Value("it's \"quoted\" <b>"));
}

TEST(PropertyList, RandomAndMutatedInputNeverCrashes) {
  std::mt19937 rng(4242);
  Bytes bin = plist::encodeBinary(sample()).value();
  std::string xml = plist::encodeXml(sample()).value();
  std::size_t decoded = 0;
  for (int i = 0; i < 6000; ++i) {
    Result<Value> r = Result<Value>::failure("");
    switch (i % 3) {
      case 0: {
        Bytes input = bin;
        for (int flips = 1 + rng() % 3; flips > 0; --flips) input[rng() % input.size()] = static_cast<std::uint8_t>(rng());
        r = plist::decode(input);
        break;
      }
      case 1: {
        std::string input = xml;
        for (int flips = 1 + rng() % 3; flips > 0; --flips) input[rng() % input.size()] = static_cast<char>(rng());
        r = plist::decode(input);
        break;
      }
      default: {
        Bytes input{'b', 'p', 'l', 'i', 's', 't', '0', '0'};
        for (int n = rng() % 80; n > 0; --n) input.push_back(static_cast<std::uint8_t>(rng()));
        r = plist::decode(input);
      }
    }
    if (r.ok()) ++decoded;
  }
  EXPECT_GT(decoded, 0u);
}
