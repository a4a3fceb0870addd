#include "platform/Random.h"

#include <gtest/gtest.h>

#include <limits>
#include <set>
#include <vector>

#include "support/ScriptedRandom.h"

namespace telvane {
namespace {

// Randomness whose bytes are all one value, to show which bits a UUID forces.
class ConstantRandom : public Random {
 public:
  explicit ConstantRandom(std::uint8_t byte) : byte_(byte) {}
  std::uint32_t uniform(std::uint32_t) override { return 0; }
  void fill(std::uint8_t* data, std::size_t size) override {
    for (std::size_t i = 0; i < size; ++i) data[i] = byte_;
  }

 private:
  std::uint8_t byte_;
};

// 8-4-4-4-12 upper-case hexadecimal digits, version digit 4, variant digit 8, 9, A or B.
bool isCanonicalVersion4Uuid(const std::string& text) {
  if (text.size() != 36) return false;
  for (std::size_t i = 0; i < text.size(); ++i) {
    char c = text[i];
    if (i == 8 || i == 13 || i == 18 || i == 23) {
      if (c != '-') return false;
    } else if (!((c >= '0' && c <= '9') || (c >= 'A' && c <= 'F'))) {
      return false;
    }
  }
  return text[14] == '4' && (text[19] == '8' || text[19] == '9' || text[19] == 'A' || text[19] == 'B');
}

TEST(RandomTest, SystemUuidStringHasCanonicalUpperCaseForm) {
  auto random = Random::system();
  for (int i = 0; i < 100; ++i) {
    std::string uuid = random->uuidString();
    EXPECT_EQ(uuid.size(), 36u);
    EXPECT_TRUE(isCanonicalVersion4Uuid(uuid)) << uuid;
  }
}

TEST(RandomTest, UuidBytesCarryVersionFourAndVariantBits) {
  auto random = Random::system();
  for (int i = 0; i < 200; ++i) {
    Bytes b = random->uuidBytes();
    ASSERT_EQ(b.size(), 16u);
    EXPECT_EQ(b[6] & 0xF0, 0x40);
    EXPECT_EQ(b[8] & 0xC0, 0x80);
  }
  EXPECT_FALSE(isCanonicalVersion4Uuid("00000000-0000-0000-0000-000000000000"));
  EXPECT_FALSE(isCanonicalVersion4Uuid("ffffffff-ffff-4fff-bfff-ffffffffffff"));
  ConstantRandom zeros(0x00);
  EXPECT_EQ(zeros.uuidString(), "00000000-0000-4000-8000-000000000000");
  ConstantRandom ones(0xFF);
  EXPECT_EQ(ones.uuidString(), "FFFFFFFF-FFFF-4FFF-BFFF-FFFFFFFFFFFF");
}

TEST(RandomTest, UuidsComeFromTheInjectedRandom) {
  test::ScriptedRandom scripted;
  EXPECT_EQ(scripted.uuidString(), "00010203-0405-4607-8809-0A0B0C0D0E0F");
  EXPECT_EQ(scripted.uuidString(), "10111213-1415-4617-9819-1A1B1C1D1E1F");
}

TEST(RandomTest, SystemUuidsAreUnique) {
  auto random = Random::system();
  std::set<std::string> seen;
  for (int i = 0; i < 5000; ++i) seen.insert(random->uuidString());
  EXPECT_EQ(seen.size(), 5000u);
}

TEST(RandomTest, UuidTextFormatsSixteenBytes) {
  Bytes b = {0x12, 0x34, 0x56, 0x78, 0x9a, 0xbc, 0xde, 0xf0, 0x0f, 0xed, 0xcb, 0xa9, 0x87, 0x65, 0x43, 0x21};
  EXPECT_EQ(uuidText(b), "12345678-9ABC-DEF0-0FED-CBA987654321");
  EXPECT_EQ(uuidText(Bytes(15, 0)), "");
  EXPECT_EQ(uuidText(Bytes(17, 0)), "");
}

TEST(RandomTest, UniformStaysWithinBounds) {
  auto random = Random::system();
  EXPECT_EQ(random->uniform(0), 0u);
  EXPECT_EQ(random->uniform(1), 0u);
  std::vector<int> counts(7, 0);
  for (int i = 0; i < 7000; ++i) {
    std::uint32_t v = random->uniform(7);
    ASSERT_LT(v, 7u);
    ++counts[v];
  }
  // Each value is expected 1000 times; 700 is more than nine standard deviations away.
  for (int c : counts) EXPECT_GT(c, 700);
  for (int i = 0; i < 1000; ++i) {
    EXPECT_LT(random->uniform(7200), 7200u);
    EXPECT_LT(random->uniform(std::numeric_limits<std::uint32_t>::max()), std::numeric_limits<std::uint32_t>::max());
  }
}

TEST(RandomTest, UniformHasNoModuloBias) {
  // With a bound of 3 * 2^30, a plain "r % bound" would put half of all draws below
  // 2^30 instead of a third.
  auto random = Random::system();
  const std::uint32_t bound = 3u << 30;
  const int draws = 6000;
  int low = 0;
  for (int i = 0; i < draws; ++i) {
    std::uint32_t v = random->uniform(bound);
    ASSERT_LT(v, bound);
    if (v < (1u << 30)) ++low;
  }
  double share = static_cast<double>(low) / draws;
  // Expected 1/3 with a standard deviation of about 0.006.
  EXPECT_GT(share, 0.28);
  EXPECT_LT(share, 0.39);
}

TEST(RandomTest, FillGivesDifferentBytesEachTime) {
  auto random = Random::system();
  Bytes a(64), b(64);
  random->fill(a.data(), a.size());
  random->fill(b.data(), b.size());
  EXPECT_NE(a, b);
  EXPECT_NE(a, Bytes(64, 0));
  random->fill(nullptr, 0);  // nothing to do, nothing to break
}

}  // namespace
}  // namespace telvane
