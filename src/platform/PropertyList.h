// Property lists in and out, XML and binary, over libplist.
//
// Storebag documents, the fallback document and the archives of log data are property
// lists. `decode` reads either form (a binary list starts with "bplist00") into a
// Value; `encodeBinary` and `encodeXml` write one.
//
// Type mapping: dict ↔ Dictionary, array ↔ Array, string ↔ String, integer ↔ Integer
// or Unsigned, real ↔ Double, boolean ↔ Boolean, date ↔ Date, data ↔ Bytes; a UID
// (a keyed-archive reference) decodes as an Integer.
//
// Integers: the library keeps every integer as 64 bits and a width. Negative numbers
// are 8-byte two's complement; only numbers above INT64_MAX are written as 16-byte
// (unsigned) integers. So an 8-byte integer whose bits read above INT64_MAX is the
// negative number it encodes and decodes as an Integer, while a 16-byte one (or an
// XML integer written above INT64_MAX) decodes as an Unsigned. Encoding mirrors this,
// so every Integer and Unsigned value comes back as it went in.
//
// Dates: property lists count seconds from 2001-01-01 00:00:00 UTC, Values from
// 1970; the codec converts both ways. A binary list keeps the exact double; XML keeps
// whole seconds.
//
// Null has no property-list form: encoding a value that holds a null anywhere fails,
// as does a string or key with an embedded zero byte (the library keeps C strings).
//
// Hostile input: the library parses binary lists and frees every tree recursively, so
// input is checked before it is handed over: nesting deeper than kMaxNestingDepth, a
// binary list whose shared objects would expand to more than kMaxBinaryObjectCount
// nodes, and XML whose tag boundaries different parsers could disagree on are refused.
// Malformed input yields a failure, never a crash.
//
// Threading: free functions without shared state; safe from any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Result.h"
#include "telvane/Value.h"

namespace telvane::plist {

// Containers nested deeper than this are refused, both ways.
inline constexpr int kMaxNestingDepth = 512;
// A binary list may reference one object from many places; the library copies each
// reference into its tree. More nodes than this after expansion are refused.
inline constexpr std::size_t kMaxBinaryObjectCount = std::size_t{1} << 20;

Result<Value> decode(const std::uint8_t* data, std::size_t size);
inline Result<Value> decode(const Bytes& data) { return decode(data.data(), data.size()); }
inline Result<Value> decode(std::string_view data) {
  return decode(reinterpret_cast<const std::uint8_t*>(data.data()), data.size());
}

Result<Bytes> encodeBinary(const Value& value);
Result<std::string> encodeXml(const Value& value);

}  // namespace telvane::plist
