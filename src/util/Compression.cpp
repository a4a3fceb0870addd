#include "util/Compression.h"

#include <zlib.h>

#include <algorithm>
#include <limits>

#include "platform/Log.h"

namespace telvane {

namespace {

constexpr int kDeflateLevel = Z_DEFAULT_COMPRESSION;  // -1
constexpr int kDeflateMethod = Z_DEFLATED;            // 8
constexpr int kGzipWindowBits = 31;
constexpr int kZlibWindowBits = 15;
constexpr int kMemoryLevel = 8;
constexpr int kStrategy = Z_DEFAULT_STRATEGY;  // 0

const char* streamMessage(const z_stream& stream) { return stream.msg ? stream.msg : "(null)"; }

}  // namespace

const char* deflateInitErrorMessage(int code) {
  switch (code) {
    case Z_VERSION_ERROR: return "The version of zlib.h and the version of the library linked do not match.";
    case Z_MEM_ERROR: return "Insufficient memory.";
    case Z_STREAM_ERROR: return "Invalid parameter passed in to function.";
    default: return "Unknown error code.";
  }
}

const char* deflateErrorMessage(int code) {
  switch (code) {
    case Z_VERSION_ERROR: return "The version of zlib.h and the version of the library linked do not match.";
    case Z_BUF_ERROR: return "Ran out of output buffer for writing compressed bytes.";
    case Z_MEM_ERROR: return "Memory could not be allocated for processing.";
    case Z_DATA_ERROR: return "The deflate data was invalid or incomplete.";
    case Z_STREAM_ERROR: return "The stream state was inconsistent (e.g., next_in or next_out was NULL).";
    case Z_ERRNO: return "Error occured while reading file.";
    default: return "Unknown error code.";
  }
}

std::optional<Bytes> compressDataWithZlibOrGzip(bool gzip, const std::uint8_t* data, std::size_t size) {
  if (size == 0 || data == nullptr) {
    log::error("compressDataWithZlibOrGzip: Cannot compress empty ByteData");
    return std::nullopt;
  }
  if (size > std::numeric_limits<uInt>::max()) {
    log::error("compressDataWithZlibOrGzip: Cannot compress %llu bytes in one pass",
               static_cast<unsigned long long>(size));
    return std::nullopt;
  }

  z_stream stream{};
  int rc = deflateInit2(&stream, kDeflateLevel, kDeflateMethod, gzip ? kGzipWindowBits : kZlibWindowBits,
                        kMemoryLevel, kStrategy);
  if (rc != Z_OK) {
    log::error("compressDataWithZlibOrGzip: deflateInit2() Error: \"%s\" Message: \"%s\"", deflateInitErrorMessage(rc),
               streamMessage(stream));
    return std::nullopt;
  }

  // zlib only reads through next_in; the cast drops const for its C interface.
  stream.next_in = const_cast<Bytef*>(reinterpret_cast<const Bytef*>(data));
  stream.avail_in = static_cast<uInt>(size);

  // One allocation at the worst case, so that a single finishing call suffices.
  Bytes out(deflateBound(&stream, static_cast<uLong>(size)));
  std::size_t produced = 0;
  do {
    stream.next_out = out.data() + produced;
    const std::size_t room = out.size() - produced;
    const uInt offered = static_cast<uInt>(std::min<std::size_t>(room, std::numeric_limits<uInt>::max()));
    stream.avail_out = offered;
    rc = deflate(&stream, Z_FINISH);
    produced += offered - stream.avail_out;
  } while (rc == Z_OK);

  if (rc == Z_STREAM_END) {
    deflateEnd(&stream);
    out.resize(produced);
    log::info("compressDataWithZlibOrGzip: Compressed file from %u to %u", static_cast<std::uint32_t>(size),
              static_cast<std::uint32_t>(produced));
    return out;
  }

  log::error("compressDataWithZlibOrGzip: zlib error while attempting compression: \"%s\" Message: \"%s\"",
             deflateErrorMessage(rc), streamMessage(stream));
  deflateEnd(&stream);
  return std::nullopt;
}

std::optional<Bytes> gzipDeflate(const std::uint8_t* data, std::size_t size) {
  return compressDataWithZlibOrGzip(true, data, size);
}

std::optional<Bytes> gzipDeflate(const Bytes& data) { return gzipDeflate(data.data(), data.size()); }

std::optional<Bytes> gzipDeflate(std::string_view data) {
  return gzipDeflate(reinterpret_cast<const std::uint8_t*>(data.data()), data.size());
}

struct GzipDeflateStream::State {
  z_stream stream{};
  bool initialised = false;
};

GzipDeflateStream::GzipDeflateStream() : state_(std::make_unique<State>()) {
  const int rc =
      deflateInit2(&state_->stream, kDeflateLevel, kDeflateMethod, kGzipWindowBits, kMemoryLevel, kStrategy);
  if (rc != Z_OK) {
    log::error("compressDataWithZlibOrGzip: deflateInit2() Error: \"%s\" Message: \"%s\"",
               deflateInitErrorMessage(rc), streamMessage(state_->stream));
    failed_ = true;
    return;
  }
  state_->initialised = true;
}

GzipDeflateStream::~GzipDeflateStream() {
  if (state_->initialised) deflateEnd(&state_->stream);
}

bool GzipDeflateStream::deflateInto(int flush) {
  z_stream& stream = state_->stream;
  constexpr std::size_t kGrowBytes = 64 * 1024;
  int rc;
  do {
    const std::size_t produced = out_.size();
    out_.resize(produced + kGrowBytes);
    stream.next_out = reinterpret_cast<Bytef*>(out_.data() + produced);
    stream.avail_out = static_cast<uInt>(kGrowBytes);
    rc = deflate(&stream, flush);
    out_.resize(produced + (kGrowBytes - stream.avail_out));
    if (rc == Z_STREAM_ERROR) break;
    // Without finishing, zlib is done with this piece once it leaves output room.
  } while (flush == Z_FINISH ? rc == Z_OK : stream.avail_out == 0);
  if ((flush == Z_FINISH && rc != Z_STREAM_END) || rc == Z_STREAM_ERROR) {
    log::error("compressDataWithZlibOrGzip: zlib error while attempting compression: \"%s\" Message: \"%s\"",
               deflateErrorMessage(rc), streamMessage(stream));
    failed_ = true;
    return false;
  }
  return true;
}

bool GzipDeflateStream::append(const char* data, std::size_t size) {
  if (failed_) return false;
  z_stream& stream = state_->stream;
  while (size > 0) {
    const uInt piece = static_cast<uInt>(std::min<std::size_t>(size, std::numeric_limits<uInt>::max()));
    // zlib only reads through next_in; the cast drops const for its C interface.
    stream.next_in = const_cast<Bytef*>(reinterpret_cast<const Bytef*>(data));
    stream.avail_in = piece;
    if (!deflateInto(Z_NO_FLUSH)) return false;
    data += piece;
    size -= piece;
    inputBytes_ += piece;
  }
  return true;
}

std::optional<std::string> GzipDeflateStream::finish() {
  if (failed_) return std::nullopt;
  if (inputBytes_ == 0) {
    log::error("compressDataWithZlibOrGzip: Cannot compress empty ByteData");
    return std::nullopt;
  }
  state_->stream.next_in = nullptr;
  state_->stream.avail_in = 0;
  if (!deflateInto(Z_FINISH)) return std::nullopt;
  out_.shrink_to_fit();
  log::info("compressDataWithZlibOrGzip: Compressed file from %u to %u", static_cast<std::uint32_t>(inputBytes_),
            static_cast<std::uint32_t>(out_.size()));
  failed_ = true;  // finished: nothing more may be appended
  return std::move(out_);
}

}  // namespace telvane
