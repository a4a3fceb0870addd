#include "platform/PropertyList.h"

#include <plist/plist.h>

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <cstring>
#include <limits>
#include <memory>
#include <vector>

#include "platform/Json.h"

namespace telvane::plist {

namespace {

constexpr double kSecondsFrom1970To2001 = 978307200.0;
// Encodable dates: years 1000 to 9999 (the XML writer prints the year unpadded).
constexpr double kMinDateSince1970 = -30610224000.0;
constexpr double kMaxDateSince1970 = 253402300799.0;
// The XML check counts every element, so it allows the property-list element and a
// leaf element on top of the container depth.
constexpr int kMaxXmlElementDepth = kMaxNestingDepth + 2;
constexpr std::size_t kBinaryHeaderSize = 8;
constexpr std::size_t kBinaryTrailerSize = 32;
constexpr std::uint8_t kBinaryDateMarker = 0x33;

struct PlistFree {
  void operator()(void* node) const { plist_free(static_cast<plist_t>(node)); }
};
using PlistPtr = std::unique_ptr<void, PlistFree>;

std::uint64_t readBigEndian(const std::uint8_t* p, std::size_t width) {
  std::uint64_t v = 0;
  for (std::size_t i = 0; i < width; ++i) v = (v << 8) | p[i];
  return v;
}

// ---- checks before the library sees the input ----

// Quotes inside a tag must pair up with no quote of the other kind inside, so that
// every parser, whichever quotes it honours, ends the tag at its first '>'.
bool quotesUnambiguous(std::string_view tag) {
  std::size_t i = 0;
  while ((i = tag.find_first_of("\"'", i)) != std::string_view::npos) {
    char quote = tag[i];
    std::size_t end = tag.find(quote, i + 1);
    if (end == std::string_view::npos) return false;
    if (tag.substr(i + 1, end - i - 1).find(quote == '"' ? '\'' : '"') != std::string_view::npos) return false;
    i = end + 1;
  }
  return true;
}

// The library parses XML without recursion but frees the tree recursively; bound the
// element depth first. Over-counting is harmless (a rare odd document is refused);
// the rules below make sure the count never falls below the parser's depth.
Status checkXml(std::string_view xml) {
  const auto npos = std::string_view::npos;
  const Status ambiguous = statusError("XML property list uses constructs that are not supported");
  int depth = 0;
  std::size_t i = 0;
  while ((i = xml.find('<', i)) != npos) {
    std::string_view rest = xml.substr(i);
    if (rest.starts_with("<!--")) {
      std::size_t end = xml.find("-->", i + 4);
      if (end == npos) return statusOk();  // unterminated: the parser refuses it
      if (xml.substr(i, end - i).find_first_of("\"'") != npos) return ambiguous;
      i = end + 3;
      continue;
    }
    if (rest.starts_with("<![CDATA[")) {
      std::size_t end = xml.find("]]>", i + 9);
      if (end == npos) return statusOk();
      i = end + 3;
      continue;
    }
    bool instruction = rest.starts_with("<?");
    std::size_t close = instruction ? xml.find("?>", i + 2) : xml.find('>', i + 1);
    if (close == npos) return statusOk();
    std::string_view tag = xml.substr(i, close - i);
    if (!quotesUnambiguous(tag)) return ambiguous;
    i = close + (instruction ? 2 : 1);
    if (instruction) continue;
    if (tag.size() > 1 && tag[1] == '!') {
      if (tag.find('[') != npos) return ambiguous;  // an internal DTD subset
    } else if (tag.size() > 1 && tag[1] == '/') {
      if (depth > 0) --depth;
    } else if (tag.back() != '/') {
      if (++depth > kMaxXmlElementDepth) return statusError("property list nested too deeply");
    }
  }
  return statusOk();
}

// Walks the object graph of a binary list: the library parses it recursively and
// copies each reference of a shared object, so both the depth and the expanded size
// are bounded here, with each object visited once.
class BinaryCheck {
 public:
  BinaryCheck(const std::uint8_t* data, std::size_t size) : data_(data), size_(size) {}

  Status run() {
    if (size_ < kBinaryHeaderSize + kBinaryTrailerSize) return statusError("binary property list is truncated");
    const std::uint8_t* trailer = data_ + size_ - kBinaryTrailerSize;
    offsetWidth_ = trailer[6];
    refWidth_ = trailer[7];
    std::uint64_t count = readBigEndian(trailer + 8, 8);
    std::uint64_t root = readBigEndian(trailer + 16, 8);
    tableOffset_ = readBigEndian(trailer + 24, 8);
    auto validWidth = [](std::size_t w) { return w == 1 || w == 2 || w == 4 || w == 8; };
    objectsEnd_ = size_ - kBinaryTrailerSize;
    if (!validWidth(offsetWidth_) || !validWidth(refWidth_) || count == 0 || root >= count ||
        tableOffset_ < kBinaryHeaderSize || tableOffset_ > objectsEnd_ ||
        count > (objectsEnd_ - tableOffset_) / offsetWidth_) {
      return statusError("binary property list has a malformed trailer");
    }
    objectCount_ = count;
    state_.assign(count, 0);
    height_.assign(count, 0);
    nodes_.assign(count, 0);
    if (!visit(root, 0)) return statusError(error_);
    if (nodes_[root] > kMaxBinaryObjectCount) return statusError("binary property list expands to too many objects");
    return statusOk();
  }

 private:
  bool fail(const char* message) {
    error_ = message;
    return false;
  }

  // The object's offset and marker, or false when the offset is out of place.
  bool locate(std::uint64_t index, std::size_t& offset) {
    offset = readBigEndian(data_ + tableOffset_ + index * offsetWidth_, offsetWidth_);
    if (offset < kBinaryHeaderSize || offset >= objectsEnd_) return fail("binary property list has a bad object offset");
    return true;
  }

  // The element count after a marker: its low nibble, or an integer object after it.
  bool readCount(std::uint8_t marker, std::size_t& pos, std::uint64_t& count) {
    count = marker & 0x0F;
    if (count != 0x0F) return true;
    if (pos >= objectsEnd_ || (data_[pos] >> 4) != 0x1) return fail("binary property list has a bad count");
    std::size_t width = std::size_t{1} << (data_[pos] & 0x0F);
    if (width > 8 || objectsEnd_ - pos - 1 < width) return fail("binary property list has a bad count");
    count = readBigEndian(data_ + pos + 1, width);
    pos += 1 + width;
    return true;
  }

  bool fits(std::size_t pos, std::uint64_t length) {
    if (length > objectsEnd_ - pos) return fail("binary property list has an object running past its end");
    return true;
  }

  // Only well-formed objects reach the library: it asserts on some malformed ones (a
  // key with a zero byte) instead of refusing them.
  bool checkLeaf(std::uint8_t marker, std::size_t pos) {
    const unsigned low = marker & 0x0F;
    std::uint64_t count = 0;
    switch (marker >> 4) {
      case 0x0:
        if (marker == 0x08 || marker == 0x09) return true;  // false, true
        break;
      case 0x1: if (low <= 4) return fits(pos, std::uint64_t{1} << low); break;  // 1 to 16 bytes
      case 0x2: if (low == 2 || low == 3) return fits(pos, std::uint64_t{1} << low); break;
      case 0x3: if (marker == kBinaryDateMarker) return fits(pos, 8); break;
      case 0x4: return readCount(marker, pos, count) && fits(pos, count);
      case 0x5: {
        if (!readCount(marker, pos, count) || !fits(pos, count)) return false;
        if (std::memchr(data_ + pos, 0, count)) return fail("binary property list has a string with a zero byte");
        return true;
      }
      case 0x6: {
        if (!readCount(marker, pos, count) || count > objectsEnd_ || !fits(pos, count * 2)) return false;
        for (std::uint64_t i = 0; i < count; ++i) {
          if (data_[pos + 2 * i] == 0 && data_[pos + 2 * i + 1] == 0) {
            return fail("binary property list has a string with a zero byte");
          }
        }
        return true;
      }
      case 0x8: if (low <= 7) return fits(pos, low + 1); break;  // a UID of 1 to 8 bytes
      default: break;
    }
    return fail("binary property list has an object of an unsupported type");
  }

  bool visit(std::uint64_t index, int depth) {
    if (state_[index] == kDone) return true;
    if (state_[index] == kVisiting) return fail("binary property list contains a reference cycle");
    std::size_t offset = 0;
    if (!locate(index, offset)) return false;
    const std::uint8_t marker = data_[offset];
    const unsigned kind = marker >> 4;
    std::size_t pos = offset + 1;
    if (kind != 0xA && kind != 0xC && kind != 0xD) {
      if (!checkLeaf(marker, pos)) return false;
      state_[index] = kDone;
      nodes_[index] = 1;
      return true;
    }
    if (depth >= kMaxNestingDepth) return fail("property list nested too deeply");
    std::uint64_t entries = 0;
    if (!readCount(marker, pos, entries)) return false;
    const std::uint64_t refs = kind == 0xD ? entries * 2 : entries;
    if (entries > objectsEnd_ || refs > (objectsEnd_ - pos) / refWidth_) {
      return fail("binary property list has a bad count");
    }
    state_[index] = kVisiting;
    std::uint32_t height = 0;
    std::uint64_t nodes = 1;
    for (std::uint64_t r = 0; r < refs; ++r) {
      std::uint64_t child = readBigEndian(data_ + pos + r * refWidth_, refWidth_);
      if (child >= objectCount_) return fail("binary property list has a bad object reference");
      if (kind == 0xD && r < entries) {  // the keys come first and must be strings
        std::size_t keyOffset = 0;
        if (!locate(child, keyOffset)) return false;
        unsigned keyKind = data_[keyOffset] >> 4;
        if (keyKind != 0x5 && keyKind != 0x6) return fail("binary property list has a key that is not a string");
      }
      if (!visit(child, depth + 1)) return false;
      height = std::max(height, height_[child]);
      nodes = std::min<std::uint64_t>(nodes + nodes_[child], kMaxBinaryObjectCount + 1);
    }
    height_[index] = height + 1;
    if (height_[index] > static_cast<std::uint32_t>(kMaxNestingDepth)) return fail("property list nested too deeply");
    nodes_[index] = static_cast<std::uint32_t>(nodes);
    state_[index] = kDone;
    return true;
  }

  static constexpr std::uint8_t kVisiting = 1;
  static constexpr std::uint8_t kDone = 2;

  const std::uint8_t* data_;
  std::size_t size_;
  std::size_t offsetWidth_ = 0;
  std::size_t refWidth_ = 0;
  std::uint64_t tableOffset_ = 0;
  std::uint64_t objectsEnd_ = 0;
  std::uint64_t objectCount_ = 0;
  std::vector<std::uint8_t> state_;
  std::vector<std::uint32_t> height_;
  std::vector<std::uint32_t> nodes_;
  std::string error_;
};

// ---- library tree → Value ----

// True when an integer node above INT64_MAX was marked unsigned (16 bytes wide): the
// library's own constructor makes 8-byte nodes, and node comparison includes the width.
bool isWideUnsigned(plist_t node, std::uint64_t bits) {
  PlistPtr narrow(plist_new_uint(bits));
  return !plist_compare_node_value(node, static_cast<plist_t>(narrow.get()));
}

// The library hands dates out as whole seconds and a magnitude of microseconds (the
// sign of dates just before 2001 is lost). A one-object binary list of the node
// carries the exact double.
double secondsSince2001(plist_t node) {
  char* buffer = nullptr;
  std::uint32_t length = 0;
  plist_to_bin(node, &buffer, &length);
  std::unique_ptr<char, void (*)(char*)> owned(buffer, plist_to_bin_free);
  if (buffer && length >= kBinaryHeaderSize + 9 &&
      static_cast<std::uint8_t>(buffer[kBinaryHeaderSize]) == kBinaryDateMarker) {
    std::uint64_t bits = readBigEndian(reinterpret_cast<const std::uint8_t*>(buffer) + kBinaryHeaderSize + 1, 8);
    double seconds;
    std::memcpy(&seconds, &bits, sizeof seconds);
    return seconds;
  }
  std::int32_t sec = 0, usec = 0;
  plist_get_date_val(node, &sec, &usec);
  return sec + (sec < 0 ? -usec : usec) / 1e6;
}

Value integerValue(std::uint64_t bits, bool unsignedWidth) {
  if (bits <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max()) || !unsignedWidth) {
    return Value(static_cast<long long>(bits));  // two's complement for negative numbers
  }
  return Value(static_cast<unsigned long long>(bits));
}

bool toValue(plist_t node, int depth, Value& out, std::string& error) {
  switch (plist_get_node_type(node)) {
    case PLIST_BOOLEAN: {
      std::uint8_t b = 0;
      plist_get_bool_val(node, &b);
      out = Value(b != 0);
      return true;
    }
    case PLIST_UINT: {
      std::uint64_t bits = 0;
      plist_get_uint_val(node, &bits);
      bool wide = bits > static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max()) &&
                  isWideUnsigned(node, bits);
      out = integerValue(bits, wide);
      return true;
    }
    case PLIST_UID: {
      std::uint64_t uid = 0;
      plist_get_uid_val(node, &uid);
      out = integerValue(uid, true);
      return true;
    }
    case PLIST_REAL: {
      double d = 0;
      plist_get_real_val(node, &d);
      out = Value(d);
      return true;
    }
    case PLIST_STRING:
    case PLIST_KEY: {
      std::uint64_t length = 0;
      const char* s = plist_get_string_ptr(node, &length);
      out = s ? Value(std::string(s, length)) : Value(std::string());
      return true;
    }
    case PLIST_DATA: {
      std::uint64_t length = 0;
      const char* p = plist_get_data_ptr(node, &length);
      out = p ? Value(Bytes(p, p + length)) : Value(Bytes());
      return true;
    }
    case PLIST_DATE:
      out = Value::date(secondsSince2001(node) + kSecondsFrom1970To2001);
      return true;
    case PLIST_ARRAY: {
      if (depth >= kMaxNestingDepth) return (error = "property list nested too deeply"), false;
      std::uint32_t n = plist_array_get_size(node);
      Array items;
      items.reserve(n);
      for (std::uint32_t i = 0; i < n; ++i) {
        Value item;
        if (!toValue(plist_array_get_item(node, i), depth + 1, item, error)) return false;
        items.push_back(std::move(item));
      }
      out = Value(std::move(items));
      return true;
    }
    case PLIST_DICT: {
      if (depth >= kMaxNestingDepth) return (error = "property list nested too deeply"), false;
      std::vector<Dictionary::Entry> entries;
      entries.reserve(plist_dict_get_size(node));
      plist_dict_iter iter = nullptr;
      plist_dict_new_iter(node, &iter);
      std::unique_ptr<void, void (*)(void*)> ownedIter(iter, std::free);
      bool ok = true;
      while (ok) {
        char* key = nullptr;
        plist_t item = nullptr;
        plist_dict_next_item(node, iter, &key, &item);
        std::unique_ptr<char, void (*)(void*)> ownedKey(key, std::free);
        if (!item) break;
        Value value;
        ok = toValue(item, depth + 1, value, error);
        if (ok) entries.emplace_back(key ? std::string(key) : std::string(), std::move(value));
      }
      if (!ok) return false;
      // Keys of a property list are unique, so a stable sort then appending in order
      // builds the dictionary without shifting entries around.
      std::stable_sort(entries.begin(), entries.end(),
                       [](const Dictionary::Entry& a, const Dictionary::Entry& b) { return a.first < b.first; });
      Dictionary dict;
      dict.reserve(entries.size());
      for (auto& [k, v] : entries) dict.set(std::move(k), std::move(v));
      out = Value(std::move(dict));
      return true;
    }
    default:
      error = "property list holds a node of an unsupported type";
      return false;
  }
}

// ---- Value → library tree ----

// An integer above INT64_MAX must be a 16-byte node to be written unsigned; the
// library builds those only when it reads one, so it reads one.
plist_t newWideUnsigned(std::uint64_t u) {
  std::string xml = "<integer>" + std::to_string(u) + "</integer>";
  plist_t node = nullptr;
  plist_from_xml(xml.data(), static_cast<std::uint32_t>(xml.size()), &node);
  return node;
}

// A date node holding the exact double: the library's constructor takes whole seconds
// and microseconds in 32 bits each. A one-object binary list carries the double.
plist_t newDate(double secondsSince2001) {
  std::uint8_t list[kBinaryHeaderSize + 9 + 1 + kBinaryTrailerSize] = {'b', 'p', 'l', 'i', 's', 't', '0', '0',
                                                                      kBinaryDateMarker};
  std::uint64_t bits;
  std::memcpy(&bits, &secondsSince2001, sizeof bits);
  for (int i = 0; i < 8; ++i) list[9 + i] = static_cast<std::uint8_t>(bits >> (56 - 8 * i));
  list[17] = static_cast<std::uint8_t>(kBinaryHeaderSize);  // offset table: object 0 at 8
  std::uint8_t* trailer = list + 18;
  trailer[6] = 1;   // offset width
  trailer[7] = 1;   // reference width
  trailer[15] = 1;  // one object; the root is object 0
  trailer[31] = 17;  // the offset table starts at 17
  plist_t node = nullptr;
  plist_from_bin(reinterpret_cast<const char*>(list), sizeof list, &node);
  return node;
}

bool encodableText(const std::string& s, std::string& error) {
  if (s.find('\0') != std::string::npos) {
    error = "a string with a zero byte cannot be encoded in a property list";
    return false;
  }
  if (!json::isValidUtf8(s)) {
    error = "a string that is not valid UTF-8 cannot be encoded in a property list";
    return false;
  }
  return true;
}

plist_t fromValue(const Value& value, int depth, std::string& error) {
  switch (value.type()) {
    case Value::Type::Null:
      error = "null cannot be encoded in a property list";
      return nullptr;
    case Value::Type::Boolean: return plist_new_bool(value.boolValue() ? 1 : 0);
    case Value::Type::Integer: return plist_new_uint(static_cast<std::uint64_t>(value.integerValue()));
    case Value::Type::Unsigned: {
      std::uint64_t u = value.unsignedLongLongValue();
      if (u <= static_cast<std::uint64_t>(std::numeric_limits<std::int64_t>::max())) return plist_new_uint(u);
      plist_t node = newWideUnsigned(u);
      if (!node) error = "could not build an unsigned property-list integer";
      return node;
    }
    case Value::Type::Double: return plist_new_real(value.doubleValue());
    case Value::Type::String: {
      if (!encodableText(*value.asString(), error)) return nullptr;
      return plist_new_string(value.asString()->c_str());
    }
    case Value::Type::Bytes: {
      const Bytes& b = *value.asBytes();
      return plist_new_data(b.empty() ? "" : reinterpret_cast<const char*>(b.data()), b.size());
    }
    case Value::Type::Date: {
      double t = value.asDate()->secondsSince1970;
      if (!(t >= kMinDateSince1970 && t <= kMaxDateSince1970)) {
        error = "date out of the range a property list can hold: " + value.description();
        return nullptr;
      }
      plist_t node = newDate(t - kSecondsFrom1970To2001);
      if (!node) error = "could not build a property-list date";
      return node;
    }
    case Value::Type::Array: {
      if (depth >= kMaxNestingDepth) return (error = "value nested too deeply for a property list"), nullptr;
      PlistPtr array(plist_new_array());
      for (const auto& item : *value.asArray()) {
        plist_t node = fromValue(item, depth + 1, error);
        if (!node) return nullptr;
        plist_array_append_item(static_cast<plist_t>(array.get()), node);
      }
      return static_cast<plist_t>(array.release());
    }
    case Value::Type::Dictionary: {
      if (depth >= kMaxNestingDepth) return (error = "value nested too deeply for a property list"), nullptr;
      PlistPtr dict(plist_new_dict());
      for (const auto& [key, item] : *value.asDictionary()) {
        if (!encodableText(key, error)) return nullptr;
        plist_t node = fromValue(item, depth + 1, error);
        if (!node) return nullptr;
        plist_dict_set_item(static_cast<plist_t>(dict.get()), key.c_str(), node);
      }
      return static_cast<plist_t>(dict.release());
    }
  }
  error = "value of an unknown type";
  return nullptr;
}

}  // namespace

Result<Value> decode(const std::uint8_t* data, std::size_t size) {
  if (size == 0) return Result<Value>::failure("empty property list");
  if (size > std::numeric_limits<std::uint32_t>::max()) return Result<Value>::failure("property list too large");
  const char* text = reinterpret_cast<const char*>(data);
  bool binary = size >= kBinaryHeaderSize && std::memcmp(data, "bplist00", kBinaryHeaderSize) == 0;
  Status checked = binary ? BinaryCheck(data, size).run() : checkXml(std::string_view(text, size));
  if (!checked) return Result<Value>::failure(checked.error());

  plist_t root = nullptr;
  if (binary) {
    plist_from_bin(text, static_cast<std::uint32_t>(size), &root);
  } else {
    plist_from_xml(text, static_cast<std::uint32_t>(size), &root);
  }
  if (!root) return Result<Value>::failure(binary ? "malformed binary property list" : "malformed XML property list");
  PlistPtr owned(root);
  Value value;
  std::string error;
  if (!toValue(root, 0, value, error)) return Result<Value>::failure(error);
  return Result<Value>::success(std::move(value));
}

Result<Bytes> encodeBinary(const Value& value) {
  std::string error;
  PlistPtr root(fromValue(value, 0, error));
  if (!root) return Result<Bytes>::failure(error);
  char* buffer = nullptr;
  std::uint32_t length = 0;
  plist_to_bin(static_cast<plist_t>(root.get()), &buffer, &length);
  std::unique_ptr<char, void (*)(char*)> owned(buffer, plist_to_bin_free);
  if (!buffer) return Result<Bytes>::failure("could not write the binary property list");
  return Result<Bytes>::success(Bytes(buffer, buffer + length));
}

Result<std::string> encodeXml(const Value& value) {
  std::string error;
  PlistPtr root(fromValue(value, 0, error));
  if (!root) return Result<std::string>::failure(error);
  char* buffer = nullptr;
  std::uint32_t length = 0;
  plist_to_xml(static_cast<plist_t>(root.get()), &buffer, &length);
  std::unique_ptr<char, void (*)(char*)> owned(buffer, plist_to_xml_free);
  if (!buffer) return Result<std::string>::failure("could not write the XML property list");
  return Result<std::string>::success(std::string(buffer, length));
}

}  // namespace telvane::plist
