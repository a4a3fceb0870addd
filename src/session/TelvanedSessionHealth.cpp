// TelvanedSession: the health report of the end message and the aggregation of events
// towards the client (or an aggregating ancestor's client).
#include "platform/Log.h"
#include "session/SessionKeys.h"
#include "session/TelvanedSession.h"
#include "util/ComponentTags.h"

namespace telvane {

namespace {

constexpr const char* kSessionsCountKey = "SessionsCount";
constexpr const char* kBatchSizeKey = "BatchSize";
constexpr const char* kStorebagsCountKey = "StorebagsCount";
constexpr const char* kStorebagsSizeKey = "StorebagsSize";
constexpr const char* kCalculatedMemoryUsageKey = "CalculatedMemoryUsage";
constexpr const char* kProcessMemoryUsageKey = "ProcessMemoryUsage";

// Adds to a counter of the report read as a 32-bit integer (absent counts as 0).
void addToCounter(Dictionary& report, const std::string& key, std::uint64_t amount) {
  std::uint32_t current = report.get(key).unsignedIntValue();
  report.set(key, Value(static_cast<unsigned>(current + static_cast<std::uint32_t>(amount))));
}

}  // namespace

std::uint64_t TelvanedSession::addSessionHealthInfo(const TelvanedSession& session, Dictionary& healthReport) {
  std::string tag(healthComponentTag(session.sessionInfo()[keys::kSessionInfoComponentType].integerValue()));
  std::uint64_t batched = static_cast<std::uint64_t>(session.batchedEventsSize());
  addToCounter(healthReport, fmt::sprintf("%s_%s", kSessionsCountKey, tag), 1);
  addToCounter(healthReport, fmt::sprintf("%s_%s", kBatchSizeKey, tag), batched);
  return batched;
}

void TelvanedSession::addSessionsAccumulatedHealthInfoToPayload(
    Dictionary& payload, const std::vector<std::shared_ptr<TelvanedSession>>& sessionList,
    const Value& storebags) const {
  std::uint64_t listSize = 0;
  for (const auto& session : sessionList) {
    if (session) listSize += addSessionHealthInfo(*session, payload);
  }
  // The reporting session counts too, even when the list holds it already.
  std::uint64_t ownSize = addSessionHealthInfo(*this, payload);
  std::uint64_t storebagsCount = 0;
  if (const Dictionary* map = storebags.asDictionary()) {
    storebagsCount = map->size();
  } else if (const Array* list = storebags.asArray()) {
    storebagsCount = list->size();
  }
  std::uint64_t storebagsSize =
      storebags.isNull() ? 0 : static_cast<std::uint64_t>(static_cast<std::uint32_t>(storebags.sizeEstimate()));
  payload.set(kStorebagsCountKey, Value(static_cast<unsigned long long>(storebagsCount)));
  payload.set(kStorebagsSizeKey, Value(static_cast<unsigned long long>(storebagsSize)));
  payload.set(kCalculatedMemoryUsageKey, Value(static_cast<unsigned long long>(listSize + ownSize + storebagsSize)));
  payload.set(kProcessMemoryUsageKey, Value(static_cast<unsigned long long>(environment_.taskMemoryBytes())));
}

void TelvanedSession::aggregateMessage(const Value& message, double timestamp, std::uint16_t category,
                                       std::uint16_t type, const Value& payload) {
  Value merged;
  if (payload.isDictionary()) {
    merged = payload.copy();
    Value user = userInfo();
    if (const Dictionary* entries = user.asDictionary()) {
      // User-info values win on equal keys.
      for (const auto& [key, value] : *entries) merged.asDictionary()->set(key, value);
    }
  }
  auto agent = delegate();
  if (!agent) return;
  std::unique_lock<std::recursive_mutex> lock(agent->agentLock());
  auto ancestor = agent->getAncestorWithAggregatorForSession(shared_from_this());
  if (!ancestor) {
    lock.unlock();
    if (hasAggregator()) sendToAggregator(message, timestamp, category, type, merged);
    return;
  }
  // Under the lock, so that the ancestor cannot end meanwhile.
  ancestor->sendToAggregator(message, timestamp, category, type, merged);
}

void TelvanedSession::sendToAggregator(const Value& message, double timestamp, std::uint16_t category,
                                       std::uint16_t type, const Value& payload) {
  std::shared_ptr<IpcConnection> connection;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    connection = connection_;
  }
  if (!connection || !connection->isValid()) {
    log::error("sendMessageWithDictionary: Failed to get remote object proxy: %s",
               "the connection to the client has been invalidated");
    return;
  }
  Array arguments;
  arguments.reserve(5);
  arguments.push_back(message.isDictionary() ? message : Value());
  arguments.emplace_back(timestamp);
  arguments.emplace_back(static_cast<unsigned>(category));
  arguments.emplace_back(static_cast<unsigned>(type));
  arguments.push_back(payload.isDictionary() ? payload : Value());
  // A call without reply: nothing is awaited.
  connection->call(ipc::Operation::SendMessageToClient, std::move(arguments));
}

void TelvanedSession::shutdownSessionAggregation() {
  log::info("shutdownSessionAggregation: Disable aggregation module for session %u", sessionID());
  bool hadAggregator;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    hadAggregator = hasAggregator_;
    hasAggregator_ = false;
  }
  // An empty message tells the client that aggregation has ended.
  if (hadAggregator) sendToAggregator(Value(), 0.0, 0, 0, Value());
}

}  // namespace telvane
