// telvane::Value: the one dynamic value of the system.
//
// Every map and list that crosses a boundary (session info, payloads, storebags,
// event records, IPC arguments) is a Value. A value is null, a boolean, a signed or
// unsigned 64-bit integer, a double, a UTF-8 string, bytes, a date (seconds since
// 1970 as a double), an array or a dictionary with string keys.
//
// Containers are reference-counted: copying a Value that holds an array or a
// dictionary shares the container ("the live map"). `copy()` makes a new container
// with the same elements (one level), `deepCopy()` copies all levels.
//
// Coercions (`integerValue`, `doubleValue`, `boolValue`) follow one set of rules for
// the whole system; code never converts by hand.
//
// Threading: a Value is not synchronised. A container shared between threads must be
// either immutable by then or guarded by its owner.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "telvane/Export.h"

namespace telvane {

class Value;

using Bytes = std::vector<std::uint8_t>;

// An ordered list of values.
using Array = std::vector<Value>;

class Dictionary;

struct Date {
  double secondsSince1970 = 0;
  bool operator==(const Date&) const = default;
};

class TELVANE_EXPORT Value {
 public:
  enum class Type { Null, Boolean, Integer, Unsigned, Double, String, Bytes, Date, Array, Dictionary };

  Value() = default;
  Value(std::nullptr_t) {}
  Value(bool b) : v_(b) {}
  Value(int i) : v_(static_cast<std::int64_t>(i)) {}
  Value(long i) : v_(static_cast<std::int64_t>(i)) {}
  Value(long long i) : v_(static_cast<std::int64_t>(i)) {}
  Value(unsigned u) : v_(static_cast<std::uint64_t>(u)) {}
  Value(unsigned long u) : v_(static_cast<std::uint64_t>(u)) {}
  Value(unsigned long long u) : v_(static_cast<std::uint64_t>(u)) {}
  Value(double d) : v_(d) {}
  Value(const char* s) : v_(std::string(s)) {}
  Value(std::string s) : v_(std::move(s)) {}
  Value(std::string_view s) : v_(std::string(s)) {}
  Value(Bytes b) : v_(std::make_shared<const telvane::Bytes>(std::move(b))) {}
  Value(Date d) : v_(d) {}
  // Wrap a container: the Value owns a new shared container holding it.
  Value(Array a);
  Value(Dictionary d);

  static Value date(double secondsSince1970) { return Value(Date{secondsSince1970}); }
  static Value array();
  static Value dictionary();

  Type type() const { return static_cast<Type>(v_.index()); }
  bool isNull() const { return type() == Type::Null; }
  bool isBoolean() const { return type() == Type::Boolean; }
  bool isInteger() const { return type() == Type::Integer || type() == Type::Unsigned; }
  bool isDouble() const { return type() == Type::Double; }
  // Integers, doubles and booleans all count as numbers.
  bool isNumber() const { return isInteger() || isDouble() || isBoolean(); }
  bool isString() const { return type() == Type::String; }
  bool isBytes() const { return type() == Type::Bytes; }
  bool isDate() const { return type() == Type::Date; }
  bool isArray() const { return type() == Type::Array; }
  bool isDictionary() const { return type() == Type::Dictionary; }

  // Coercions. Integer of a number truncates toward zero (saturating); of a string,
  // optional leading blanks, an optional sign and the leading decimal digits
  // (saturating); of anything else 0.
  std::int64_t integerValue() const;
  std::int32_t intValue() const { return static_cast<std::int32_t>(integerValue()); }
  std::uint32_t unsignedIntValue() const { return static_cast<std::uint32_t>(integerValue()); }
  std::uint16_t unsignedShortValue() const { return static_cast<std::uint16_t>(integerValue()); }
  std::uint64_t unsignedLongLongValue() const;
  // Double of a string: the longest leading decimal floating-point text, else 0.
  double doubleValue() const;
  // Boolean of a string: skip blanks, a sign and zeros; true on Y, y, T, t or 1-9.
  // Of a number: non-zero.
  bool boolValue() const;

  // Typed access: null when the value is of another type.
  const std::string* asString() const { return std::get_if<std::string>(&v_); }
  const telvane::Bytes* asBytes() const;
  const Date* asDate() const { return std::get_if<Date>(&v_); }
  const telvane::Array* asArray() const;
  telvane::Array* asArray();
  const telvane::Dictionary* asDictionary() const;
  telvane::Dictionary* asDictionary();
  // The string, or an empty string for any other type.
  const std::string& stringOrEmpty() const;

  // Dictionary convenience: the value for the key, or null (also when this is not a
  // dictionary).
  const Value& operator[](std::string_view key) const;

  // A new container with the same elements; scalars are returned as they are.
  Value copy() const;
  // A copy of every level.
  Value deepCopy() const;

  // A stable one-line description for logs.
  std::string description() const;

  // The allocation size the value itself takes (its node and its owned text or bytes).
  std::int32_t allocationSize() const;
  // The recursive memory estimate used by health reports and batch accounting: the
  // value's own allocation size, plus for a dictionary the allocation sizes of its keys
  // and, for each value, its estimate plus its allocation size; for an array, each
  // element's estimate plus its allocation size. Values and elements are counted twice
  // on purpose; sums wrap in 32 bits.
  std::int32_t sizeEstimate() const;

  bool operator==(const Value& other) const;
  bool operator!=(const Value& other) const { return !(*this == other); }

  // True when both values share the same container (the live map).
  bool sharesContainerWith(const Value& other) const;

 private:
  std::variant<std::monostate, bool, std::int64_t, std::uint64_t, double, std::string,
               std::shared_ptr<const telvane::Bytes>, Date, std::shared_ptr<telvane::Array>,
               std::shared_ptr<telvane::Dictionary>>
      v_;
};

// A dictionary with string keys, kept sorted by key so that iteration, descriptions
// and encodings are deterministic. Small maps dominate (event records, payloads), so
// a sorted vector beats a node-based map here.
class TELVANE_EXPORT Dictionary {
 public:
  using Entry = std::pair<std::string, Value>;
  using const_iterator = std::vector<Entry>::const_iterator;
  using iterator = std::vector<Entry>::iterator;

  Dictionary() = default;
  Dictionary(std::initializer_list<Entry> entries);

  // Null when the key is absent.
  const Value* find(std::string_view key) const;
  Value* find(std::string_view key);
  bool contains(std::string_view key) const { return find(key) != nullptr; }
  // The value for the key, or a null value when absent.
  const Value& get(std::string_view key) const;

  void set(std::string key, Value value);
  // Adds an entry whose key sorts after every key present (decoders that read keys in
  // order); a key equal to the last one replaces it. Anything else is a programmer
  // error, checked in debug builds.
  void appendInOrder(std::string key, Value value);
  // Returns true when the key was present.
  bool erase(std::string_view key);
  void clear() { entries_.clear(); }
  void reserve(std::size_t n) { entries_.reserve(n); }

  std::size_t size() const { return entries_.size(); }
  bool empty() const { return entries_.empty(); }
  const_iterator begin() const { return entries_.begin(); }
  const_iterator end() const { return entries_.end(); }
  iterator begin() { return entries_.begin(); }
  iterator end() { return entries_.end(); }

  bool operator==(const Dictionary& other) const;

 private:
  std::vector<Entry>::const_iterator lowerBound(std::string_view key) const;
  std::vector<Entry> entries_;
};

inline Value::Value(Array a) : v_(std::make_shared<telvane::Array>(std::move(a))) {}
inline Value::Value(Dictionary d) : v_(std::make_shared<telvane::Dictionary>(std::move(d))) {}
inline Value Value::array() { return Value(Array{}); }
inline Value Value::dictionary() { return Value(Dictionary{}); }

// Coercion helpers over raw text, shared with decoders and command-line parsing.
TELVANE_EXPORT std::int64_t integerFromText(std::string_view text);
TELVANE_EXPORT double doubleFromText(std::string_view text);
TELVANE_EXPORT bool boolFromText(std::string_view text);

}  // namespace telvane
