// TelvanedSession: the path of one event to the backends, the session's own messages,
// flushing, the one-shot send and the uploads.
#include "platform/Log.h"
#include "session/SessionKeys.h"
#include "session/TelvanedSession.h"
#include "util/PersistentIdentifiers.h"

namespace telvane {

namespace {

constexpr const char* kSecondHTTPSPostBackendName = "brindle";
constexpr const char* kDashboardBackendName = "dashboard";

bool containsSplunk(const std::string& name) { return name.find("splunk") != std::string::npos; }

// The flush completions of all sessions count down under this one lock.
std::mutex& flushCompletionLock() {
  static std::mutex* lock = new std::mutex();  // lives for the process
  return *lock;
}

// What the flush completions of one flush share: how many backends are still to
// answer and the client's reply, called once.
struct FlushCountdown {
  int remaining = 0;
  TelvanedSession::FlushReply reply;  // guarded by flushCompletionLock(); empty once called
};

int hexDigit(char c) {
  if (c >= '0' && c <= '9') return c - '0';
  if (c >= 'a' && c <= 'f') return c - 'a' + 10;
  if (c >= 'A' && c <= 'F') return c - 'A' + 10;
  return -1;
}

// The file-system path of a file URL ("file:///a/b%20c" gives "/a/b c"); any other
// text is taken as a path already.
std::string pathOfFileURL(const std::string& fileURL) {
  constexpr std::string_view kScheme = "file://";
  constexpr std::string_view kLocalHost = "localhost";
  if (fileURL.compare(0, kScheme.size(), kScheme) != 0) return fileURL;
  std::string rest = fileURL.substr(kScheme.size());
  if (rest.compare(0, kLocalHost.size(), kLocalHost) == 0) rest.erase(0, kLocalHost.size());
  std::string path;
  for (std::size_t i = 0; i < rest.size(); ++i) {
    if (rest[i] == '%') {
      int high = i + 1 < rest.size() ? hexDigit(rest[i + 1]) : -1;
      int low = i + 2 < rest.size() ? hexDigit(rest[i + 2]) : -1;
      if (high >= 0 && low >= 0) {
        path += static_cast<char>(high * 16 + low);
        i += 2;
        continue;
      }
    }
    path += rest[i];
  }
  return path;
}

}  // namespace

void TelvanedSession::sendMessageWithDictionary(const Value& message, TextReply reply) {
  assertOnQueue(queue_);
  log::info("sendMessageWithDictionary: Sending message for session %u", sessionID());
  auto result = sendMessageWithDictionary(message, nullptr);
  if (reply) reply(result);
}

std::optional<std::string> TelvanedSession::sendMessageWithDictionary(const Value& message, TelvaneError* /*error*/) {
  assertOnQueue(queue_);
  auto backends = this->backends();
  if (!backends) {
    log::info("sendMessageWithDictionary: No backends available to send message");
    return std::nullopt;
  }
  if (message[keys::kMessageParametersCategory].isNull()) {
    log::info("sendMessageWithDictionary: Missing mandatory parameter 'category'");
    return std::nullopt;
  }
  if (message[keys::kMessageParametersType].isNull()) {
    log::info("sendMessageWithDictionary: Missing mandatory parameter 'type'");
    return std::nullopt;
  }
  std::uint16_t category = message[keys::kMessageParametersCategory].unsignedShortValue();
  std::uint16_t type = message[keys::kMessageParametersType].unsignedShortValue();
  const Value& rawPayload = message[keys::kMessageParametersPayload];
  Value payload = rawPayload.isDictionary() ? rawPayload : Value();
  std::uint32_t flag = message[keys::kMessageParametersFlag].unsignedIntValue();

  TimeValue timestamp = now();
  // The aggregator sees every event that has its parameters, before any filter.
  aggregateMessage(sessionInfo(), timestamp.toSeconds(), category, type, payload);

  Dictionary blob;
  if (auto agent = delegate()) {
    std::lock_guard<std::recursive_mutex> lock(agent->agentLock());
    if (auto shared = agent->sharedDataForSession(shared_from_this())) {
      blob.set(keys::kMessageBlobSharedData, shared->copy());
    }
  }
  if (!payload.isNull()) blob.set(keys::kMessageBlobClientData, payload);
  Value event(std::move(blob));

  std::optional<std::string> chosen;
  for (const auto& [name, backend] : *backends) {
    if (!backend->isWhitelistedEvent(category)) {
      log::info("sendMessageWithDictionary: Dropping event with category %d as it is not whitelisted for backend %s",
                category, name);
      continue;
    }
    if (backend->isBlacklistedEvent(category)) {
      log::info("sendMessageWithDictionary: Dropping event with category %d as it is blacklisted for backend %s",
                category, name);
      continue;
    }
    auto result = backend->sendMessage(event, timestamp, category, type, flag);
    if (result) writeMessageLog(fmt::sprintf("[%s -> sendMessageWithDictionary] %s", name, *result));
    // The HTTPS post backends answer the client; the dashboard only when they did not.
    if (name == kSecondHTTPSPostBackendName || containsSplunk(name)) {
      if (result) chosen = result;
    } else if (name == kDashboardBackendName) {
      if (!chosen) chosen = result;
    }
  }
  return chosen;
}

void TelvanedSession::internalSendMessage(const Value& payload, TimeValue /*timestamp*/, std::uint16_t method,
                                          std::uint16_t respCode) {
  Dictionary message;
  message.set(keys::kMessageParametersCategory, Value(static_cast<unsigned>(method)));
  message.set(keys::kMessageParametersType, Value(static_cast<unsigned>(respCode)));
  if (!payload.isNull()) message.set(keys::kMessageParametersPayload, payload);
  message.set(keys::kMessageParametersFlag, Value(0u));
  sendMessageWithDictionary(Value(std::move(message)), nullptr);
  log::info("internalSendMessage: Sent internal message (method:%d respCode:%d)", method, respCode);
}

void TelvanedSession::flushMessagesWithCompletion(FlushReply reply) {
  assertOnQueue(queue_);
  log::info("flushMessagesWithCompletion: Flushing messages for session %u", sessionID());
  internalFlushMessagesWithCompletion(std::move(reply));
}

void TelvanedSession::internalFlushMessagesWithCompletion(FlushReply reply) {
  auto backends = this->backends();
  if (!backends) {
    log::info("internalFlushMessagesWithCompletion: %s", kNoBackendsText);
    if (reply) reply(std::nullopt, makeTelvaneError(-1, kNoBackendsText));
    return;
  }
  // With an empty backend map nobody answers and the reply is never called.
  auto countdown = std::make_shared<FlushCountdown>();
  countdown->remaining = static_cast<int>(backends->size());
  countdown->reply = std::move(reply);
  auto messageLog = environment_.messageLog;
  for (const auto& [name, backend] : *backends) {
    backend->flushMessagesWithCompletion(
        [countdown, name = name, messageLog](std::optional<std::string> result, std::optional<TelvaneError> error) {
          log::info("internalFlushMessagesWithCompletion: %s", name);
          if (result) messageLog(fmt::sprintf("[%s -> flushMessages] %s", name, *result));
          FlushReply reply;
          {
            std::lock_guard<std::mutex> lock(flushCompletionLock());
            --countdown->remaining;
            // The first error answers the client; without one, the last backend does.
            if (countdown->reply && (error || countdown->remaining < 1)) reply = std::move(countdown->reply);
            if (reply) countdown->reply = nullptr;
          }
          if (reply) reply(std::move(result), std::move(error));
        });
  }
}

void TelvanedSession::sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo,
                                                 std::uint16_t category, std::uint16_t type, const Value& payload,
                                                 TextReply reply) {
  assertOnQueue(queue_);
  Value info = sessionInfo.copy();
  {
    std::lock_guard<std::mutex> lock(mutex_);
    sessionInfo_ = info;
  }
  auto agent = delegate();
  if (!agent) return;
  if (agent->isActiveClientLimitReachedForSession(shared_from_this(), info)) {
    if (reply) {
      reply(fmt::sprintf("Exceeded maximum active reporting session limit for userInfo='%s'",
                         objectDescription(userInfo)));
    }
    return;
  }
  if (info[keys::kSessionInfoComponentType].isNull() || info[keys::kSessionInfoSessionID].isNull()) {
    log::error("sendMessageWithSessionInfo: %s", kMissingIdentifiersText);
    if (reply) reply(std::string(kMissingIdentifiersText));
    return;
  }
  setSessionID(info[keys::kSessionInfoSessionID].unsignedIntValue());
  const Value& hierarchy = info[keys::kSessionInfoHierarchyToken];
  if (hierarchy.isDictionary()) {
    std::lock_guard<std::mutex> lock(mutex_);
    hierarchyDictionary_ = hierarchy.copy();
  }
  agent->updateCorrelatedSessions(shared_from_this());
  log::info("sendMessageWithSessionInfo: Sending message with session info for session %u", sessionID());
  auto storebag = agent->storebagForSession(shared_from_this());
  if (!storebag) {
    if (reply) reply(std::string(kStorebagNotAvailableText));
    return;
  }
  sendOneMessageWithSessionInfo(info, userInfo, *storebag, category, type, payload);
  // The reply does not reflect what the backends did with the event.
  if (reply) reply(std::string(kFinishedText));
}

void TelvanedSession::sendOneMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo,
                                                    const Value& storebag, std::uint16_t category,
                                                    std::uint16_t type, const Value& payload) {
  assertOnQueue(queue_);
  log::info("sendOneMessageWithSessionInfo: Sending single message with sessionID %ld",
            static_cast<long>(sessionInfo[keys::kSessionInfoSessionID].integerValue()));
  if (sessionInfo.isNull() || storebag.isNull()) {
    log::error("sendOneMessageWithSessionInfo: Attempted to send message with one or more nil parameters");
    return;
  }
  if (userInfo.isNull()) {
    log::error("sendOneMessageWithSessionInfo: userInfo must be present and valid!!! Aborting method...");
    return;
  }
  refreshDeviceID();
  createBackendsWithStorebag(storebag);
  auto backends = this->backends();
  if (!backends || backends->empty()) {
    log::error("sendOneMessageWithSessionInfo: No backends available to send single message");
    return;
  }
  receivedUserInfo(userInfo);
  TimeValue timestamp = now();
  auto helper = connectivityHelper();
  for (const auto& [name, backend] : *backends) {
    backend->updateState();
    backend->setReportingSessionConnectivityDelegate(helper);
    if (!backend->isWhitelistedEvent(category)) {
      log::info(
          "sendOneMessageWithSessionInfo: Dropping event with category %d as it is not whitelisted for backend %s",
          category, name);
      continue;
    }
    if (backend->isBlacklistedEvent(category)) {
      log::info("sendOneMessageWithSessionInfo: Dropping event with category %d as it is blacklisted for backend %s",
                category, name);
      continue;
    }
    Value event = payload.isDictionary() ? payload.copy() : Value::dictionary();
    if (*environment_.internalBuild) {
      auto serial = environment_.deviceInfo->serialNumber();
      event.asDictionary()->set("SerialNum", Value(serial ? *serial : std::string("Unknown")));
    }
    auto result = backend->sendMessage(event, timestamp, category, type, kMessageFlagOrdinary);
    if (result) writeMessageLog(fmt::sprintf("[%s -> sendOneMessageWithSessionInfo] %s", name, *result));
  }
}

void TelvanedSession::uploadFileAtPath(const std::string& fileURL, FileAccessToken& token, UploadReply reply) {
  assertOnQueue(queue_);
  log::info("uploadFileAtPath: Uploading file for session %u", sessionID());
  uploadFileWithURL(fileURL, token, std::move(reply));
}

void TelvanedSession::uploadFileWithURL(const std::string& fileURL, FileAccessToken& token, UploadReply reply) {
  std::string path = pathOfFileURL(fileURL);
  bool succeeded = false;
  if (auto backends = this->backends()) {
    // Every backend is asked, also after one succeeded.
    for (const auto& [name, backend] : *backends) {
      if (backend->uploadFileAtPath(path, token)) succeeded = true;
    }
  }
  const char* word;
  if (succeeded) {
    log::info("uploadFileWithURL: File upload successful for %s", path);
    word = "succeeded";
  } else {
    log::error("uploadFileWithURL: File upload failed for %s", path);
    word = "failed";
  }
  writeMessageLog(fmt::sprintf("[uploadFileWithURL] Upload %s for file %s", word, fileURL));
  if (reply) reply(succeeded, token.removalLeftToClient);
}

void TelvanedSession::uploadLogData(const Array& logData, LogDataReply reply) {
  assertOnQueue(queue_);
  bool succeeded = false;
  if (auto backends = this->backends()) {
    for (const auto& [name, backend] : *backends) {
      if (backend->uploadLogData(logData)) succeeded = true;
    }
  }
  if (succeeded) {
    log::info("uploadLogData: Log data array upload successful");
  } else {
    log::error("uploadLogData: Log data array upload failed");
  }
  if (reply) reply(succeeded, std::nullopt);
}

std::int64_t TelvanedSession::batchedEventsSize() const {
  std::int64_t total = 0;
  if (auto backends = this->backends()) {
    for (const auto& [name, backend] : *backends) total += backend->batchedEventsSize();
  }
  return total;
}

void TelvanedSession::persistentIdentifierForDNU(bool respect, bool regenerate, TextReply reply) {
  assertOnQueue(queue_);
  // Both functions serialise on the class-level lock themselves.
  std::string identifier =
      regenerate ? regeneratePersistentIdentifierForDNU(*environment_.settings, *environment_.random, respect)
                 : getPersistentIdentifierForDNU(*environment_.settings, *environment_.random, respect);
  if (reply) reply(std::move(identifier));
}

}  // namespace telvane
