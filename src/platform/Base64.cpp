#include "platform/Base64.h"

#include <array>

namespace telvane::crypto {

namespace {

constexpr char kBase64Alphabet[] = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/";
// The 6-bit value of each base64 character, or -1 for every other character.
constexpr std::array<std::int8_t, 256> makeBase64Table() {
  std::array<std::int8_t, 256> table{};
  for (auto& v : table) v = -1;
  for (int i = 0; i < 64; ++i) table[static_cast<unsigned char>(kBase64Alphabet[i])] = static_cast<std::int8_t>(i);
  return table;
}
constexpr std::array<std::int8_t, 256> kBase64Table = makeBase64Table();

}  // namespace

std::string base64Encode(const std::uint8_t* data, std::size_t size) {
  std::string out;
  out.reserve((size + 2) / 3 * 4);
  std::size_t i = 0;
  for (; i + 3 <= size; i += 3) {
    std::uint32_t n = (std::uint32_t{data[i]} << 16) | (std::uint32_t{data[i + 1]} << 8) | data[i + 2];
    out += kBase64Alphabet[(n >> 18) & 63];
    out += kBase64Alphabet[(n >> 12) & 63];
    out += kBase64Alphabet[(n >> 6) & 63];
    out += kBase64Alphabet[n & 63];
  }
  std::size_t rest = size - i;
  if (rest == 1) {
    std::uint32_t n = std::uint32_t{data[i]} << 16;
    out += kBase64Alphabet[(n >> 18) & 63];
    out += kBase64Alphabet[(n >> 12) & 63];
    out += "==";
  } else if (rest == 2) {
    std::uint32_t n = (std::uint32_t{data[i]} << 16) | (std::uint32_t{data[i + 1]} << 8);
    out += kBase64Alphabet[(n >> 18) & 63];
    out += kBase64Alphabet[(n >> 12) & 63];
    out += kBase64Alphabet[(n >> 6) & 63];
    out += '=';
  }
  return out;
}

// Every character outside the alphabet is skipped, '=' included: padding carries no
// data, and skipping it also keeps text that was wrapped or re-padded by hand readable.
Result<Bytes> base64Decode(std::string_view text) {
  Bytes out;
  out.reserve(text.size() / 4 * 3 + 2);
  std::uint32_t group = 0;
  int count = 0;
  for (char c : text) {
    std::int8_t v = kBase64Table[static_cast<unsigned char>(c)];
    if (v < 0) continue;
    group = (group << 6) | static_cast<std::uint32_t>(v);
    if (++count == 4) {
      out.push_back(static_cast<std::uint8_t>(group >> 16));
      out.push_back(static_cast<std::uint8_t>(group >> 8));
      out.push_back(static_cast<std::uint8_t>(group));
      group = 0;
      count = 0;
    }
  }
  if (count == 1) return Result<Bytes>::failure("base64 text ends with a single dangling character");
  if (count == 2) {
    out.push_back(static_cast<std::uint8_t>(group >> 4));
  } else if (count == 3) {
    out.push_back(static_cast<std::uint8_t>(group >> 10));
    out.push_back(static_cast<std::uint8_t>(group >> 2));
  }
  return Result<Bytes>::success(std::move(out));
}

}  // namespace telvane::crypto
