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
#include <memory>
#include <optional>
#include <string>
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

// A gzip stream made from input that arrives in pieces (a file read in chunks), so that
// only the compressed output is held, never the whole input. The result is the same
// stream gzipDeflate makes of the whole input, and it logs the same lines. Not
// thread-safe; one stream per use.
class GzipDeflateStream {
 public:
  GzipDeflateStream();
  ~GzipDeflateStream();
  GzipDeflateStream(const GzipDeflateStream&) = delete;
  GzipDeflateStream& operator=(const GzipDeflateStream&) = delete;

  // Compresses the next piece. False (logged) when zlib fails; the stream is then
  // unusable.
  bool append(const char* data, std::size_t size);
  // Ends the stream and hands the compressed bytes over. Nothing (logged) when no
  // byte was appended, or when zlib failed.
  std::optional<std::string> finish();
  // Input bytes appended so far.
  std::uint64_t inputBytes() const { return inputBytes_; }

 private:
  bool deflateInto(int flush);

  struct State;
  std::unique_ptr<State> state_;
  std::string out_;
  std::uint64_t inputBytes_ = 0;
  bool failed_ = false;
};

// The texts logged for zlib's return codes: of deflateInit2(), and of deflate().
const char* deflateInitErrorMessage(int code);
const char* deflateErrorMessage(int code);

}  // namespace telvane
