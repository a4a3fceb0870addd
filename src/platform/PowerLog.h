// PowerLog: the device's power and energy telemetry log, to which the power-log
// backend records "registered events" (an event category, an event name and a
// dictionary of values).
//
// On Linux the log is the journal: JournalPowerLog writes each event as ONE
// structured journal entry with these fields:
//   MESSAGE                      "power log event <name> (category <category>)"
//   PRIORITY                     6 (informational)
//   TELVANE_POWERLOG_CATEGORY    the category, in decimal
//   TELVANE_POWERLOG_EVENT       the event name
//   TELVANE_POWERLOG_DICTIONARY  the whole dictionary as one compact JSON object, so
//                                that nothing is lost to the field-name mapping below
//                                (members JSON cannot carry, such as NaN, are left
//                                out of this field only)
//   TELVANE_EVENT_<KEY>          one field per dictionary entry.
// Journal field names allow only A-Z, 0-9 and "_", and at most 64 characters: <KEY>
// is the entry's key with ASCII letters upper-cased and every other byte written as
// "_", cut so that the whole name stays within 64 characters. Different keys can thus
// map to one name ("a-b" and "A_B"); the journal keeps every value of a repeated
// field, and the JSON field tells them apart. A field's value is a string entry's
// text as it is, bytes in base64, and any other value as its JSON text (numbers,
// true/false, null, dates as seconds since 1970, nested containers as JSON); a value
// JSON cannot carry is written as its description.
//
// Find the entries with `journalctl TELVANE_POWERLOG_EVENT=<name> --output=json`. On a
// system without a running journal the journal's client library drops entries
// without an error, so events are then lost quietly, as a power log that is not
// there would lose them.
//
// Ownership: shared (std::shared_ptr); `journal()` hands out one process-wide
// instance. Threading: implementations are thread-safe; the journal's client library
// is safe to call from any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "telvane/Value.h"

namespace telvane {

class PowerLog {
 public:
  virtual ~PowerLog() = default;

  // Records one registered event. False when the log refused it (the power-log
  // backend does not look: it reports nothing).
  virtual bool recordRegisteredEvent(std::uint32_t category, const std::string& eventName,
                                     const Value& dictionary) = 0;

  // The journal-backed power log of the process.
  static std::shared_ptr<PowerLog> journal();
};

class JournalPowerLog : public PowerLog {
 public:
  static constexpr const char* kCategoryField = "TELVANE_POWERLOG_CATEGORY";
  static constexpr const char* kEventNameField = "TELVANE_POWERLOG_EVENT";
  static constexpr const char* kDictionaryField = "TELVANE_POWERLOG_DICTIONARY";
  static constexpr const char* kEntryFieldPrefix = "TELVANE_EVENT_";
  // The journal's limit on the length of a field name.
  static constexpr std::size_t kMaxFieldNameLength = 64;
  static constexpr int kPriorityInformational = 6;

  bool recordRegisteredEvent(std::uint32_t category, const std::string& eventName, const Value& dictionary) override;

  // The journal field name of a dictionary key (see above).
  static std::string fieldNameForKey(std::string_view key);
  // The "NAME=value" fields of the entry for this event, in the order listed above
  // (entries in the dictionary's key order).
  static std::vector<std::string> entryFields(std::uint32_t category, const std::string& eventName,
                                              const Value& dictionary);
};

}  // namespace telvane
