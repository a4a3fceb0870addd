#include "devserver/Gunzip.h"

#include <zlib.h>

namespace telvane::devserver {

namespace {
// 16 + the largest window: zlib reads the gzip wrapper.
constexpr int kGzipWindowBits = 16 + MAX_WBITS;
constexpr std::size_t kChunkSize = 64 * 1024;
}  // namespace

bool looksGzipped(std::string_view bytes) {
  return bytes.size() >= 2 && static_cast<unsigned char>(bytes[0]) == 0x1f &&
         static_cast<unsigned char>(bytes[1]) == 0x8b;
}

std::optional<std::string> gunzip(std::string_view bytes, std::size_t limit) {
  z_stream stream{};
  if (inflateInit2(&stream, kGzipWindowBits) != Z_OK) return std::nullopt;
  std::string out;
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(bytes.data()));
  stream.avail_in = static_cast<uInt>(bytes.size());
  int rc = Z_OK;
  while (true) {
    std::size_t before = out.size();
    out.resize(before + kChunkSize);
    stream.next_out = reinterpret_cast<Bytef*>(out.data() + before);
    stream.avail_out = static_cast<uInt>(kChunkSize);
    rc = inflate(&stream, Z_NO_FLUSH);
    out.resize(before + (kChunkSize - stream.avail_out));
    if (out.size() > limit) break;
    if (rc == Z_STREAM_END) {
      // Another member may follow.
      if (stream.avail_in == 0) break;
      if (inflateReset(&stream) != Z_OK) break;
      continue;
    }
    if (rc != Z_OK) break;
    if (stream.avail_in == 0 && stream.avail_out != 0) break;  // truncated
  }
  inflateEnd(&stream);
  if (rc != Z_STREAM_END || out.size() > limit) return std::nullopt;
  return out;
}

}  // namespace telvane::devserver
