#include "util/Compression.h"

#include <gtest/gtest.h>
#include <zlib.h>

#include <algorithm>
#include <random>
#include <string>

#include "platform/Log.h"

namespace telvane {
namespace {

// Inflates a whole gzip or zlib stream (auto-detected); nullopt unless the stream ends
// exactly at the end of the buffer.
std::optional<Bytes> inflateAll(const Bytes& compressed) {
  z_stream s{};
  if (inflateInit2(&s, 15 + 32) != Z_OK) return std::nullopt;
  s.next_in = const_cast<Bytef*>(compressed.data());
  s.avail_in = static_cast<uInt>(compressed.size());
  Bytes out;
  int rc = Z_OK;
  while (rc == Z_OK) {
    std::uint8_t chunk[16384];
    s.next_out = chunk;
    s.avail_out = sizeof chunk;
    rc = inflate(&s, Z_NO_FLUSH);
    out.insert(out.end(), chunk, chunk + (sizeof chunk - s.avail_out));
  }
  bool whole = rc == Z_STREAM_END && s.avail_in == 0;
  inflateEnd(&s);
  if (!whole) return std::nullopt;
  return out;
}

TEST(Compression, EmptyInputIsRefused) {
  log::LogCapture capture;
  EXPECT_FALSE(gzipDeflate(Bytes{}).has_value());
  EXPECT_FALSE(compressDataWithZlibOrGzip(false, Bytes{}).has_value());
  EXPECT_FALSE(gzipDeflate(std::string_view{}).has_value());
  EXPECT_EQ(capture.count("compressDataWithZlibOrGzip: Cannot compress empty ByteData"), 3u);
  EXPECT_TRUE(capture.contains(log::Level::Error, "compressDataWithZlibOrGzip: Cannot compress empty ByteData"));
  EXPECT_EQ(capture.lines().size(), 3u);
}

TEST(Compression, OneByteGivesAGzipStream) {
  const Bytes input = {0x41};
  log::LogCapture capture;
  auto out = gzipDeflate(input);
  ASSERT_TRUE(out.has_value());
  ASSERT_GE(out->size(), 18u);  // 10-byte header, deflate data, 8-byte trailer
  EXPECT_EQ((*out)[0], 0x1f);
  EXPECT_EQ((*out)[1], 0x8b);
  EXPECT_EQ(inflateAll(*out), input);
  EXPECT_TRUE(capture.contains(log::Level::Info, "compressDataWithZlibOrGzip: Compressed file from 1 to " +
                                                     std::to_string(out->size())));
}

TEST(Compression, FlagFalseGivesAZlibStream) {
  const std::string text = "hello hello hello hello";
  auto out = compressDataWithZlibOrGzip(false, reinterpret_cast<const std::uint8_t*>(text.data()), text.size());
  ASSERT_TRUE(out.has_value());
  EXPECT_EQ((*out)[0], 0x78);
  EXPECT_EQ(((*out)[0] * 256 + (*out)[1]) % 31, 0);  // zlib header check bits
  EXPECT_EQ(inflateAll(*out), Bytes(text.begin(), text.end()));
  auto gz = compressDataWithZlibOrGzip(true, reinterpret_cast<const std::uint8_t*>(text.data()), text.size());
  ASSERT_TRUE(gz.has_value());
  EXPECT_EQ((*gz)[0], 0x1f);
}

TEST(Compression, OutputLengthIsTheProducedCountNotTheBound) {
  const Bytes input(100000, 'a');
  auto out = gzipDeflate(input);
  ASSERT_TRUE(out.has_value());
  z_stream s{};
  ASSERT_EQ(deflateInit2(&s, -1, 8, 31, 8, 0), Z_OK);
  uLong bound = deflateBound(&s, input.size());
  deflateEnd(&s);
  EXPECT_LT(out->size(), bound);
  EXPECT_LT(out->size(), 1000u);
  // The stream ends exactly at the end of the buffer: no slack bytes after it.
  EXPECT_EQ(inflateAll(*out), input);
  Bytes padded = *out;
  padded.push_back(0);
  EXPECT_FALSE(inflateAll(padded).has_value());
}

TEST(Compression, LargeRandomBufferRoundTrips) {
  Bytes input(3 * 1024 * 1024);
  std::mt19937 gen(1234);
  for (auto& b : input) b = static_cast<std::uint8_t>(gen());
  log::LogCapture capture;
  auto out = gzipDeflate(input);
  ASSERT_TRUE(out.has_value());
  EXPECT_GT(out->size(), input.size());  // incompressible: a little larger
  EXPECT_EQ(inflateAll(*out), input);
  EXPECT_TRUE(capture.contains("compressDataWithZlibOrGzip: Compressed file from 3145728 to " +
                               std::to_string(out->size())));
}

TEST(Compression, LargeCompressibleBufferRoundTrips) {
  std::string text;
  for (int i = 0; i < 200000; ++i) text += "{\"event\":" + std::to_string(i % 97) + ",\"ok\":true}\n";
  auto out = gzipDeflate(std::string_view(text));
  ASSERT_TRUE(out.has_value());
  EXPECT_LT(out->size(), text.size() / 10);
  EXPECT_EQ(inflateAll(*out), Bytes(text.begin(), text.end()));
  auto z = compressDataWithZlibOrGzip(false, reinterpret_cast<const std::uint8_t*>(text.data()), text.size());
  ASSERT_TRUE(z.has_value());
  EXPECT_EQ(inflateAll(*z), Bytes(text.begin(), text.end()));
}

TEST(Compression, PointerOverloadReadsInPlace) {
  const std::uint8_t data[] = {1, 2, 3, 4, 5, 6, 7, 8};
  auto out = gzipDeflate(data, sizeof data);
  ASSERT_TRUE(out.has_value());
  EXPECT_EQ(inflateAll(*out), Bytes(data, data + sizeof data));
}

TEST(Compression, StreamInPiecesMakesTheSameGzipAsOnePass) {
  std::mt19937 random(7);
  // Text that compresses and random bytes that do not, fed in uneven pieces.
  std::string text;
  while (text.size() < 300000) text += "line " + std::to_string(random() % 1000) + " of a log\n";
  std::string noise(300000, '\0');
  for (char& c : noise) c = static_cast<char>(random());
  for (const std::string& input : {text, noise}) {
    log::LogCapture capture;
    GzipDeflateStream stream;
    std::size_t at = 0;
    while (at < input.size()) {
      const std::size_t piece = std::min<std::size_t>(input.size() - at, 1 + random() % 70000);
      ASSERT_TRUE(stream.append(input.data() + at, piece));
      at += piece;
    }
    EXPECT_EQ(stream.inputBytes(), input.size());
    std::optional<std::string> streamed = stream.finish();
    ASSERT_TRUE(streamed);
    std::optional<Bytes> whole = gzipDeflate(input);
    ASSERT_TRUE(whole);
    EXPECT_EQ(Bytes(streamed->begin(), streamed->end()), *whole);
    EXPECT_EQ(inflateAll(*whole), Bytes(input.begin(), input.end()));
    EXPECT_EQ(capture.count("compressDataWithZlibOrGzip: Compressed file from " + std::to_string(input.size()) +
                            " to " + std::to_string(streamed->size())),
              2u);
  }
}

TEST(Compression, StreamWithoutInputYieldsNothing) {
  log::LogCapture capture;
  GzipDeflateStream stream;
  EXPECT_TRUE(stream.append("", 0));
  EXPECT_FALSE(stream.finish().has_value());
  EXPECT_TRUE(capture.contains(log::Level::Error, "compressDataWithZlibOrGzip: Cannot compress empty ByteData"));
  // A finished stream takes nothing more.
  GzipDeflateStream finished;
  ASSERT_TRUE(finished.append("abc", 3));
  ASSERT_TRUE(finished.finish().has_value());
  EXPECT_FALSE(finished.append("d", 1));
}

TEST(Compression, ErrorMessagesByReturnCode) {
  EXPECT_STREQ(deflateInitErrorMessage(-6), "The version of zlib.h and the version of the library linked do not match.");
  EXPECT_STREQ(deflateInitErrorMessage(-4), "Insufficient memory.");
  EXPECT_STREQ(deflateInitErrorMessage(-2), "Invalid parameter passed in to function.");
  EXPECT_STREQ(deflateInitErrorMessage(-5), "Unknown error code.");
  EXPECT_STREQ(deflateErrorMessage(-6), "The version of zlib.h and the version of the library linked do not match.");
  EXPECT_STREQ(deflateErrorMessage(-5), "Ran out of output buffer for writing compressed bytes.");
  EXPECT_STREQ(deflateErrorMessage(-4), "Memory could not be allocated for processing.");
  EXPECT_STREQ(deflateErrorMessage(-3), "The deflate data was invalid or incomplete.");
  EXPECT_STREQ(deflateErrorMessage(-2), "The stream state was inconsistent (e.g., next_in or next_out was NULL).");
  EXPECT_STREQ(deflateErrorMessage(-1), "Error occured while reading file.");
  EXPECT_STREQ(deflateErrorMessage(2), "Unknown error code.");
  EXPECT_STREQ(deflateErrorMessage(-7), "Unknown error code.");
}

}  // namespace
}  // namespace telvane
