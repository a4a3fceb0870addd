// HTTPSPostBackend: the JSON post document and its readable copy.
//
// A post document carries the post time, the client identifier and the records, in
// the order they were made. Records arrive already written as JSON, so the document
// is their texts joined. The readable copy, made only when logging is allowed, is the
// same document pretty-printed; the message log records it.
#include <string_view>
#include <utility>

#include "backends/https/HTTPSPostBackend.h"
#include "platform/Json.h"

namespace telvane {

namespace {

constexpr const char* kPostTimeKey = "postTime";
constexpr const char* kClientIdKey = "clientId";
constexpr const char* kEventsKey = "events";

// Pretty-prints compact JSON text: four blanks per level, one member or element per
// line, a blank after each colon, empty containers kept as "{}" and "[]".
std::string prettyJson(std::string_view compact) {
  std::string out;
  out.reserve(compact.size() * 2);
  int depth = 0;
  auto newline = [&] {
    out.push_back('\n');
    out.append(static_cast<std::size_t>(depth) * 4, ' ');
  };
  bool inString = false;
  for (std::size_t i = 0; i < compact.size(); ++i) {
    char c = compact[i];
    if (inString) {
      out.push_back(c);
      if (c == '\\' && i + 1 < compact.size()) {
        out.push_back(compact[++i]);
      } else if (c == '"') {
        inString = false;
      }
      continue;
    }
    switch (c) {
      case '"':
        inString = true;
        out.push_back(c);
        break;
      case '{':
      case '[':
        out.push_back(c);
        if (i + 1 < compact.size() && (compact[i + 1] == '}' || compact[i + 1] == ']')) {
          out.push_back(compact[++i]);
        } else {
          ++depth;
          newline();
        }
        break;
      case '}':
      case ']':
        --depth;
        newline();
        out.push_back(c);
        break;
      case ',':
        out.push_back(c);
        newline();
        break;
      case ':':
        out.append(": ");
        break;
      default:
        out.push_back(c);
        break;
    }
  }
  return out;
}

}  // namespace

bool HTTPSPostBackend::mayLogReadableLocked() const {
  if (dnuType_ == 0 && dnuEnabled_) return true;
  if (!forceEventLogging_) return false;
  // Forced logging applies in the development and internal environments only.
  std::uint32_t environment = platform_.environmentType();
  return environment == 1 || environment == 2;
}

std::optional<std::string> HTTPSPostBackend::createMessageForPostAndLogging(const std::vector<Value>& records,
                                                                            std::optional<std::string>* readable) const {
  bool allowNested;
  {
    std::lock_guard<std::mutex> lock(settingsMutex_);
    allowNested = allowNestedData_;
  }
  std::vector<std::string> texts;
  texts.reserve(records.size());
  for (const Value& record : records) {
    static const Dictionary kEmpty;
    texts.push_back(recordText(record.isDictionary() ? *record.asDictionary() : kEmpty, allowNested));
  }
  return documentFromRecords(texts, readable);
}

std::optional<std::string> HTTPSPostBackend::documentFromRecords(const std::vector<std::string>& records,
                                                                 std::optional<std::string>* readable) const {
  Dictionary document;
  bool wantReadable;
  {
    std::lock_guard<std::mutex> lock(settingsMutex_);
    wantReadable = readable && mayLogReadableLocked();
    document.reserve(3);
    document.appendInOrder(kClientIdKey, Value(clientIdentifierLocked()));
    // The records stand in as one array; filters on the document's top-level keys can
    // remove it but cannot change it (it is no text).
    document.appendInOrder(kEventsKey, Value::array());
    document.appendInOrder(kPostTimeKey, Value(sanitizedTimeInterval(platform_.clock->now())));
    filterEventLocked(document);
  }

  std::size_t length = 64;
  for (const std::string& record : records) length += record.size() + 1;
  std::string json;
  json.reserve(length + 128);
  json::ObjectWriter writer(json);
  for (const auto& [key, value] : document) {
    if (key == kEventsKey) {
      std::string events;
      events.reserve(length);
      events.push_back('[');
      for (std::size_t i = 0; i < records.size(); ++i) {
        if (i > 0) events.push_back(',');
        events.append(records[i]);
      }
      events.push_back(']');
      writer.rawMember(key, events);
    } else if (!writer.member(key, value)) {
      return std::nullopt;
    }
  }
  writer.finish();
  if (wantReadable) *readable = prettyJson(json);
  return json;
}

}  // namespace telvane
