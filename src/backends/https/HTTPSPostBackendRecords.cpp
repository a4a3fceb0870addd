// HTTPSPostBackend: event records.
//
// A record starts as a copy of the client's payload and receives the session's
// identity under keys that begin with an underscore; the user information and the
// event's shared data are merged over it. Values JSON cannot carry are dropped key by
// key with an error line; the record itself is kept.
//
// On the send path a record is never assembled as a map: its sources (payload, own
// entries, user information, shared data) are all sorted by key, so one merge walks
// them in key order and writes each winning entry straight into the record's JSON.
// Batches keep these texts (HTTPSPostBackendDocument.cpp joins them into posts).
#include <algorithm>
#include <array>
#include <cmath>
#include <memory>
#include <string_view>
#include <utility>

#include "backends/https/HTTPSPostBackend.h"
#include "platform/Json.h"
#include "platform/Log.h"
#include "util/ComponentTags.h"

namespace telvane {

namespace {

constexpr std::string_view kStartTSKey = "_startTS";
constexpr std::string_view kSenderKey = "_sender";
constexpr std::string_view kClientVersionKey = "_clientVersion";
constexpr std::string_view kSessionIDKey = "_sessionID";
constexpr std::string_view kEventNumberKey = "_eventNumber";
constexpr std::string_view kMethodKey = "_method";
constexpr std::string_view kStatusKey = "_status";
constexpr std::string_view kClientTSKey = "_clientTS";
constexpr std::string_view kEventTimeKey = "eventTime";
constexpr std::string_view kProductFamilyKey = "_productFamily";
constexpr std::string_view kProductModelKey = "_productModel";
constexpr std::string_view kOSVersionKey = "_osVersion";
constexpr std::string_view kBuildKey = "_build";
constexpr std::string_view kInternalKey = "_internal";
constexpr std::string_view kReportVersKey = "_reportVers";
constexpr std::string_view kTimezoneOffsetKey = "_timezoneOffset";
constexpr const char* kBytesSentSinceLastReportKey = "_bytesSentSinceLastReport";
// The keys a record receives besides the payload's.
constexpr std::size_t kRecordKeyCount = 16;


// Component types whose internal sessions are identified by number.
bool identifiedByNumber(std::int32_t compType) { return compType == 7 || compType == 11 || compType == 13; }

// "<major>.<middle>", then ".<minor>" unless the minor part is 0.
std::string versionText(std::uint8_t major, std::uint8_t middle, std::uint8_t minor) {
  std::string text = std::to_string(major) + "." + std::to_string(middle);
  if (minor != 0) text += "." + std::to_string(minor);
  return text;
}

void logUnwritable(const std::string& key, const Value& value) {
  log::error("HTTPSPostBackend(createMessageForPostAndLogging): JSON serializer unable to handle key: %s, value: %s",
             key, value.description());
}

// Writes one record entry as JSON may carry it: numbers and text as they are, dates
// as seconds since 1970 (-1.0 when not finite), arrays and maps only when nested data
// is allowed. Anything else, and anything the writer refuses (text that is not UTF-8,
// non-finite numbers inside nested data), is dropped with an error line.
void writeRecordEntry(json::ObjectWriter& writer, const std::string& key, const Value& value,
                      bool allowNestedData) {
  bool writable;
  switch (value.type()) {
    case Value::Type::Integer:
    case Value::Type::Unsigned:
    case Value::Type::Boolean:
    case Value::Type::String:
      writable = true;
      break;
    case Value::Type::Double:
      writable = std::isfinite(value.doubleValue());
      break;
    case Value::Type::Date:
      if (writer.member(key, Value(sanitizedTimeInterval(value.asDate()->secondsSince1970)))) return;
      writable = false;
      break;
    case Value::Type::Array:
    case Value::Type::Dictionary:
      writable = allowNestedData;
      break;
    default:
      writable = false;
      break;
  }
  if (writable && writer.member(key, value)) return;
  logUnwritable(key, value);
}

// Three-way comparison of two keys, byte by byte. Keys are short, and most differ
// early, so this beats a library call per comparison.
int compareKeys(const std::string& a, const std::string& b) {
  const std::size_t n = std::min(a.size(), b.size());
  for (std::size_t i = 0; i < n; ++i) {
    const auto x = static_cast<unsigned char>(a[i]);
    const auto y = static_cast<unsigned char>(b[i]);
    if (x != y) return x < y ? -1 : 1;
  }
  return a.size() < b.size() ? -1 : (a.size() > b.size() ? 1 : 0);
}

// The entries of one source of a record, in key order.
struct EntryRange {
  const Dictionary::Entry* next;
  const Dictionary::Entry* end;
};

EntryRange rangeOf(const Dictionary& dictionary) {
  return EntryRange{std::to_address(dictionary.begin()), std::to_address(dictionary.end())};
}

// Walks the sources in key order and calls visit(entry, holders) once per key with
// the entry of the last source that holds it; bit i of holders is set when source i
// holds the key.
template <std::size_t N, typename Visit>
void forEachMergedEntry(EntryRange (&ranges)[N], Visit&& visit) {
  static_assert(N < 32);
  for (;;) {
    int smallest = -1;
    std::uint32_t holders = 0;
    for (std::size_t i = 0; i < N; ++i) {
      if (ranges[i].next == ranges[i].end) continue;
      int order = smallest < 0 ? -1 : compareKeys(ranges[i].next->first, ranges[smallest].next->first);
      if (order < 0) {
        smallest = static_cast<int>(i);
        holders = 1u << i;
      } else if (order == 0) {
        holders |= 1u << i;
      }
    }
    if (smallest < 0) return;
    const Dictionary::Entry* winner = nullptr;
    for (std::size_t i = 0; i < N; ++i) {
      if (holders & (1u << i)) winner = ranges[i].next++;
    }
    visit(*winner, holders);
  }
}

const Dictionary& emptyDictionary() {
  static const Dictionary kEmpty;
  return kEmpty;
}

}  // namespace

struct HTTPSPostBackend::OwnEntries {
  // What the entries that depend on the settings only were made from.
  bool made = false;
  std::optional<std::string> buildVersion;
  std::optional<std::string> productVersion;
  std::optional<std::string> productFamily;
  std::optional<std::string> hardwareType;
  std::optional<std::string> combinedSessionID;
  std::int32_t compType = 0;
  std::uint16_t clientVersion = 0;
  std::uint32_t sessionID = 0;
  bool isInternal = false;
  std::uint8_t major = 0, middle = 0, minor = 0;
  double startTimeStamp = 0;
  long timeZoneOffset = 0;

  // The entries in key order, and for those made from the settings their value as
  // JSON (empty when it cannot be written, or for the entries of each event).
  std::array<Dictionary::Entry, kRecordKeyCount> entries;
  std::array<std::string, kRecordKeyCount> written;
  std::size_t count = 0;
  // Where the entries of each event are.
  std::size_t clientTS = 0, eventNumber = 0, method = 0, status = 0, eventTime = 0;

  std::size_t add(std::string_view key, Value value, bool fromSettings) {
    entries[count].first.assign(key.data(), key.size());
    entries[count].second = std::move(value);
    written[count].clear();
    if (fromSettings && !json::writeTo(written[count], entries[count].second)) written[count].clear();
    return count++;
  }
  EntryRange range() const { return EntryRange{entries.data(), entries.data() + count}; }
  // The value of this entry as JSON, when it was written already.
  const std::string* writtenValue(const Dictionary::Entry& entry) const {
    if (&entry < entries.data() || &entry >= entries.data() + count) return nullptr;
    const std::string& text = written[static_cast<std::size_t>(&entry - entries.data())];
    return text.empty() ? nullptr : &text;
  }
};

const HTTPSPostBackend::OwnEntries& HTTPSPostBackend::ownEntriesLocked(TimeValue timestamp, std::uint16_t method,
                                                                       std::uint16_t respCode, std::uint16_t eventID,
                                                                       long timeZoneOffset) const {
  if (!ownEntries_) ownEntries_ = std::make_shared<OwnEntries>();
  OwnEntries& own = *ownEntries_;
  const bool same = own.made && own.buildVersion == buildVersion_ && own.productVersion == productVersion_ &&
                    own.productFamily == productFamily_ && own.hardwareType == hardwareType_ &&
                    own.combinedSessionID == combinedSessionIDString_ && own.compType == compType_ &&
                    own.clientVersion == clientVersion_ && own.sessionID == sessionID_ &&
                    own.isInternal == isInternal_ && own.major == selfVersionMajor_ &&
                    own.middle == selfVersionMiddle_ && own.minor == selfVersionMinor_ &&
                    own.startTimeStamp == startTimeStamp_ && own.timeZoneOffset == timeZoneOffset;
  const std::int64_t startTS = coarsenTimestamp(static_cast<std::int64_t>(startTimeStamp_), internalRelease_);
  if (!same) {
    own.made = true;
    own.buildVersion = buildVersion_;
    own.productVersion = productVersion_;
    own.productFamily = productFamily_;
    own.hardwareType = hardwareType_;
    own.combinedSessionID = combinedSessionIDString_;
    own.compType = compType_;
    own.clientVersion = clientVersion_;
    own.sessionID = sessionID_;
    own.isInternal = isInternal_;
    own.major = selfVersionMajor_;
    own.middle = selfVersionMiddle_;
    own.minor = selfVersionMinor_;
    own.startTimeStamp = startTimeStamp_;
    own.timeZoneOffset = timeZoneOffset;

    // Component types come checked from the session; anything else is named as
    // unknown.
    std::optional<std::string_view> tag = componentTag(compType_);
    own.count = 0;
    // In key order.
    if (buildVersion_) own.add(kBuildKey, Value(*buildVersion_), true);
    own.clientTS = own.add(kClientTSKey, Value(), false);
    own.add(kClientVersionKey, Value(static_cast<unsigned>(clientVersion_)), true);
    own.eventNumber = own.add(kEventNumberKey, Value(), false);
    own.add(kInternalKey, Value(static_cast<unsigned>(internalRelease_ ? 3 : 2)), true);
    own.method = own.add(kMethodKey, Value(), false);
    if (productVersion_) own.add(kOSVersionKey, Value(*productVersion_), true);
    if (productFamily_) own.add(kProductFamilyKey, Value(*productFamily_), true);
    if (hardwareType_) own.add(kProductModelKey, Value(*hardwareType_), true);
    own.add(kReportVersKey, Value(versionText(selfVersionMajor_, selfVersionMiddle_, selfVersionMinor_)), true);
    own.add(kSenderKey, Value(tag ? *tag : std::string_view(kUnknownComponentTag)), true);
    // The combined identifier, replaced by the number for internal sessions of some
    // types.
    if (isInternal_ && identifiedByNumber(compType_)) {
      own.add(kSessionIDKey, Value(sessionID_), true);
    } else if (combinedSessionIDString_) {
      own.add(kSessionIDKey, Value(*combinedSessionIDString_), true);
    }
    own.add(kStartTSKey, Value(static_cast<long long>(startTS)), true);
    own.status = own.add(kStatusKey, Value(), false);
    own.add(kTimezoneOffsetKey, Value(static_cast<long long>(timeZoneOffset)), true);
    own.eventTime = own.add(kEventTimeKey, Value(), false);
  }
  const double clientTS =
      sanitizedTimeInterval(timestamp.toSeconds() - startTimeStamp_ + static_cast<double>(startTS));
  own.entries[own.clientTS].second = Value(clientTS);
  own.entries[own.eventTime].second = Value(clientTS);
  own.entries[own.eventNumber].second = Value(static_cast<unsigned>(eventID));
  own.entries[own.method].second = Value(static_cast<unsigned>(method));
  own.entries[own.status].second = Value(static_cast<unsigned>(respCode));
  return own;
}

Value HTTPSPostBackend::newEventDictfromPayload(const Dictionary& payload, TimeValue timestamp, std::uint16_t method,
                                                std::uint16_t respCode, std::uint16_t eventID) const {
  long timeZoneOffset = platform_.timeZoneOffsetSeconds();
  std::lock_guard<std::mutex> lock(settingsMutex_);
  const OwnEntries& own = ownEntriesLocked(timestamp, method, respCode, eventID, timeZoneOffset);
  // The record's own keys replace the payload's of the same name.
  Dictionary record;
  record.reserve(payload.size() + own.count);
  EntryRange ranges[] = {rangeOf(payload), own.range()};
  forEachMergedEntry(ranges, [&](const Dictionary::Entry& entry, std::uint32_t) {
    record.appendInOrder(entry.first, entry.second);
  });
  return Value(std::move(record));
}

void HTTPSPostBackend::prepareEventForMessage(Dictionary& record, const Value& frameworkData) const {
  {
    std::lock_guard<std::mutex> lock(settingsMutex_);
    if (const Dictionary* userInfo = userInfoDict_.asDictionary()) {
      for (const auto& [key, value] : *userInfo) record.set(key, value);
    }
  }
  // Shared data wins over the user information.
  if (const Dictionary* shared = frameworkData.asDictionary()) {
    for (const auto& [key, value] : *shared) record.set(key, value);
  }
}

HTTPSPostBackend::BatchedRecord HTTPSPostBackend::recordForEvent(const Dictionary& payload, TimeValue timestamp,
                                                                 std::uint16_t method, std::uint16_t respCode,
                                                                 std::uint16_t eventID, const Value& frameworkData,
                                                                 const Value& bytesSentSinceLastReport,
                                                                 SendSettings& settings) const {
  long timeZoneOffset = platform_.timeZoneOffsetSeconds();
  const Dictionary& shared = frameworkData.isDictionary() ? *frameworkData.asDictionary() : emptyDictionary();
  Dictionary extra;
  if (!bytesSentSinceLastReport.isNull()) extra.set(kBytesSentSinceLastReportKey, bytesSentSinceLastReport);

  BatchedRecord record;
  record.method = method;
  std::lock_guard<std::mutex> lock(settingsMutex_);
  settings.batchEvents = batchEvents_;
  settings.requireUserInfo = requireUserInfo_;
  settings.hasUserInfo = hasUserInfoLocked();
  const OwnEntries& own = ownEntriesLocked(timestamp, method, respCode, eventID, timeZoneOffset);
  const Dictionary& userInfo = userInfoDict_.isDictionary() ? *userInfoDict_.asDictionary() : emptyDictionary();
  if (userInfoDict_.isDictionary()) record.userInfo = userInfoDict_;

  // Later sources win: the record's own keys over the payload's, the user
  // information over both, the shared data over that, a byte count over everything.
  constexpr std::uint32_t kUserInfoSource = 1u << 2;
  constexpr std::uint32_t kLaterSources = ~((kUserInfoSource << 1) - 1);
  EntryRange ranges[] = {rangeOf(payload), own.range(), rangeOf(userInfo), rangeOf(shared), rangeOf(extra)};
  json::ObjectWriter writer(record.json);
  forEachMergedEntry(ranges, [&](const Dictionary::Entry& entry, std::uint32_t holders) {
    if ((holders & kUserInfoSource) && (holders & kLaterSources)) record.userInfoOverridden = true;
    if (const std::string* written = own.writtenValue(entry)) {
      writer.rawMember(entry.first, *written);
    } else {
      writeRecordEntry(writer, entry.first, entry.second, allowNestedData_);
    }
  });
  writer.finish();
  return record;
}

std::string HTTPSPostBackend::recordText(const Dictionary& record, bool allowNestedData) {
  std::string json;
  json.reserve(1024);
  json::ObjectWriter writer(json);
  for (const auto& [key, value] : record) writeRecordEntry(writer, key, value, allowNestedData);
  writer.finish();
  return json;
}

std::string HTTPSPostBackend::rewriteRecord(const std::string& json, const Dictionary& entries,
                                            bool allowNestedData) {
  Result<Value> parsed = json::parse(json);
  Dictionary* record = parsed ? parsed.value().asDictionary() : nullptr;
  if (!record) return json;  // not written by us; left as it is
  for (const auto& [key, value] : entries) record->set(key, value);
  return recordText(*record, allowNestedData);
}

}  // namespace telvane
