// Compression: one-pass in-memory deflate of a byte buffer into a gzip or zlib stream.
//
// The output is allocated once at zlib's worst-case bound and shrunk to what was
// produced; the input is read in place. Failures log a line and yield nothing.
// Inputs of 4 GiB or more are refused (zlib's single-pass input length is 32-bit).
//
// Threading: pure functions, safe from any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>

#include "telvane/Value.h"

namespace telvane {

// Gzip (header and CRC-32 trailer) when `gzip` is true, the zlib format otherwise.
std::optional<Bytes> compressDataWithZlibOrGzip(bool gzip, const std::uint8_t* data, std::size_t size);
inline std::optional<Bytes> compressDataWithZlibOrGzip(bool gzip, const Bytes& data) {
  return compressDataWithZlibOrGzip(gzip, data.data(), data.size());
}

// A gzip stream of the bytes.
std::optional<Bytes> gzipDeflate(const std::uint8_t* data, std::size_t size);
std::optional<Bytes> gzipDeflate(const Bytes& data);
std::optional<Bytes> gzipDeflate(std::string_view data);

// The texts logged for zlib's return codes: of deflateInit2(), and of deflate().
const char* deflateInitErrorMessage(int code);
const char* deflateErrorMessage(int code);

}  // namespace telvane
