#include "platform/Json.h"

#include <rapidjson/error/en.h>
#include <rapidjson/memorystream.h>
#include <rapidjson/prettywriter.h>
#include <rapidjson/reader.h>
#include <rapidjson/stringbuffer.h>
#include <rapidjson/writer.h>

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstdint>
#include <cstring>
#include <limits>
#include <memory>
#include <vector>

#include "platform/Base64.h"

namespace telvane::json {

namespace {

// Both writers check UTF-8 themselves: RapidJSON's own validation reads past the end
// of a string that stops inside a multi-byte sequence.
using CompactWriter = rapidjson::Writer<rapidjson::StringBuffer>;
using IndentingWriter = rapidjson::PrettyWriter<rapidjson::StringBuffer>;

// A buffer above this size is given back after use rather than kept for the thread.
constexpr std::size_t kKeptBufferBytes = 1 << 20;

template <typename Writer>
class ValueWriter {
 public:
  explicit ValueWriter(Writer& writer) : writer_(writer) {}

  bool write(const Value& value, int depth) {
    switch (value.type()) {
      case Value::Type::Null: return writer_.Null();
      case Value::Type::Boolean: return writer_.Bool(value.boolValue());
      case Value::Type::Integer: return writer_.Int64(value.integerValue());
      case Value::Type::Unsigned: return writer_.Uint64(value.unsignedLongLongValue());
      case Value::Type::Double: {
        double d = value.doubleValue();
        if (!std::isfinite(d)) return refuse(value.description());
        return writer_.Double(d);
      }
      case Value::Type::String: return writeString(*value.asString(), false);
      case Value::Type::Bytes: {
        std::string text = crypto::base64Encode(*value.asBytes());
        return writeString(text, false);
      }
      case Value::Type::Date: {
        double t = value.asDate()->secondsSince1970;
        if (!std::isfinite(t)) return refuse("a date of " + Value(t).description() + " seconds");
        return writer_.Double(t);
      }
      case Value::Type::Array: {
        if (depth >= kMaxNestingDepth) return refuse(nestingReason());
        if (!writer_.StartArray()) return false;
        for (const auto& item : *value.asArray()) {
          if (!write(item, depth + 1)) return false;
        }
        return writer_.EndArray();
      }
      case Value::Type::Dictionary: {
        if (depth >= kMaxNestingDepth) return refuse(nestingReason());
        if (!writer_.StartObject()) return false;
        for (const auto& [key, item] : *value.asDictionary()) {
          if (!writeString(key, true)) return false;
          if (!write(item, depth + 1)) return false;
        }
        return writer_.EndObject();
      }
    }
    return refuse(value.description());
  }

  const std::string& reason() const { return reason_; }

 private:
  static std::string nestingReason() {
    return "nesting deeper than " + std::to_string(kMaxNestingDepth) + " levels";
  }

  bool refuse(const std::string& what) {
    reason_ = "value not representable in JSON: " + what;
    return false;
  }

  bool writeString(const std::string& s, bool key) {
    if (s.size() > std::numeric_limits<rapidjson::SizeType>::max() || !isValidUtf8(s)) {
      return refuse(Value(s).description());
    }
    auto length = static_cast<rapidjson::SizeType>(s.size());
    return key ? writer_.Key(s.data(), length) : writer_.String(s.data(), length);
  }

  Writer& writer_;
  std::string reason_;
};

template <typename Writer>
bool writeWith(std::string& out, const Value& value, std::string* reason) {
  // Each thread keeps its writer and buffer: batches are written record by record, and
  // neither the writer's level stack nor the buffer is allocated again for each one.
  struct Scratch {
    rapidjson::StringBuffer buffer;
    Writer writer{buffer};
  };
  thread_local Scratch scratch;
  scratch.buffer.Clear();
  scratch.writer.Reset(scratch.buffer);
  ValueWriter<Writer> valueWriter(scratch.writer);
  bool ok = valueWriter.write(value, 0);
  if (ok) out.append(scratch.buffer.GetString(), scratch.buffer.GetSize());
  if (scratch.buffer.GetSize() > kKeptBufferBytes) {
    scratch.buffer.Clear();
    scratch.buffer.ShrinkToFit();
  }
  if (!ok && reason) *reason = valueWriter.reason().empty() ? "value not representable in JSON" : valueWriter.reason();
  return ok;
}

bool writeAny(std::string& out, const Value& value, bool pretty, std::string* reason) {
  return pretty ? writeWith<IndentingWriter>(out, value, reason) : writeWith<CompactWriter>(out, value, reason);
}

// True when a number the reader accepted but a double cannot hold is tiny rather
// than huge: its first significant digit stands at or after the decimal point.
bool isBelowDoubleRange(std::string_view text) {
  std::size_t exponentAt = text.find_first_of("eE");
  std::string_view mantissa = text.substr(0, exponentAt);
  long exponent = 0;
  if (exponentAt != std::string_view::npos) {
    std::string_view e = text.substr(exponentAt + 1);
    if (!e.empty() && e[0] == '+') e.remove_prefix(1);
    if (std::from_chars(e.data(), e.data() + e.size(), exponent).ec != std::errc()) {
      return !e.empty() && e[0] == '-';  // beyond a long: the sign decides
    }
  }
  if (!mantissa.empty() && mantissa[0] == '-') mantissa.remove_prefix(1);
  std::size_t point = mantissa.find('.');
  std::string_view whole = mantissa.substr(0, point);
  std::string_view fraction = point == std::string_view::npos ? std::string_view() : mantissa.substr(point + 1);
  std::size_t firstDigit = whole.find_first_not_of('0');
  long magnitude;
  if (firstDigit != std::string_view::npos) {
    magnitude = static_cast<long>(whole.size() - firstDigit);
  } else {
    std::size_t leadingZeros = fraction.find_first_not_of('0');
    magnitude = -static_cast<long>(leadingZeros == std::string_view::npos ? fraction.size() : leadingZeros);
  }
  return magnitude + exponent <= 0;
}

// The number the reader validated: an integer when the text is one and fits 64 bits,
// else the nearest double. False when it exceeds the largest double; numbers below
// the smallest one become a zero of their sign.
bool numberFromText(std::string_view text, Value& out) {
  const char* begin = text.data();
  const char* end = begin + text.size();
  if (text.find_first_of(".eE") == std::string_view::npos) {
    std::int64_t i = 0;
    if (std::from_chars(begin, end, i).ec == std::errc()) {
      out = Value(static_cast<long long>(i));
      return true;
    }
    std::uint64_t u = 0;
    if (text[0] != '-' && std::from_chars(begin, end, u).ec == std::errc()) {
      out = Value(static_cast<unsigned long long>(u));
      return true;
    }
  }
  double d = 0;
  auto result = std::from_chars(begin, end, d);
  if (result.ec == std::errc::result_out_of_range) {
    if (!isBelowDoubleRange(text)) return false;
    d = text[0] == '-' ? -0.0 : 0.0;
  } else if (result.ec != std::errc()) {
    return false;
  }
  out = Value(d);
  return true;
}

// Receives the reader's events and assembles the Value; containers under construction
// wait on a stack of frames.
class ValueBuilder {
 public:
  ValueBuilder() { frames_.reserve(16); }

  bool Null() { return add(Value()); }
  bool Bool(bool b) { return add(Value(b)); }
  bool Int(int i) { return add(Value(i)); }
  bool Uint(unsigned u) { return add(Value(static_cast<long long>(u))); }
  bool Int64(std::int64_t i) { return add(Value(static_cast<long long>(i))); }
  bool Uint64(std::uint64_t u) {
    if (u <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) {
      return add(Value(static_cast<long long>(u)));
    }
    return add(Value(static_cast<unsigned long long>(u)));
  }
  bool Double(double d) { return add(Value(d)); }
  // Numbers arrive as their text: RapidJSON's own full-precision conversion misbehaves
  // on a zero with an exponent ("0e5"), and the standard conversion is exact anyway.
  bool RawNumber(const char* text, rapidjson::SizeType length, bool) {
    Value number;
    if (!numberFromText(std::string_view(text, length), number)) {
      numberTooBig_ = true;
      return false;
    }
    return add(std::move(number));
  }
  bool String(const char* s, rapidjson::SizeType length, bool) { return add(Value(std::string(s, length))); }
  bool Key(const char* s, rapidjson::SizeType length, bool) {
    frames_.back().key.assign(s, length);
    return true;
  }
  bool StartObject() { return open(true); }
  bool StartArray() { return open(false); }
  bool EndArray(rapidjson::SizeType) {
    Array items = std::move(frames_.back().items);
    frames_.pop_back();
    return add(Value(std::move(items)));
  }
  bool EndObject(rapidjson::SizeType) {
    std::vector<Dictionary::Entry> entries = std::move(frames_.back().entries);
    frames_.pop_back();
    auto byKey = [](const Dictionary::Entry& a, const Dictionary::Entry& b) { return a.first < b.first; };
    // Sorted first, dictionary insertions are appends; the stable sort keeps repeated
    // keys in text order so that the last one wins.
    if (!std::is_sorted(entries.begin(), entries.end(), byKey)) {
      std::stable_sort(entries.begin(), entries.end(), byKey);
    }
    Dictionary dict;
    dict.reserve(entries.size());
    for (auto& [key, value] : entries) dict.set(std::move(key), std::move(value));
    return add(Value(std::move(dict)));
  }

  bool tooDeep() const { return tooDeep_; }
  bool numberTooBig() const { return numberTooBig_; }
  Value take() { return std::move(root_); }

 private:
  struct Frame {
    bool object = false;
    Array items;
    std::vector<Dictionary::Entry> entries;
    std::string key;
  };

  bool open(bool object) {
    if (frames_.size() >= static_cast<std::size_t>(kMaxNestingDepth)) {
      tooDeep_ = true;
      return false;
    }
    frames_.emplace_back();
    frames_.back().object = object;
    return true;
  }

  bool add(Value value) {
    if (frames_.empty()) {
      root_ = std::move(value);
      return true;
    }
    Frame& frame = frames_.back();
    if (frame.object) {
      frame.entries.emplace_back(std::move(frame.key), std::move(value));
      frame.key.clear();
    } else {
      frame.items.push_back(std::move(value));
    }
    return true;
  }

  std::vector<Frame> frames_;
  Value root_;
  bool tooDeep_ = false;
  bool numberTooBig_ = false;
};

}  // namespace

Result<std::string> write(const Value& value, bool pretty) {
  std::string out;
  std::string reason;
  if (!writeAny(out, value, pretty, &reason)) return Result<std::string>::failure(reason);
  return Result<std::string>::success(std::move(out));
}

bool writeTo(std::string& out, const Value& value, bool pretty) { return writeAny(out, value, pretty, nullptr); }

namespace {

// Scratch buffers of the object writers of this thread, one per nesting level; kept
// for reuse so that objects written one after another allocate nothing.
struct ObjectBuffers {
  std::vector<std::unique_ptr<rapidjson::StringBuffer>> buffers;
  std::size_t depth = 0;
};
thread_local ObjectBuffers tObjectBuffers;

rapidjson::StringBuffer& bufferOf(void* buffer) { return *static_cast<rapidjson::StringBuffer*>(buffer); }

void appendRaw(rapidjson::StringBuffer& buffer, std::string_view text) {
  if (text.empty()) return;
  std::memcpy(buffer.Push(text.size()), text.data(), text.size());
}

// Appends the key as a JSON string; false when it cannot be one.
bool appendKey(rapidjson::StringBuffer& buffer, std::string_view key) {
  if (key.size() > std::numeric_limits<rapidjson::SizeType>::max() || !isValidUtf8(key)) return false;
  CompactWriter writer(buffer);
  return writer.String(key.data(), static_cast<rapidjson::SizeType>(key.size()));
}

}  // namespace

ObjectWriter::ObjectWriter(std::string& out) : out_(out) {
  ObjectBuffers& buffers = tObjectBuffers;
  if (buffers.depth == buffers.buffers.size()) buffers.buffers.push_back(std::make_unique<rapidjson::StringBuffer>());
  rapidjson::StringBuffer& buffer = *buffers.buffers[buffers.depth++];
  buffer.Clear();
  buffer.Put('{');
  buffer_ = &buffer;
}

ObjectWriter::~ObjectWriter() {
  rapidjson::StringBuffer& buffer = bufferOf(buffer_);
  if (buffer.GetSize() > kKeptBufferBytes) {
    buffer.Clear();
    buffer.ShrinkToFit();
  }
  --tObjectBuffers.depth;
}

bool ObjectWriter::member(std::string_view key, const Value& value) {
  rapidjson::StringBuffer& buffer = bufferOf(buffer_);
  const std::size_t mark = buffer.GetSize();
  if (!first_) buffer.Put(',');
  bool ok = appendKey(buffer, key);
  if (ok) {
    buffer.Put(':');
    // A writer per value: a refused value leaves no writer state behind to undo.
    CompactWriter writer(buffer);
    ValueWriter<CompactWriter> valueWriter(writer);
    ok = valueWriter.write(value, 0);
  }
  if (!ok) {
    buffer.Pop(buffer.GetSize() - mark);
    return false;
  }
  first_ = false;
  return true;
}

bool ObjectWriter::rawMember(std::string_view key, std::string_view json) {
  rapidjson::StringBuffer& buffer = bufferOf(buffer_);
  const std::size_t mark = buffer.GetSize();
  if (!first_) buffer.Put(',');
  if (!appendKey(buffer, key)) {
    buffer.Pop(buffer.GetSize() - mark);
    return false;
  }
  buffer.Put(':');
  appendRaw(buffer, json);
  first_ = false;
  return true;
}

void ObjectWriter::finish() {
  rapidjson::StringBuffer& buffer = bufferOf(buffer_);
  buffer.Put('}');
  out_.append(buffer.GetString(), buffer.GetSize());
  buffer.Clear();
}

Result<Value> parse(std::string_view text) {
  rapidjson::MemoryStream stream(text.data(), text.size());
  rapidjson::Reader reader;
  ValueBuilder builder;
  constexpr unsigned kFlags = rapidjson::kParseNumbersAsStringsFlag | rapidjson::kParseValidateEncodingFlag;
  rapidjson::ParseResult result = reader.Parse<kFlags>(stream, builder);
  if (!result) {
    if (builder.numberTooBig()) {
      return Result<Value>::failure("JSON parse error at offset " + std::to_string(result.Offset()) + ": " +
                                    rapidjson::GetParseError_En(rapidjson::kParseErrorNumberTooBig));
    }
    if (builder.tooDeep()) {
      return Result<Value>::failure("JSON nested deeper than " + std::to_string(kMaxNestingDepth) +
                                    " levels at offset " + std::to_string(result.Offset()));
    }
    return Result<Value>::failure("JSON parse error at offset " + std::to_string(result.Offset()) + ": " +
                                  rapidjson::GetParseError_En(result.Code()));
  }
  // The stream reports a zero byte as the end of the text; one before the real end is
  // trailing garbage.
  if (stream.Tell() != text.size()) {
    return Result<Value>::failure("JSON parse error at offset " + std::to_string(stream.Tell()) +
                                  ": zero byte after the document");
  }
  return Result<Value>::success(builder.take());
}

bool isValidUtf8(std::string_view text) {
  const auto* p = reinterpret_cast<const unsigned char*>(text.data());
  const std::size_t n = text.size();
  std::size_t i = 0;
  while (i < n) {
    // Runs of ASCII, eight bytes at a time.
    while (i + 8 <= n) {
      std::uint64_t chunk;
      std::memcpy(&chunk, p + i, sizeof chunk);
      if (chunk & 0x8080808080808080ULL) break;
      i += 8;
    }
    if (i >= n) break;
    unsigned char c = p[i];
    if (c < 0x80) {
      ++i;
      continue;
    }
    std::size_t length;
    std::uint32_t codePoint;
    if (c >= 0xC2 && c <= 0xDF) {
      length = 2;
      codePoint = c & 0x1F;
    } else if ((c & 0xF0) == 0xE0) {
      length = 3;
      codePoint = c & 0x0F;
    } else if (c >= 0xF0 && c <= 0xF4) {
      length = 4;
      codePoint = c & 0x07;
    } else {
      return false;  // a continuation byte, an overlong lead (C0, C1) or F5..FF
    }
    if (n - i < length) return false;
    for (std::size_t k = 1; k < length; ++k) {
      unsigned char next = p[i + k];
      if ((next & 0xC0) != 0x80) return false;
      codePoint = (codePoint << 6) | (next & 0x3F);
    }
    if (length == 3 && (codePoint < 0x800 || (codePoint >= 0xD800 && codePoint <= 0xDFFF))) return false;
    if (length == 4 && (codePoint < 0x10000 || codePoint > 0x10FFFF)) return false;
    i += length;
  }
  return true;
}

}  // namespace telvane::json
