#include "platform/PowerLog.h"

#include <sys/uio.h>
#include <systemd/sd-journal.h>

#include "platform/Crypto.h"
#include "platform/Json.h"

namespace telvane {

namespace {

// The text a journal field carries for one dictionary value.
std::string fieldValueText(const Value& value) {
  if (const std::string* text = value.asString()) return *text;
  if (const Bytes* bytes = value.asBytes()) return crypto::base64Encode(*bytes);
  Result<std::string> json = json::write(value);
  return json.ok() ? json.value() : value.description();
}

// The dictionary as one JSON object; members JSON cannot carry are left out.
std::string dictionaryJson(const Dictionary* dictionary) {
  std::string out;
  json::ObjectWriter writer(out);
  if (dictionary) {
    for (const auto& [key, value] : *dictionary) writer.member(key, value);
  }
  writer.finish();
  return out;
}

}  // namespace

std::shared_ptr<PowerLog> PowerLog::journal() {
  static const std::shared_ptr<PowerLog> instance = std::make_shared<JournalPowerLog>();
  return instance;
}

std::string JournalPowerLog::fieldNameForKey(std::string_view key) {
  std::string name = kEntryFieldPrefix;
  for (char c : key) {
    if (name.size() >= kMaxFieldNameLength) break;
    if (c >= 'a' && c <= 'z') {
      name += static_cast<char>(c - 'a' + 'A');
    } else if ((c >= 'A' && c <= 'Z') || (c >= '0' && c <= '9')) {
      name += c;
    } else {
      name += '_';
    }
  }
  return name;
}

std::vector<std::string> JournalPowerLog::entryFields(std::uint32_t category, const std::string& eventName,
                                                      const Value& dictionary) {
  const Dictionary* entries = dictionary.asDictionary();
  std::vector<std::string> fields;
  fields.reserve(5 + (entries ? entries->size() : 0));
  fields.push_back("MESSAGE=power log event " + eventName + " (category " + std::to_string(category) + ")");
  fields.push_back("PRIORITY=" + std::to_string(kPriorityInformational));
  fields.push_back(std::string(kCategoryField) + "=" + std::to_string(category));
  fields.push_back(std::string(kEventNameField) + "=" + eventName);
  fields.push_back(std::string(kDictionaryField) + "=" + dictionaryJson(entries));
  if (entries) {
    for (const auto& [key, value] : *entries) fields.push_back(fieldNameForKey(key) + "=" + fieldValueText(value));
  }
  return fields;
}

bool JournalPowerLog::recordRegisteredEvent(std::uint32_t category, const std::string& eventName,
                                            const Value& dictionary) {
  std::vector<std::string> fields = entryFields(category, eventName, dictionary);
  std::vector<iovec> vector;
  vector.reserve(fields.size());
  for (std::string& field : fields) vector.push_back(iovec{field.data(), field.size()});
  // Values may hold new lines or any bytes: the vector form sends them as they are.
  return ::sd_journal_sendv(vector.data(), static_cast<int>(vector.size())) >= 0;
}

}  // namespace telvane
