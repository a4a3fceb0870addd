// JSON in and out of Values, over RapidJSON, without a document tree.
//
// Writing drives RapidJSON's writer straight from the Value: dictionaries in their
// (sorted) key order, Integer and Unsigned as integers, doubles in the shortest text
// that reads back to the same double, bytes as a base64 string, dates as the number of
// seconds since 1970 (a double). JSON cannot carry NaN or an infinity, and its strings
// must be UTF-8: a value holding one of those (or nested deeper than
// kMaxNestingDepth) is refused as a whole, with the reason
// "value not representable in JSON: <description of the offending value>", rather
// than written as invalid JSON.
//
// Reading uses RapidJSON's event reader and builds the Value as the events arrive:
// integers become Integer (Unsigned above INT64_MAX), other numbers the nearest Double
// (a number below the smallest double becomes a zero, one above the largest is
// refused), strings must be valid UTF-8, and nesting deeper than
// kMaxNestingDepth is refused before it can exhaust the stack. When a key repeats
// within an object, the last one wins.
//
// Threading: safe from any thread. Writing keeps one scratch writer and buffer per
// thread, so that batches written record by record allocate nothing per record.
#pragma once

#include <string>
#include <string_view>

#include "platform/Result.h"
#include "telvane/Value.h"

namespace telvane::json {

inline constexpr int kMaxNestingDepth = 512;

// The JSON text of the value; `pretty` indents it for people.
Result<std::string> write(const Value& value, bool pretty = false);

// Appends the JSON text of the value to `out` (for building batches). On failure
// returns false and leaves `out` exactly as it was.
bool writeTo(std::string& out, const Value& value, bool pretty = false);

// Writes one JSON object member by member, with the rules of write() (compact form),
// for callers that assemble an object from several sources without building a Value
// first. Members are written into a per-thread scratch buffer; finish() appends the
// object ("{", the members, "}") to `out`. A member whose key or value cannot be
// written is refused and leaves no trace. Writers on one thread nest (each takes its
// own buffer) but must end in reverse order of creation; an unfinished object is
// dropped.
class ObjectWriter {
 public:
  explicit ObjectWriter(std::string& out);
  ~ObjectWriter();
  ObjectWriter(const ObjectWriter&) = delete;
  ObjectWriter& operator=(const ObjectWriter&) = delete;

  bool member(std::string_view key, const Value& value);
  // A member whose value is JSON text made elsewhere; the text is not checked.
  bool rawMember(std::string_view key, std::string_view json);
  void finish();

 private:
  std::string& out_;
  void* buffer_;  // the scratch buffer this writer took
  bool first_ = true;
};

// One JSON document (any value at the top); whitespace may surround it, nothing else.
Result<Value> parse(std::string_view text);

// True when the bytes are well-formed UTF-8: no overlong forms, no surrogates, no
// code point above U+10FFFF.
bool isValidUtf8(std::string_view text);

}  // namespace telvane::json
