// base64 text of bytes and back. Kept apart from the digests so that code without
// OpenSSL (the client library) can use it. Pure and thread-safe.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Result.h"
#include "telvane/Value.h"

namespace telvane::crypto {

std::string base64Encode(const std::uint8_t* data, std::size_t size);
inline std::string base64Encode(const Bytes& b) { return base64Encode(b.data(), b.size()); }
// Decodes base64, ignoring every character outside the alphabet (line breaks, blanks,
// junk). Fails only when the remaining characters cannot form base64 (a dangling
// single character).
Result<Bytes> base64Decode(std::string_view text);

}  // namespace telvane::crypto
