#include "platform/MessagePack.h"

#include <gtest/gtest.h>
#include <msgpack.h>

#include <cmath>
#include <cstring>
#include <limits>
#include <random>

using namespace telvane;
namespace mp = telvane::msgpack_codec;

namespace {

std::string encoded(const Value& v) {
  std::string out;
  EXPECT_TRUE(mp::encode(v, out)) << v.description();
  return out;
}

Value roundTrip(const Value& v) {
  auto r = mp::decode(encoded(v));
  EXPECT_TRUE(r.ok()) << r.error();
  return r.ok() ? r.value() : Value();
}

std::string bytesOf(std::initializer_list<int> bytes) {
  std::string s;
  for (int b : bytes) s.push_back(static_cast<char>(b));
  return s;
}

Value typicalEvent() {
  Dictionary payload{{"duration", 1234}, {"result", "ok"}, {"ratio", 0.75}};
  return Value(Dictionary{{"ParametersCategory", 101},
                          {"ParametersType", 7},
                          {"ParametersFlag", 0},
                          {"ParametersPayload", Value(payload)},
                          {"when", Value::date(1700000000.25)},
                          {"blob", Value(Bytes{1, 2, 3})},
                          {"list", Value(Array{1, "two", 3.5, true, nullptr})}});
}

Value nestedArrays(int depth) {
  Value v = Value::array();
  for (int i = 1; i < depth; ++i) v = Value(Array{v});
  return v;
}

}  // namespace

TEST(MessagePack, EncodesScalarsInTheirShortestForms) {
  EXPECT_EQ(encoded(Value()), bytesOf({0xc0}));
  EXPECT_EQ(encoded(Value(true)), bytesOf({0xc3}));
  EXPECT_EQ(encoded(Value(false)), bytesOf({0xc2}));
  EXPECT_EQ(encoded(Value(1)), bytesOf({0x01}));
  EXPECT_EQ(encoded(Value(-1)), bytesOf({0xff}));
  EXPECT_EQ(encoded(Value(-33)), bytesOf({0xd0, 0xdf}));
  EXPECT_EQ(encoded(Value(200)), bytesOf({0xcc, 0xc8}));
  EXPECT_EQ(encoded(Value(70000)), bytesOf({0xce, 0x00, 0x01, 0x11, 0x70}));
  EXPECT_EQ(encoded(Value(std::numeric_limits<unsigned long long>::max())),
            bytesOf({0xcf, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff}));
  EXPECT_EQ(encoded(Value(1.5)), bytesOf({0xcb, 0x3f, 0xf8, 0, 0, 0, 0, 0, 0}));
  EXPECT_EQ(encoded(Value("ab")), bytesOf({0xa2, 'a', 'b'}));
  EXPECT_EQ(encoded(Value(Bytes{9})), bytesOf({0xc4, 0x01, 0x09}));
  EXPECT_EQ(encoded(Value(Array{1, 2})), bytesOf({0x92, 0x01, 0x02}));
  // Keys come out in the dictionary's sorted order.
  EXPECT_EQ(encoded(Value(Dictionary{{"b", 2}, {"a", 1}})), bytesOf({0x82, 0xa1, 'a', 0x01, 0xa1, 'b', 0x02}));
}

TEST(MessagePack, IntegersRoundTripAtEveryWidthBoundary) {
  const long long kSigned[] = {0, 1, 127, 128, 255, 256, 65535, 65536, 4294967295LL, 4294967296LL,
                               -1, -32, -33, -128, -129, -32768, -32769, -2147483648LL, -2147483649LL,
                               std::numeric_limits<long long>::max(), std::numeric_limits<long long>::min()};
  for (long long i : kSigned) {
    Value back = roundTrip(Value(i));
    EXPECT_EQ(back.type(), Value::Type::Integer) << i;
    EXPECT_EQ(back.integerValue(), i);
  }
  Value big = roundTrip(Value(9223372036854775808ULL));
  EXPECT_EQ(big.type(), Value::Type::Unsigned);
  EXPECT_EQ(big.unsignedLongLongValue(), 9223372036854775808ULL);
  // A small unsigned value travels as a plain integer.
  EXPECT_EQ(roundTrip(Value(5u)).type(), Value::Type::Integer);
}

TEST(MessagePack, DoublesRoundTripBitForBit) {
  for (double d : {0.1, 1e300, -1e-300, 123456789.123456789, 5e-324, std::numeric_limits<double>::max()}) {
    Value back = roundTrip(Value(d));
    ASSERT_TRUE(back.isDouble());
    EXPECT_EQ(back.doubleValue(), d);
  }
  Value negativeZero = roundTrip(Value(-0.0));
  EXPECT_TRUE(std::signbit(negativeZero.doubleValue()));
  EXPECT_TRUE(std::isnan(roundTrip(Value(std::nan(""))).doubleValue()));
  EXPECT_EQ(roundTrip(Value(-INFINITY)).doubleValue(), -INFINITY);
}

TEST(MessagePack, StringsAndBytesOfEveryLengthClass) {
  for (std::size_t n : {0, 1, 31, 32, 255, 256, 65535, 65536, 70000}) {
    std::string s(n, 'x');
    if (n > 2) s[1] = '\0';  // embedded zero bytes survive
    EXPECT_EQ(roundTrip(Value(s)), Value(s)) << n;
    Bytes b(n, 0xab);
    EXPECT_EQ(roundTrip(Value(b)), Value(b)) << n;
  }
  EXPECT_EQ(roundTrip(Value("grüße 🙂")), Value("grüße 🙂"));
}

TEST(MessagePack, NestedValuesRoundTrip) {
  Value event = typicalEvent();
  EXPECT_EQ(roundTrip(event), event);
  Value mixed(Array{Value::dictionary(), Value::array(), Value(Dictionary{{"", Value(Array{Value()})}})});
  EXPECT_EQ(roundTrip(mixed), mixed);
}

TEST(MessagePack, DatesUseTheTimestampExtension) {
  // Whole seconds within 32 bits: timestamp 32.
  EXPECT_EQ(encoded(Value::date(1)), bytesOf({0xd6, 0xff, 0, 0, 0, 1}));
  // A fraction: timestamp 64, nanoseconds in the upper 30 bits.
  EXPECT_EQ(encoded(Value::date(1.5)), bytesOf({0xd7, 0xff, 0x77, 0x35, 0x94, 0x00, 0, 0, 0, 1}));
  // Before 1970: timestamp 96 with signed seconds; -1.5 is -2 s + 0.5 s.
  EXPECT_EQ(encoded(Value::date(-1.5)),
            bytesOf({0xc7, 12, 0xff, 0x1d, 0xcd, 0x65, 0x00, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xfe}));
  for (double t : {0.0, 1700000000.0, 1700000000.25, 1700000000.123456, 1234567890.987654321, -1.5, -0.25,
                   -86400.75, 17179869184.5 /* 2^34 s: timestamp 96 */, 4294967296.0}) {
    Value back = roundTrip(Value::date(t));
    ASSERT_TRUE(back.isDate()) << t;
    EXPECT_EQ(back.asDate()->secondsSince1970, t);
  }
  // Any date more than about 200 days from 1970, either way, comes back bit for bit.
  std::mt19937_64 rng(1);
  std::uniform_real_distribution<double> seconds(2e7, 2e10);
  for (int i = 0; i < 2000; ++i) {
    double t = (i % 2 ? -1 : 1) * seconds(rng);
    EXPECT_EQ(roundTrip(Value::date(t)).asDate()->secondsSince1970, t);
  }
  // Small magnitudes keep nanoseconds.
  EXPECT_NEAR(roundTrip(Value::date(0.123456789123)).asDate()->secondsSince1970, 0.123456789123, 1e-9);
}

TEST(MessagePack, RefusesValuesWithoutAnEncodingAndLeavesTheBufferAlone) {
  std::string out = "keep";
  EXPECT_FALSE(mp::encode(Value(Array{1, Value::date(std::nan(""))}), out));
  EXPECT_FALSE(mp::encode(Value::date(INFINITY), out));
  EXPECT_FALSE(mp::encode(Value::date(1e19), out));
  EXPECT_FALSE(mp::encode(nestedArrays(mp::kMaxNestingDepth + 1), out));
  EXPECT_EQ(out, "keep");
  EXPECT_TRUE(mp::encode(nestedArrays(mp::kMaxNestingDepth), out));
  EXPECT_EQ(out.substr(0, 4), "keep");
  EXPECT_TRUE(mp::decode(out.substr(4)).ok());
}

TEST(MessagePack, AgreesWithMsgpackC) {
  // Our encoding read by msgpack-c's unpacker.
  std::string bytes = encoded(typicalEvent());
  msgpack_unpacked result;
  msgpack_unpacked_init(&result);
  std::size_t offset = 0;
  ASSERT_EQ(msgpack_unpack_next(&result, bytes.data(), bytes.size(), &offset), MSGPACK_UNPACK_SUCCESS);
  EXPECT_EQ(offset, bytes.size());
  ASSERT_EQ(result.data.type, MSGPACK_OBJECT_MAP);
  ASSERT_EQ(result.data.via.map.size, 7u);
  const msgpack_object_kv& first = result.data.via.map.ptr[0];
  EXPECT_EQ(std::string(first.key.via.str.ptr, first.key.via.str.size), "ParametersCategory");
  EXPECT_EQ(first.val.via.u64, 101u);
  msgpack_timestamp ts;
  const msgpack_object& when = result.data.via.map.ptr[6].val;
  ASSERT_TRUE(msgpack_object_to_timestamp(&when, &ts));
  EXPECT_EQ(ts.tv_sec, 1700000000);
  EXPECT_EQ(ts.tv_nsec, 250000000u);
  msgpack_unpacked_destroy(&result);

  // msgpack-c's packer (including forms we never write: float32, str8) read by us.
  msgpack_sbuffer buffer;
  msgpack_sbuffer_init(&buffer);
  msgpack_packer pk;
  msgpack_packer_init(&pk, &buffer, msgpack_sbuffer_write);
  msgpack_pack_map(&pk, 3);
  msgpack_pack_str_with_body(&pk, "f", 1);
  msgpack_pack_float(&pk, 0.5f);
  msgpack_pack_str_with_body(&pk, "t", 1);
  msgpack_timestamp stamp{-5, 7};
  msgpack_pack_timestamp(&pk, &stamp);
  msgpack_pack_str_with_body(&pk, "z", 1);
  msgpack_pack_array(&pk, 2);
  msgpack_pack_int8(&pk, -100);
  msgpack_pack_unsigned_long_long(&pk, 3);
  auto decoded = mp::decode(reinterpret_cast<const std::uint8_t*>(buffer.data), buffer.size);
  msgpack_sbuffer_destroy(&buffer);
  ASSERT_TRUE(decoded.ok()) << decoded.error();
  EXPECT_EQ(decoded.value()["f"], Value(0.5));
  EXPECT_DOUBLE_EQ(decoded.value()["t"].asDate()->secondsSince1970, -5 + 7e-9);
  EXPECT_EQ(decoded.value()["z"], Value(Array{-100, 3}));
}

TEST(MessagePack, MapKeysOutOfOrderAreSortedAndTheLastRepeatWins) {
  auto r = mp::decode(bytesOf({0x83, 0xa1, 'c', 0x01, 0xa1, 'a', 0x02, 0xa1, 'c', 0x03}));
  ASSERT_TRUE(r.ok()) << r.error();
  EXPECT_EQ(r.value(), Value(Dictionary{{"a", 2}, {"c", 3}}));
  auto sorted = mp::decode(bytesOf({0x83, 0xa1, 'a', 0x01, 0xa1, 'b', 0x02, 0xa1, 'b', 0x03}));
  ASSERT_TRUE(sorted.ok());
  EXPECT_EQ(sorted.value(), Value(Dictionary{{"a", 1}, {"b", 3}}));
}

TEST(MessagePack, RefusesMalformedInputWithItsOffset) {
  struct Case {
    std::string bytes;
    std::string error;
  };
  const Case cases[] = {
      {"", "MessagePack truncated input at offset 0"},
      {bytesOf({0xc1}), "MessagePack invalid type byte 0xc1 at offset 0"},
      {bytesOf({0x01, 0x02}), "MessagePack trailing bytes after the value at offset 1"},
      {bytesOf({0x92, 0x01}), "MessagePack array longer than the input at offset 1"},
      {bytesOf({0x92, 0x01, 0x02, 0x03}), "MessagePack trailing bytes after the value at offset 3"},
      {bytesOf({0x92, 0x01, 0xcd, 0x01}), "MessagePack truncated input at offset 3"},
      {bytesOf({0xdd, 0xff, 0xff, 0xff, 0xff}), "MessagePack array longer than the input at offset 5"},
      {bytesOf({0xdf, 0xff, 0xff, 0xff, 0xff, 0xc0, 0xc0}), "MessagePack map longer than the input at offset 5"},
      {bytesOf({0xdb, 0xff, 0xff, 0xff, 0xff, 'a'}), "MessagePack string longer than the input at offset 5"},
      {bytesOf({0xc6, 0x7f, 0xff, 0xff, 0xff}), "MessagePack byte string longer than the input at offset 5"},
      {bytesOf({0xc9, 0xff, 0xff, 0xff, 0xff, 0xff}), "MessagePack truncated extension at offset 5"},
      {bytesOf({0xd4, 0x05, 0x00}), "MessagePack extension of an unknown type at offset 1"},
      {bytesOf({0xd4, 0xff, 0x00}), "MessagePack timestamp of a bad length at offset 1"},
      {bytesOf({0xd7, 0xff, 0xff, 0xff, 0xff, 0xff, 0, 0, 0, 0}),
       "MessagePack timestamp with more than a second of nanoseconds at offset 1"},
      {bytesOf({0xc7, 12, 0xff, 0, 0, 0, 0, 0x7f, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff, 0xff}),
       "MessagePack timestamp out of range at offset 2"},
      {bytesOf({0x81, 0x01, 0x02}), "MessagePack map key that is not a string at offset 1"},
      {bytesOf({0x81, 0xc0, 0x02}), "MessagePack map key that is not a string at offset 1"},
      {bytesOf({0xcb, 0x00}), "MessagePack truncated input at offset 1"},
  };
  for (const auto& c : cases) {
    auto r = mp::decode(c.bytes);
    EXPECT_FALSE(r.ok());
    EXPECT_EQ(r.error(), c.error);
  }
}

TEST(MessagePack, EveryTruncationOfAValidEncodingFails) {
  std::string bytes = encoded(typicalEvent());
  for (std::size_t n = 0; n < bytes.size(); ++n) {
    EXPECT_FALSE(mp::decode(bytes.substr(0, n)).ok()) << n;
  }
  EXPECT_TRUE(mp::decode(bytes).ok());
}

TEST(MessagePack, DeepNestingIsRefusedWithoutExhaustingTheStack) {
  std::string ok(mp::kMaxNestingDepth, '\x91');
  ok.back() = '\x90';
  EXPECT_TRUE(mp::decode(ok).ok());
  std::string tooDeep(mp::kMaxNestingDepth + 1, '\x91');
  tooDeep.back() = '\x90';
  EXPECT_EQ(mp::decode(tooDeep).error(), "MessagePack nested too deeply at offset 257");
  std::string hostile(1000000, '\x81');  // maps of one entry, all the way down
  for (std::size_t i = 1; i < hostile.size(); i += 2) hostile[i] = '\xa0';
  EXPECT_FALSE(mp::decode(hostile).ok());
}

TEST(MessagePack, RandomAndMutatedInputNeverCrashes) {
  std::mt19937 rng(20240611);
  std::string valid = encoded(typicalEvent());
  std::size_t decodedCount = 0;
  for (int i = 0; i < 20000; ++i) {
    std::string input;
    if (i % 2 == 0) {
      input.resize(rng() % 64);
      for (auto& c : input) c = static_cast<char>(rng());
    } else {
      input = valid;
      for (int flips = 1 + rng() % 4; flips > 0; --flips) input[rng() % input.size()] = static_cast<char>(rng());
    }
    auto r = mp::decode(input);
    if (r.ok()) {
      ++decodedCount;
      // Whatever decodes encodes again and reads back the same.
      std::string again;
      ASSERT_TRUE(mp::encode(r.value(), again));
      auto twice = mp::decode(again);
      ASSERT_TRUE(twice.ok());
      EXPECT_EQ(twice.value().description(), r.value().description());
    } else {
      EXPECT_EQ(r.error().rfind("MessagePack ", 0), 0u) << r.error();
    }
  }
  EXPECT_GT(decodedCount, 0u);
}
