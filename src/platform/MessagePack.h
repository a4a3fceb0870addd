// The IPC wire encoding of Values: MessagePack.
//
// Mapping: Dictionary ↔ map with string keys, Array ↔ array, String ↔ str, Bytes ↔
// bin, Integer/Unsigned ↔ int/uint in their shortest form, Double ↔ float64 (float32
// is read too), Boolean ↔ bool, Null ↔ nil, Date ↔ the timestamp extension (type -1):
// 32-bit when the date is whole seconds within 0..2^32-1, 64-bit for other dates
// from 1970 up to 2^34 seconds, 96-bit (signed seconds) otherwise. Dates keep
// nanoseconds: one more than about 200 days from 1970 comes back as the same double,
// a nearer one to the nanosecond. An integer on the wire decodes as Integer unless it
// is above INT64_MAX (then Unsigned).
//
// Encoding uses msgpack-c's packer and appends straight to the caller's buffer.
// Decoding reads the bytes straight into a Value, checking every length against the
// bytes that remain before reserving anything, so a hostile peer cannot make the
// daemon allocate for elements it never sent; msgpack-c's unpacker allocates for the
// declared count up front and stops at a fixed depth of 32, too shallow for payloads.
// String bytes are taken as they are (not checked for UTF-8).
//
// Both directions refuse nesting deeper than kMaxNestingDepth containers, so what one
// side encodes the other side decodes.
//
// Threading: free functions without shared state; safe from any thread.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <string_view>

#include "platform/Result.h"
#include "telvane/Value.h"

namespace telvane::msgpack_codec {

inline constexpr int kMaxNestingDepth = 256;

// Appends the encoding of the value to `out`. Returns false and leaves `out` as it
// was when the value has no encoding: nesting deeper than kMaxNestingDepth, a date
// that is not finite or lies beyond ±2^63 seconds, or a string, byte string or
// container longer than 2^32-1.
bool encode(const Value& value, std::string& out);

// Decodes exactly one value filling the whole buffer. Truncated or malformed input,
// trailing bytes, an extension other than the timestamp, a map key that is not a
// string or nesting deeper than kMaxNestingDepth yield a failure naming the offset.
Result<Value> decode(const std::uint8_t* data, std::size_t size);
inline Result<Value> decode(std::string_view data) {
  return decode(reinterpret_cast<const std::uint8_t*>(data.data()), data.size());
}
inline Result<Value> decode(const Bytes& data) { return decode(data.data(), data.size()); }

}  // namespace telvane::msgpack_codec
