#include "platform/MessagePack.h"

#include <msgpack.h>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <limits>
#include <vector>

namespace telvane::msgpack_codec {

namespace {

constexpr std::int8_t kTimestampType = -1;
constexpr std::uint32_t kNanosecondsPerSecond = 1000000000;
constexpr std::uint64_t kMaxLength = std::numeric_limits<std::uint32_t>::max();
// Timestamps carry signed 64-bit seconds; dates beyond ±2^63 have no encoding.
constexpr double kTimestampLimitSeconds = 9223372036854775808.0;
// Containers grow as their elements actually arrive; a declared count only reserves
// this much, so a large count with nothing behind it costs nothing.
constexpr std::uint64_t kMaxReserve = 1024;

int appendToString(void* data, const char* bytes, std::size_t length) {
  static_cast<std::string*>(data)->append(bytes, length);
  return 0;
}

class Encoder {
 public:
  explicit Encoder(std::string& out) { msgpack_packer_init(&packer_, &out, appendToString); }

  bool encode(const Value& value, int depth) {
    switch (value.type()) {
      case Value::Type::Null: msgpack_pack_nil(&packer_); return true;
      case Value::Type::Boolean:
        if (value.boolValue()) {
          msgpack_pack_true(&packer_);
        } else {
          msgpack_pack_false(&packer_);
        }
        return true;
      case Value::Type::Integer: msgpack_pack_int64(&packer_, value.integerValue()); return true;
      case Value::Type::Unsigned: msgpack_pack_uint64(&packer_, value.unsignedLongLongValue()); return true;
      case Value::Type::Double: msgpack_pack_double(&packer_, value.doubleValue()); return true;
      case Value::Type::String: {
        const std::string& s = *value.asString();
        if (s.size() > kMaxLength) return false;
        msgpack_pack_str_with_body(&packer_, s.data(), s.size());
        return true;
      }
      case Value::Type::Bytes: {
        const Bytes& b = *value.asBytes();
        if (b.size() > kMaxLength) return false;
        msgpack_pack_bin_with_body(&packer_, b.data(), b.size());
        return true;
      }
      case Value::Type::Date: return encodeDate(value.asDate()->secondsSince1970);
      case Value::Type::Array: {
        const Array& items = *value.asArray();
        if (depth >= kMaxNestingDepth || items.size() > kMaxLength) return false;
        msgpack_pack_array(&packer_, items.size());
        for (const auto& item : items) {
          if (!encode(item, depth + 1)) return false;
        }
        return true;
      }
      case Value::Type::Dictionary: {
        const Dictionary& dict = *value.asDictionary();
        if (depth >= kMaxNestingDepth || dict.size() > kMaxLength) return false;
        msgpack_pack_map(&packer_, dict.size());
        for (const auto& [key, item] : dict) {
          if (key.size() > kMaxLength) return false;
          msgpack_pack_str_with_body(&packer_, key.data(), key.size());
          if (!encode(item, depth + 1)) return false;
        }
        return true;
      }
    }
    return false;
  }

 private:
  bool encodeDate(double seconds) {
    if (!(seconds >= -kTimestampLimitSeconds && seconds < kTimestampLimitSeconds)) return false;
    double whole = std::floor(seconds);
    // The fraction of a double is exact; round it to the nearest nanosecond.
    auto nanoseconds = static_cast<std::int64_t>(std::llround((seconds - whole) * kNanosecondsPerSecond));
    auto wholeSeconds = static_cast<std::int64_t>(whole);
    if (nanoseconds >= kNanosecondsPerSecond) {
      if (wholeSeconds == std::numeric_limits<std::int64_t>::max()) return false;
      ++wholeSeconds;
      nanoseconds -= kNanosecondsPerSecond;
    }
    msgpack_timestamp timestamp{wholeSeconds, static_cast<std::uint32_t>(nanoseconds)};
    msgpack_pack_timestamp(&packer_, &timestamp);
    return true;
  }

  msgpack_packer packer_;
};

class Decoder {
 public:
  Decoder(const std::uint8_t* data, std::size_t size) : begin_(data), pos_(data), end_(data + size) {}

  bool value(Value& out, int depth) {
    if (pos_ == end_) return fail("truncated input");
    const std::uint8_t marker = *pos_++;
    if (marker <= 0x7f) {
      out = Value(static_cast<long long>(marker));
      return true;
    }
    if (marker >= 0xe0) {
      out = Value(static_cast<long long>(static_cast<std::int8_t>(marker)));
      return true;
    }
    if ((marker & 0xf0) == 0x80) return map(marker & 0x0f, out, depth);
    if ((marker & 0xf0) == 0x90) return array(marker & 0x0f, out, depth);
    if ((marker & 0xe0) == 0xa0) return string(marker & 0x1f, out);
    std::uint64_t n = 0;
    switch (marker) {
      case 0xc0: out = Value(); return true;
      case 0xc2: out = Value(false); return true;
      case 0xc3: out = Value(true); return true;
      case 0xc4: return readUnsigned(1, n) && bytes(n, out);
      case 0xc5: return readUnsigned(2, n) && bytes(n, out);
      case 0xc6: return readUnsigned(4, n) && bytes(n, out);
      case 0xc7: return readUnsigned(1, n) && extension(n, out);
      case 0xc8: return readUnsigned(2, n) && extension(n, out);
      case 0xc9: return readUnsigned(4, n) && extension(n, out);
      case 0xca: {
        if (!readUnsigned(4, n)) return false;
        auto bits = static_cast<std::uint32_t>(n);
        float f;
        std::memcpy(&f, &bits, sizeof f);
        out = Value(static_cast<double>(f));
        return true;
      }
      case 0xcb: {
        if (!readUnsigned(8, n)) return false;
        double d;
        std::memcpy(&d, &n, sizeof d);
        out = Value(d);
        return true;
      }
      case 0xcc: return readUnsigned(1, n) && integer(n, out);
      case 0xcd: return readUnsigned(2, n) && integer(n, out);
      case 0xce: return readUnsigned(4, n) && integer(n, out);
      case 0xcf: return readUnsigned(8, n) && integer(n, out);
      case 0xd0: return readSigned(1, out);
      case 0xd1: return readSigned(2, out);
      case 0xd2: return readSigned(4, out);
      case 0xd3: return readSigned(8, out);
      case 0xd4: return extension(1, out);
      case 0xd5: return extension(2, out);
      case 0xd6: return extension(4, out);
      case 0xd7: return extension(8, out);
      case 0xd8: return extension(16, out);
      case 0xd9: return readUnsigned(1, n) && string(n, out);
      case 0xda: return readUnsigned(2, n) && string(n, out);
      case 0xdb: return readUnsigned(4, n) && string(n, out);
      case 0xdc: return readUnsigned(2, n) && array(n, out, depth);
      case 0xdd: return readUnsigned(4, n) && array(n, out, depth);
      case 0xde: return readUnsigned(2, n) && map(n, out, depth);
      case 0xdf: return readUnsigned(4, n) && map(n, out, depth);
      default: --pos_; return fail("invalid type byte 0xc1");
    }
  }

  bool atEnd() const { return pos_ == end_; }
  std::size_t offset() const { return static_cast<std::size_t>(pos_ - begin_); }
  const std::string& error() const { return error_; }

 private:
  std::size_t remaining() const { return static_cast<std::size_t>(end_ - pos_); }

  bool fail(const char* what) {
    error_ = std::string("MessagePack ") + what + " at offset " + std::to_string(offset());
    return false;
  }

  bool readUnsigned(std::size_t width, std::uint64_t& n) {
    if (remaining() < width) return fail("truncated input");
    n = 0;
    for (std::size_t i = 0; i < width; ++i) n = (n << 8) | pos_[i];
    pos_ += width;
    return true;
  }

  bool readSigned(std::size_t width, Value& out) {
    std::uint64_t bits = 0;
    if (!readUnsigned(width, bits)) return false;
    // Sign-extend from the width read.
    std::uint64_t sign = std::uint64_t{1} << (width * 8 - 1);
    auto v = static_cast<std::int64_t>((bits ^ sign) - sign);
    out = Value(static_cast<long long>(v));
    return true;
  }

  bool integer(std::uint64_t n, Value& out) {
    if (n <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
      out = Value(static_cast<long long>(n));
    } else {
      out = Value(static_cast<unsigned long long>(n));
    }
    return true;
  }

  bool string(std::uint64_t n, Value& out) {
    if (remaining() < n) return fail("string longer than the input");
    out = Value(std::string(reinterpret_cast<const char*>(pos_), n));
    pos_ += n;
    return true;
  }

  bool bytes(std::uint64_t n, Value& out) {
    if (remaining() < n) return fail("byte string longer than the input");
    out = Value(Bytes(pos_, pos_ + n));
    pos_ += n;
    return true;
  }

  bool extension(std::uint64_t n, Value& out) {
    if (remaining() < 1 || remaining() - 1 < n) return fail("truncated extension");
    auto type = static_cast<std::int8_t>(*pos_);
    if (type != kTimestampType) return fail("extension of an unknown type");
    msgpack_object object{};
    object.type = MSGPACK_OBJECT_EXT;
    object.via.ext.type = type;
    object.via.ext.size = static_cast<std::uint32_t>(n);
    object.via.ext.ptr = reinterpret_cast<const char*>(pos_ + 1);
    msgpack_timestamp timestamp;
    if (!msgpack_object_to_timestamp(&object, &timestamp)) return fail("timestamp of a bad length");
    if (timestamp.tv_nsec >= kNanosecondsPerSecond) return fail("timestamp with more than a second of nanoseconds");
    double seconds =
        static_cast<double>(timestamp.tv_sec) + static_cast<double>(timestamp.tv_nsec) / kNanosecondsPerSecond;
    // Seconds near 2^63 round up to 2^63 as a double; keep decoded dates encodable.
    if (!(seconds < kTimestampLimitSeconds)) return fail("timestamp out of range");
    pos_ += 1 + n;
    out = Value::date(seconds);
    return true;
  }

  bool array(std::uint64_t n, Value& out, int depth) {
    if (depth >= kMaxNestingDepth) return fail("nested too deeply");
    if (n > remaining()) return fail("array longer than the input");  // each element takes a byte
    Array items;
    items.reserve(std::min<std::uint64_t>(n, kMaxReserve));
    for (std::uint64_t i = 0; i < n; ++i) {
      items.emplace_back();
      if (!value(items.back(), depth + 1)) return false;
    }
    out = Value(std::move(items));
    return true;
  }

  bool key(std::string& out) {
    if (pos_ == end_) return fail("truncated input");
    std::uint8_t marker = *pos_;
    std::uint64_t n = 0;
    if ((marker & 0xe0) == 0xa0) {
      n = marker & 0x1f;
      ++pos_;
    } else if (marker >= 0xd9 && marker <= 0xdb) {
      ++pos_;
      if (!readUnsigned(std::size_t{1} << (marker - 0xd9), n)) return false;
    } else {
      return fail("map key that is not a string");
    }
    if (remaining() < n) return fail("string longer than the input");
    out.assign(reinterpret_cast<const char*>(pos_), n);
    pos_ += n;
    return true;
  }

  bool map(std::uint64_t n, Value& out, int depth) {
    if (depth >= kMaxNestingDepth) return fail("nested too deeply");
    if (n > remaining() / 2) return fail("map longer than the input");  // each entry takes two bytes
    Dictionary dict;
    dict.reserve(std::min<std::uint64_t>(n, kMaxReserve));
    // Keys normally arrive sorted (every encoder of ours sorts them) and are appended.
    // Out of order, the entries are gathered and sorted once, so that a hostile order
    // costs n log n rather than n² shifts; the stable sort lets the last repeat win.
    std::vector<Dictionary::Entry> gathered;
    bool ordered = true;
    for (std::uint64_t i = 0; i < n; ++i) {
      std::string k;
      Value v;
      if (!key(k) || !value(v, depth + 1)) return false;
      if (ordered && (dict.empty() || k >= std::prev(dict.end())->first)) {
        dict.appendInOrder(std::move(k), std::move(v));
        continue;
      }
      if (ordered) {
        ordered = false;
        gathered.reserve(std::min<std::uint64_t>(n, kMaxReserve));
        for (auto& entry : dict) gathered.push_back(std::move(entry));
        dict.clear();
      }
      gathered.emplace_back(std::move(k), std::move(v));
    }
    if (!ordered) {
      std::stable_sort(gathered.begin(), gathered.end(),
                       [](const Dictionary::Entry& a, const Dictionary::Entry& b) { return a.first < b.first; });
      for (auto& [k, v] : gathered) dict.set(std::move(k), std::move(v));
    }
    out = Value(std::move(dict));
    return true;
  }

  const std::uint8_t* begin_;
  const std::uint8_t* pos_;
  const std::uint8_t* end_;
  std::string error_;
};

}  // namespace

bool encode(const Value& value, std::string& out) {
  const std::size_t mark = out.size();
  Encoder encoder(out);
  if (encoder.encode(value, 0)) return true;
  out.resize(mark);
  return false;
}

Result<Value> decode(const std::uint8_t* data, std::size_t size) {
  Decoder decoder(data, size);
  Value value;
  if (!decoder.value(value, 0)) return Result<Value>::failure(decoder.error());
  if (!decoder.atEnd()) {
    return Result<Value>::failure("MessagePack trailing bytes after the value at offset " +
                                  std::to_string(decoder.offset()));
  }
  return Result<Value>::success(std::move(value));
}

}  // namespace telvane::msgpack_codec
