// gunzip: inflates a gzip stream in tests, to compare what was posted with what was
// meant to be sent.
#pragma once

#include <zlib.h>

#include <optional>
#include <string>
#include <string_view>

namespace telvane::test {

// The bytes of the gzip stream inflated; nothing when they are not one whole stream.
inline std::optional<std::string> gunzip(std::string_view compressed) {
  z_stream stream{};
  if (inflateInit2(&stream, 16 + MAX_WBITS) != Z_OK) return std::nullopt;
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(compressed.data()));
  stream.avail_in = static_cast<uInt>(compressed.size());
  std::string out;
  char buffer[16384];
  int status = Z_OK;
  while (status == Z_OK) {
    stream.next_out = reinterpret_cast<Bytef*>(buffer);
    stream.avail_out = sizeof buffer;
    status = inflate(&stream, Z_NO_FLUSH);
    out.append(buffer, sizeof buffer - stream.avail_out);
  }
  inflateEnd(&stream);
  if (status != Z_STREAM_END) return std::nullopt;
  return out;
}

}  // namespace telvane::test
