#include "telvane/Value.h"

#include <algorithm>
#include <cassert>
#include <cerrno>
#include <cmath>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <limits>

namespace telvane {

namespace {

const Value kNullValue;
const std::string kEmptyString;

bool isBlank(char c) { return c == ' ' || c == '\t' || c == '\n' || c == '\r' || c == '\v' || c == '\f'; }

std::int64_t saturatingFromDouble(double d) {
  if (std::isnan(d)) return 0;
  if (d >= 9223372036854775807.0) return std::numeric_limits<std::int64_t>::max();
  if (d <= -9223372036854775808.0) return std::numeric_limits<std::int64_t>::min();
  return static_cast<std::int64_t>(d);  // truncation toward zero
}

// Allocation sizes as the allocator would round them: 16-byte granules.
std::int32_t granules(std::size_t bytes) {
  std::size_t rounded = (bytes + 15) / 16 * 16;
  return static_cast<std::int32_t>(std::min<std::size_t>(rounded, std::numeric_limits<std::int32_t>::max()));
}

std::int32_t stringAllocationSize(std::size_t length) {
  // A string object plus its character storage (with the terminating zero).
  return static_cast<std::int32_t>(32 + (length < 16 ? 0 : granules(length + 1)));
}

std::int32_t wrapAdd(std::int32_t a, std::int32_t b) {
  return static_cast<std::int32_t>(static_cast<std::uint32_t>(a) + static_cast<std::uint32_t>(b));
}

void appendQuoted(std::string& out, const std::string& s) {
  out += '"';
  for (unsigned char c : s) {
    switch (c) {
      case '"': out += "\\\""; break;
      case '\\': out += "\\\\"; break;
      case '\n': out += "\\n"; break;
      case '\r': out += "\\r"; break;
      case '\t': out += "\\t"; break;
      default:
        if (c < 0x20) {
          char buf[8];
          std::snprintf(buf, sizeof buf, "\\u%04x", c);
          out += buf;
        } else {
          out += static_cast<char>(c);
        }
    }
  }
  out += '"';
}

void describe(const Value& v, std::string& out) {
  switch (v.type()) {
    case Value::Type::Null: out += "null"; break;
    case Value::Type::Boolean: out += v.boolValue() ? "true" : "false"; break;
    case Value::Type::Integer: out += std::to_string(v.integerValue()); break;
    case Value::Type::Unsigned: out += std::to_string(v.unsignedLongLongValue()); break;
    case Value::Type::Double: {
      char buf[32];
      std::snprintf(buf, sizeof buf, "%.17g", v.doubleValue());
      out += buf;
      break;
    }
    case Value::Type::String: appendQuoted(out, *v.asString()); break;
    case Value::Type::Bytes: {
      static const char kHex[] = "0123456789abcdef";
      out += '<';
      for (auto b : *v.asBytes()) {
        out += kHex[b >> 4];
        out += kHex[b & 15];
      }
      out += '>';
      break;
    }
    case Value::Type::Date: {
      double t = v.asDate()->secondsSince1970;
      // Beyond the calendar's range (or not a number) the seconds are printed as they
      // are; converting such a double to time_t would be undefined.
      bool inRange = t > -1e17 && t < 1e17;
      std::time_t secs = inRange ? static_cast<std::time_t>(std::floor(t)) : 0;
      std::tm tm{};
      char buf[40];
      if (inRange && gmtime_r(&secs, &tm)) {
        std::strftime(buf, sizeof buf, "%Y-%m-%d %H:%M:%S +0000", &tm);
      } else {
        std::snprintf(buf, sizeof buf, "%.17g", t);
      }
      out += buf;
      break;
    }
    case Value::Type::Array: {
      out += '[';
      bool first = true;
      for (const auto& e : *v.asArray()) {
        if (!first) out += ", ";
        first = false;
        describe(e, out);
      }
      out += ']';
      break;
    }
    case Value::Type::Dictionary: {
      out += '{';
      bool first = true;
      for (const auto& [k, e] : *v.asDictionary()) {
        if (!first) out += ", ";
        first = false;
        appendQuoted(out, k);
        out += ": ";
        describe(e, out);
      }
      out += '}';
      break;
    }
  }
}

}  // namespace

// ---- text coercions ----

std::int64_t integerFromText(std::string_view text) {
  std::size_t i = 0;
  while (i < text.size() && isBlank(text[i])) ++i;
  bool negative = false;
  if (i < text.size() && (text[i] == '+' || text[i] == '-')) {
    negative = text[i] == '-';
    ++i;
  }
  // Accumulate as a negative number so that the minimum is representable.
  std::int64_t acc = 0;
  constexpr std::int64_t kMin = std::numeric_limits<std::int64_t>::min();
  bool overflow = false;
  for (; i < text.size() && text[i] >= '0' && text[i] <= '9'; ++i) {
    int digit = text[i] - '0';
    if (overflow) continue;
    if (acc < (kMin + digit) / 10) {
      overflow = true;
      continue;
    }
    acc = acc * 10 - digit;
  }
  if (overflow) return negative ? kMin : std::numeric_limits<std::int64_t>::max();
  if (negative) return acc;
  if (acc == kMin) return std::numeric_limits<std::int64_t>::max();
  return -acc;
}

double doubleFromText(std::string_view text) {
  // strtod needs a terminated buffer; it reads the longest valid leading text.
  std::string buf(text);
  const char* begin = buf.c_str();
  while (*begin && isBlank(*begin)) ++begin;
  // Only decimal text counts: refuse hex floats, infinities and NaN spelled out.
  const char* p = begin;
  if (*p == '+' || *p == '-') ++p;
  if (!((*p >= '0' && *p <= '9') || (*p == '.' && p[1] >= '0' && p[1] <= '9'))) return 0;
  if (p[0] == '0' && (p[1] == 'x' || p[1] == 'X')) {
    return begin[0] == '-' ? -0.0 : 0.0;
  }
  char* end = nullptr;
  errno = 0;
  double d = std::strtod(begin, &end);
  if (end == begin) return 0;
  return d;
}

bool boolFromText(std::string_view text) {
  std::size_t i = 0;
  while (i < text.size() && isBlank(text[i])) ++i;
  if (i < text.size() && (text[i] == '+' || text[i] == '-')) ++i;
  while (i < text.size() && text[i] == '0') ++i;
  if (i >= text.size()) return false;
  char c = text[i];
  return c == 'Y' || c == 'y' || c == 'T' || c == 't' || (c >= '1' && c <= '9');
}

// ---- Value ----

std::int64_t Value::integerValue() const {
  switch (type()) {
    case Type::Boolean: return std::get<bool>(v_) ? 1 : 0;
    case Type::Integer: return std::get<std::int64_t>(v_);
    case Type::Unsigned: {
      std::uint64_t u = std::get<std::uint64_t>(v_);
      return u > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())
                 ? std::numeric_limits<std::int64_t>::max()
                 : static_cast<std::int64_t>(u);
    }
    case Type::Double: return saturatingFromDouble(std::get<double>(v_));
    case Type::String: return integerFromText(std::get<std::string>(v_));
    default: return 0;
  }
}

std::uint64_t Value::unsignedLongLongValue() const {
  if (type() == Type::Unsigned) return std::get<std::uint64_t>(v_);
  if (type() == Type::Double) {
    double d = std::get<double>(v_);
    if (d >= 0 && d < 18446744073709551616.0) return static_cast<std::uint64_t>(d);
  }
  return static_cast<std::uint64_t>(integerValue());
}

double Value::doubleValue() const {
  switch (type()) {
    case Type::Boolean: return std::get<bool>(v_) ? 1.0 : 0.0;
    case Type::Integer: return static_cast<double>(std::get<std::int64_t>(v_));
    case Type::Unsigned: return static_cast<double>(std::get<std::uint64_t>(v_));
    case Type::Double: return std::get<double>(v_);
    case Type::String: return doubleFromText(std::get<std::string>(v_));
    default: return 0;
  }
}

bool Value::boolValue() const {
  switch (type()) {
    case Type::Boolean: return std::get<bool>(v_);
    case Type::Integer: return std::get<std::int64_t>(v_) != 0;
    case Type::Unsigned: return std::get<std::uint64_t>(v_) != 0;
    case Type::Double: return std::get<double>(v_) != 0.0;
    case Type::String: return boolFromText(std::get<std::string>(v_));
    default: return false;
  }
}

const telvane::Bytes* Value::asBytes() const {
  auto p = std::get_if<std::shared_ptr<const telvane::Bytes>>(&v_);
  return p ? p->get() : nullptr;
}

const telvane::Array* Value::asArray() const {
  auto p = std::get_if<std::shared_ptr<telvane::Array>>(&v_);
  return p ? p->get() : nullptr;
}

telvane::Array* Value::asArray() {
  auto p = std::get_if<std::shared_ptr<telvane::Array>>(&v_);
  return p ? p->get() : nullptr;
}

const telvane::Dictionary* Value::asDictionary() const {
  auto p = std::get_if<std::shared_ptr<telvane::Dictionary>>(&v_);
  return p ? p->get() : nullptr;
}

telvane::Dictionary* Value::asDictionary() {
  auto p = std::get_if<std::shared_ptr<telvane::Dictionary>>(&v_);
  return p ? p->get() : nullptr;
}

const std::string& Value::stringOrEmpty() const {
  auto s = asString();
  return s ? *s : kEmptyString;
}

const Value& Value::operator[](std::string_view key) const {
  auto d = asDictionary();
  return d ? d->get(key) : kNullValue;
}

Value Value::copy() const {
  if (auto a = asArray()) return Value(telvane::Array(*a));
  if (auto d = asDictionary()) return Value(telvane::Dictionary(*d));
  return *this;
}

Value Value::deepCopy() const {
  if (auto a = asArray()) {
    telvane::Array out;
    out.reserve(a->size());
    for (const auto& e : *a) out.push_back(e.deepCopy());
    return Value(std::move(out));
  }
  if (auto d = asDictionary()) {
    telvane::Dictionary out;
    out.reserve(d->size());
    for (const auto& [k, e] : *d) out.set(k, e.deepCopy());
    return Value(std::move(out));
  }
  return *this;
}

std::string Value::description() const {
  std::string out;
  describe(*this, out);
  return out;
}

std::int32_t Value::allocationSize() const {
  switch (type()) {
    case Type::Null: return 16;
    case Type::Boolean:
    case Type::Integer:
    case Type::Unsigned:
    case Type::Double:
    case Type::Date: return 16;
    case Type::String: return stringAllocationSize(asString()->size());
    case Type::Bytes: return wrapAdd(32, granules(asBytes()->size()));
    case Type::Array: return wrapAdd(48, granules(asArray()->capacity() * sizeof(Value)));
    case Type::Dictionary:
      return wrapAdd(48, granules(asDictionary()->size() * sizeof(telvane::Dictionary::Entry)));
  }
  return 16;
}

std::int32_t Value::sizeEstimate() const {
  std::int32_t sum = 0;
  if (auto d = asDictionary()) {
    for (const auto& [k, e] : *d) {
      sum = wrapAdd(sum, stringAllocationSize(k.size()));
      sum = wrapAdd(sum, wrapAdd(e.sizeEstimate(), e.allocationSize()));
    }
  } else if (auto a = asArray()) {
    for (const auto& e : *a) sum = wrapAdd(sum, wrapAdd(e.sizeEstimate(), e.allocationSize()));
  }
  return wrapAdd(sum, allocationSize());
}

bool Value::operator==(const Value& other) const {
  if (type() != other.type()) {
    // Integers compare by value across signedness.
    if (isInteger() && other.isInteger()) {
      if (integerValue() < 0 || other.integerValue() < 0) return false;
      return unsignedLongLongValue() == other.unsignedLongLongValue();
    }
    return false;
  }
  switch (type()) {
    case Type::Bytes: return *asBytes() == *other.asBytes();
    case Type::Array: return *asArray() == *other.asArray();
    case Type::Dictionary: return *asDictionary() == *other.asDictionary();
    default: return v_ == other.v_;
  }
}

bool Value::sharesContainerWith(const Value& other) const {
  if (auto a = asArray()) return a == other.asArray();
  if (auto d = asDictionary()) return d == other.asDictionary();
  return false;
}

// ---- Dictionary ----

Dictionary::Dictionary(std::initializer_list<Entry> entries) {
  entries_.reserve(entries.size());
  for (const auto& e : entries) set(e.first, e.second);
}

std::vector<Dictionary::Entry>::const_iterator Dictionary::lowerBound(std::string_view key) const {
  return std::lower_bound(entries_.begin(), entries_.end(), key,
                          [](const Entry& e, std::string_view k) { return std::string_view(e.first) < k; });
}

const Value* Dictionary::find(std::string_view key) const {
  auto it = lowerBound(key);
  if (it != entries_.end() && it->first == key) return &it->second;
  return nullptr;
}

Value* Dictionary::find(std::string_view key) {
  return const_cast<Value*>(static_cast<const Dictionary*>(this)->find(key));
}

const Value& Dictionary::get(std::string_view key) const {
  const Value* v = find(key);
  return v ? *v : kNullValue;
}

void Dictionary::set(std::string key, Value value) {
  auto cit = lowerBound(key);
  auto it = entries_.begin() + (cit - entries_.cbegin());
  if (it != entries_.end() && it->first == key) {
    it->second = std::move(value);
  } else {
    entries_.emplace(it, std::move(key), std::move(value));
  }
}

void Dictionary::appendInOrder(std::string key, Value value) {
  if (!entries_.empty() && entries_.back().first == key) {
    entries_.back().second = std::move(value);
    return;
  }
  assert(entries_.empty() || entries_.back().first < key);
  entries_.emplace_back(std::move(key), std::move(value));
}

bool Dictionary::erase(std::string_view key) {
  auto cit = lowerBound(key);
  if (cit == entries_.end() || cit->first != key) return false;
  entries_.erase(cit);
  return true;
}

bool Dictionary::operator==(const Dictionary& other) const { return entries_ == other.entries_; }

}  // namespace telvane
