// HTTPSPostBackend: what happens to each event (dropped, posted at once or batched),
// when the batch goes out, and the readable text of what went out.
//
// Events of a pending (0) or deferred (3) backend are kept until the state allows a
// flush; a realtime event never overtakes batched ones, because a batch that exists
// when it arrives is flushed first. The batch counts its events per method; a method
// whose count has passed the threshold flushes the whole batch (all methods) and the
// event at hand opens the next one.
#include <string_view>
#include <utility>

#include "backends/https/HTTPSPostBackend.h"
#include "platform/Json.h"
#include "platform/Log.h"

namespace telvane {

namespace {

constexpr const char* kClientDataKey = "ClientData";
constexpr const char* kSharedDataKey = "SharedData";
constexpr const char* kMethodKey = "_method";
constexpr std::string_view kSessionIDKey = "_sessionID";
// Keys added to the session's stop message.
constexpr const char* kOptKey = "Opt";
constexpr const char* kSamplingThresholdKey = "SamplingThreshold";
constexpr const char* kOverrideSamplingKey = "OverrideSampling";
constexpr const char* kBatchKey = "Batch";
constexpr const char* kTotalBytesSentKey = "_totalBytesSent";

constexpr const char* kNothingToFlush = "Nothing to flush";
constexpr const char* kUserInfoRequired = "Can not flush: userInfo is required";
constexpr const char* kCompletelyFilteredOut = "Nothing to flush: batched events were completely filtered out";

// The session's stop message: method 0, response code 1.
bool isSessionStopMessage(std::uint16_t method, std::uint16_t respCode) { return method == 0 && respCode == 1; }

bool isRealtimeFlag(std::uint32_t flag) {
  return flag == kMessageFlagRealtime || flag == kMessageFlagRealtimeAndPromote;
}

bool isPromoteFlag(std::uint32_t flag) {
  return flag == kMessageFlagPromote || flag == kMessageFlagRealtimeAndPromote;
}

// The record already holds every one of the entries: it was made with a user
// information map that has them with these values, and no shared data replaced any.
template <typename Record>
bool carriesEntries(const Record& record, const Dictionary& entries) {
  if (record.userInfoOverridden) return false;
  const Dictionary* merged = record.userInfo.asDictionary();
  if (!merged) return false;
  for (const auto& [key, value] : entries) {
    const Value* present = merged->find(key);
    if (!present || *present != value) return false;
  }
  return true;
}

}  // namespace

std::optional<std::string> HTTPSPostBackend::sendMessage(const Value& message, TimeValue timestamp,
                                                         std::uint16_t method, std::uint16_t respCode,
                                                         std::uint16_t eventID, std::uint32_t flag) {
  const std::int32_t state = this->state();
  if (state == kBackendStateDisabled) return std::nullopt;

  // The payload is the client's data when the session wrapped it, else the message
  // itself (a one-shot send hands the payload over as it is).
  static const Dictionary kEmptyPayload;
  const Dictionary* payload = &kEmptyPayload;
  const Value& clientData = message[kClientDataKey];
  const Value& source = clientData.isNull() ? message : clientData;
  if (source.isNull()) {
    log::error("HTTPSPostBackend(sendMessage): SESSION_TYPE_STOP message dictionary is nil");
  } else if (const Dictionary* fields = source.asDictionary()) {
    payload = fields;
  }

  Dictionary stopPayload;
  if (isSessionStopMessage(method, respCode)) {
    log::info(
        "HTTPSPostBackend(sendMessage): Adding dnu type and sampling threshold to SESSION_TYPE_STOP message "
        "dictionary");
    stopPayload = *payload;
    std::lock_guard<std::mutex> lock(settingsMutex_);
    stopPayload.set(kOptKey, Value(dnuType_));
    stopPayload.set(kSamplingThresholdKey, samplingThreshold_ ? Value(*samplingThreshold_) : Value(-1));
    stopPayload.set(kOverrideSamplingKey, overrideSampling_ ? Value(*overrideSampling_) : Value(-1));
    stopPayload.set(kBatchKey, Value(batchEvents_ ? 1 : 0));
    stopPayload.set(kTotalBytesSentKey, Value(takeTotalBytesSent()));
    payload = &stopPayload;
  }

  const bool realtime = isRealtimeFlag(flag);
  // The promoting event itself is still handled as deferred (batched); only later
  // events see the enabled state.
  if (isPromoteFlag(flag) && state == kBackendStateDeferred) setState(kBackendStateEnabled);
  log::info("HTTPSPostBackend(sendMessage): realtime is %d", realtime ? 1 : 0);
  Value bytesSentSinceLastReport;
  if (flag == kMessageFlagHealthReport && internalRelease_) bytesSentSinceLastReport = Value(takeBytesSentSinceLastReport());

  // The record, with the user information and the event's shared data merged in.
  SendSettings settings;
  BatchedRecord record = recordForEvent(*payload, timestamp, method, respCode, eventID, message[kSharedDataKey],
                                        bytesSentSinceLastReport, settings);

  if (state == kBackendStateEnabled && (realtime || !settings.batchEvents) &&
      (!settings.requireUserInfo || settings.hasUserInfo)) {
    std::optional<std::string> flushed;
    bool forcedFlush = false;
    if (realtime) {
      bool hasBatch = false;
      stateQueue_->sync([&] { hasBatch = !batch_.batchedEvents.empty(); });
      if (hasBatch) {
        log::info(
            "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. Forcing "
            "Flush here to keep events in order.");
        flushed = flushMessages(nullptr);
        forcedFlush = true;
      }
    }
    log::info("HTTPSPostBackend(sendMessage): Sending %d, %d, %d", state, settings.batchEvents ? 1 : 0,
              settings.requireUserInfo ? 1 : 0);
    std::optional<std::string> readable;
    std::vector<std::string> records;
    records.push_back(std::move(record.json));
    std::optional<std::string> json = documentFromRecords(records, &readable);
    if (!json) return std::nullopt;
    std::optional<std::string> result = readable;
    if (forcedFlush && flushed) {
      result = fmt::sprintf("Flushed events:\n%s\nStandalone event:\n%s", *flushed, readable.value_or("(null)"));
    }
    postJSONMessage(*json, flag, method, respCode, nullptr);
    if (flushed) {
      std::lock_guard<std::mutex> lock(settingsMutex_);
      immutable_ = true;
    }
    return result;
  }

  log::info("HTTPSPostBackend(sendMessage): Batching %d, %d, %d", state, settings.batchEvents ? 1 : 0,
            settings.requireUserInfo ? 1 : 0);
  return batchRecord(std::move(record));
}

std::optional<std::string> HTTPSPostBackend::batchEvent(const Value& record) {
  BatchedRecord batched;
  batched.method = record[kMethodKey].unsignedShortValue();
  static const Dictionary kEmpty;
  batched.json = recordText(record.isDictionary() ? *record.asDictionary() : kEmpty, allowNestedData());
  return batchRecord(std::move(batched));
}

std::optional<std::string> HTTPSPostBackend::batchRecord(BatchedRecord record) {
  const std::uint16_t method = record.method;
  const std::int32_t threshold = eventThreshold();
  bool flushNeeded = false;
  // Counting and, unless a flush must come first, appending happen in one step on
  // the state queue.
  stateQueue_->sync([&] {
    auto found = batch_.eventMethodCounts.find(method);
    std::int32_t count = found == batch_.eventMethodCounts.end() ? 0 : found->second;
    // Deliberately one past the threshold: with 49, the 51st event of a method
    // flushes the 50 before it and opens the next batch.
    flushNeeded = threshold < count;
    batch_.eventMethodCounts[method] = flushNeeded ? 1 : count + 1;
    if (!flushNeeded) batch_.batchedEvents.push_back(std::move(record));
  });
  if (!flushNeeded) return std::nullopt;

  log::info(
      "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method %d",
      method);
  std::optional<std::string> flushed = flushMessages(nullptr);
  stateQueue_->sync([&] { batch_.batchedEvents.push_back(std::move(record)); });
  return flushed;
}

void HTTPSPostBackend::flushMessagesWithCompletion(FlushCompletion completion) {
  flushMessages(std::move(completion));
}

std::optional<std::string> HTTPSPostBackend::flushMessages(FlushCompletion completion) {
  FlushPlan plan;
  stateQueue_->sync([&] { plan = flushOnQueue(); });
  if (plan.error) {
    if (completion) completion(std::nullopt, std::move(plan.error));
    return std::nullopt;
  }
  FlushCompletion posted;
  if (completion) {
    posted = [readable = plan.readable, completion = std::move(completion)](std::optional<std::string> /*result*/,
                                                                          std::optional<TelvaneError> error) {
      completion(readable, std::move(error));
    };
  }
  postJSONMessage(*plan.json, kMessageFlagOrdinary, std::nullopt, std::nullopt, std::move(posted));
  return plan.readable;
}

HTTPSPostBackend::FlushPlan HTTPSPostBackend::flushOnQueue() {
  assertOnQueue(stateQueue_);
  FlushPlan plan;
  std::vector<BatchedRecord>& events = batch_.batchedEvents;
  if (events.empty()) {
    plan.error = makeTelvaneError(-1, kNothingToFlush);
    return plan;
  }
  if (stateOnQueue() != kBackendStateEnabled) {
    // Not enabled: the batch is lost.
    events.clear();
    plan.error = makeTelvaneError(-1, kNothingToFlush);
    return plan;
  }
  Value userInfo;
  bool requireUserInfo;
  bool allowNested;
  {
    std::lock_guard<std::mutex> lock(settingsMutex_);
    requireUserInfo = requireUserInfo_;
    userInfo = userInfoDict_;
    allowNested = allowNestedData_;
  }
  if (requireUserInfo && !userInfo.isDictionary()) {
    // The batch is kept for a flush after the user information has arrived.
    plan.error = makeTelvaneError(-1, kUserInfoRequired);
    return plan;
  }

  log::info("HTTPSPostBackend(flushMessagesWithCompletion): called");
  Dictionary filteredUserInfo;
  if (const Dictionary* fields = userInfo.asDictionary()) filteredUserInfo = *fields;
  filterEvent(filteredUserInfo);

  std::vector<std::string> kept;
  kept.reserve(events.size());
  {
    std::lock_guard<std::mutex> lock(settingsMutex_);
    for (BatchedRecord& record : events) {
      if (!isWhitelistedEventLocked(record.method)) {
        log::info(
            "flushMessagesWithCompletion: Dropping event with category %d as it is not whitelisted for backend %s",
            record.method, name_);
        continue;
      }
      if (isBlacklistedEventLocked(record.method)) {
        log::info("flushMessagesWithCompletion: Dropping event with category %d as it is blacklisted for backend %s",
                  record.method, name_);
        continue;
      }
      // The filtered user information goes over every record. Most records already
      // carry exactly these values (merged when they arrived); only the others are
      // read back and written again.
      if (!filteredUserInfo.empty() && !carriesEntries(record, filteredUserInfo)) {
        record.json = rewriteRecord(record.json, filteredUserInfo, allowNested);
      }
      kept.push_back(std::move(record.json));
    }
  }
  events.clear();
  batch_.eventMethodCounts.clear();

  if (!kept.empty()) plan.json = documentFromRecords(kept, &plan.readable);
  if (!plan.json) {
    plan.readable.reset();
    plan.error = makeTelvaneError(-1, kCompletelyFilteredOut);
    return plan;
  }
  // The readable text exists only when logging is allowed, so a backend without
  // consent to log never freezes.
  if (plan.readable) {
    std::lock_guard<std::mutex> lock(settingsMutex_);
    immutable_ = true;
  }
  return plan;
}

void HTTPSPostBackend::setCorrelatedSessionID(const std::string& identifier) {
  TelvaneBackendBase::setCorrelatedSessionID(identifier);
  const bool allowNested = allowNestedData();
  Dictionary entries{{std::string(kSessionIDKey), Value(identifier)}};
  stateQueue_->sync([&] {
    for (BatchedRecord& record : batch_.batchedEvents) record.json = rewriteRecord(record.json, entries, allowNested);
  });
}

std::int64_t HTTPSPostBackend::batchedEventsSize() const {
  // Batched records are kept as JSON text: their estimate is that of the text.
  std::int64_t size = 0;
  stateQueue_->sync([&] {
    for (const BatchedRecord& record : batch_.batchedEvents) size += Value(record.json).allocationSize();
  });
  return size;
}

std::vector<Value> HTTPSPostBackend::batchedEvents() const {
  std::vector<Value> records;
  stateQueue_->sync([&] {
    records.reserve(batch_.batchedEvents.size());
    for (const BatchedRecord& record : batch_.batchedEvents) {
      Result<Value> parsed = json::parse(record.json);
      records.push_back(parsed ? parsed.value() : Value());
    }
  });
  return records;
}

std::map<std::uint16_t, std::int32_t> HTTPSPostBackend::eventMethodCounts() const {
  std::map<std::uint16_t, std::int32_t> counts;
  stateQueue_->sync([&] { counts = batch_.eventMethodCounts; });
  return counts;
}

}  // namespace telvane
