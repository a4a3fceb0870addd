// TelvanedSession: configuration by the client (session info, user info, start and
// state queries), the start message, the display URL and the shared-data calls.
#include "platform/Log.h"
#include "session/SessionKeys.h"
#include "session/TelvanedSession.h"

namespace telvane {

namespace {

constexpr const char* kTimedSettingsDomain = "com.zembra.timed";
constexpr const char* kAutomaticTimeZoneEnabledKey = "TMAutomaticTimeZoneEnabled";
constexpr const char* kUnknownValue = "Unknown";
constexpr const char* kDefaultReportVersion = "8.0";

// The start message: category (method) 0, type (respCode) 0.
constexpr std::uint16_t kInternalMessageMethod = 0;
constexpr std::uint16_t kStartMessageRespCode = 0;

bool hasText(const Value& map, const char* key) { return map[key].isString(); }

// User info is valid when it names the client or the service.
bool isValidUserInfo(const Value& userInfo) {
  return userInfo.isDictionary() &&
         (!userInfo[keys::kUserInfoClientName].isNull() || !userInfo[keys::kUserInfoServiceName].isNull());
}

// Whether a name changed between two user-info maps; a missing value on either side
// counts as changed.
bool nameChanged(const Value& oldInfo, const Value& newInfo, const char* key) {
  if (!hasText(oldInfo, key) || !hasText(newInfo, key)) return true;
  return *oldInfo[key].asString() != *newInfo[key].asString();
}

Value textOrUnknown(const std::optional<std::string>& text) { return Value(text ? *text : std::string(kUnknownValue)); }

}  // namespace

void TelvanedSession::setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworks,
                                     bool hasAggregationBlock) {
  assertOnQueue(queue_);
  Value info = sessionInfo.copy();
  {
    std::lock_guard<std::mutex> lock(mutex_);
    sessionInfo_ = info;
  }
  auto agent = delegate();
  if (!agent) return;
  if (agent->isActiveClientLimitReachedForSession(shared_from_this(), info)) return;

  std::uint32_t sessionID = info[keys::kSessionInfoSessionID].unsignedIntValue();
  setSessionID(sessionID);
  log::info("setSessionInfo: Configuring session %u", sessionID);
  if (!userInfo.isNull() && !info[keys::kSessionInfoRequireUserDict].boolValue()) {
    log::error("setSessionInfo: Configure session: user info provided without requiring it");
  }
  const Value& hierarchy = info[keys::kSessionInfoHierarchyToken];
  {
    std::lock_guard<std::mutex> lock(mutex_);
    hierarchyDictionary_ = hierarchy.isDictionary() ? hierarchy.copy() : Value();
  }
  agent->updateCorrelatedSessions(shared_from_this());
  {
    std::lock_guard<std::mutex> lock(mutex_);
    frameworks_ = frameworks.copy();
  }
  updateUserInfo(userInfo);
  std::lock_guard<std::mutex> lock(mutex_);
  hasAggregator_ = hasAggregationBlock;
}

void TelvanedSession::releaseUserInfo() {
  bool heldUserInfo;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    heldUserInfo = !userInfo_.isNull();
  }
  if (heldUserInfo) {
    if (auto agent = delegate()) agent->releaseSharedConnectivityHelperForReportingSession(shared_from_this());
  }
  std::lock_guard<std::mutex> lock(mutex_);
  userInfo_ = Value();
  connectivityHelper_.reset();
}

void TelvanedSession::updateUserInfo(const Value& userInfo) {
  releaseUserInfo();
  Value info = userInfo.copy();
  std::uint32_t releaseTimeout;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    userInfo_ = info;
    releaseTimeout = connectivityHelperReleaseTimeout_;
  }
  if (!isValidUserInfo(info)) return;
  auto agent = delegate();
  if (!agent) return;
  auto helper = agent->copySharedConnectivityHelperForReportingSession(
      shared_from_this(), ReportingSessionConnectivityHelper::kPOSTRequestMode);
  if (helper) helper->setReleaseTimeout(releaseTimeout);
  std::optional<BackendMap> backends;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    connectivityHelper_ = helper;
    backends = backends_;
  }
  if (backends) {
    for (const auto& [name, backend] : *backends) backend->setReportingSessionConnectivityDelegate(helper);
  }
}

void TelvanedSession::receivedUserInfo(const Value& userInfo) {
  Value held, sessionInfo;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    held = userInfo_;
    sessionInfo = sessionInfo_;
  }
  bool clientChanged = true;
  bool serviceChanged = true;
  if (!held.isNull()) {
    if (userInfo.isNull() && sessionInfo[keys::kSessionInfoRequireUserDict].boolValue()) return;
    clientChanged = nameChanged(held, userInfo, keys::kUserInfoClientName);
    serviceChanged = nameChanged(held, userInfo, keys::kUserInfoServiceName);
  } else if (userInfo.isNull()) {
    return;
  }
  updateUserInfo(userInfo);
  updateUserInfoForBackends();
  if (!clientChanged && !serviceChanged) return;
  log::info("receivedUserInfo: Received new user info for session %u", sessionID());
  updateSessionWithDefaultSessionInfo();
}

void TelvanedSession::updateSessionWithDefaultSessionInfo() {
  bool activate = updateReportingStates();
  if (!activate) {
    // A deferred backend (sampled out, kept by the sampling override) becomes enabled
    // by a later promoting event without another state evaluation; its posts need an
    // active helper then, so deferred counts for the activation too.
    if (auto backends = this->backends()) {
      for (const auto& [name, backend] : *backends) {
        if (backend->state() == kBackendStateDeferred) activate = true;
      }
    }
  }
  if (activate) {
    std::shared_ptr<ReportingSessionConnectivityHelper> helper;
    std::uint32_t releaseTimeout;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      helper = connectivityHelper_;
      releaseTimeout = connectivityHelperReleaseTimeout_;
    }
    if (helper) {
      log::info("activate: activating connectivity helper for WebSession with ID <%s>", helper->webSessionDescription());
      helper->activate(releaseTimeout);
    }
  }
  if (auto agent = delegate()) agent->updateDownstreamSessions(shared_from_this());
}

void TelvanedSession::startConfigWithCompletionHandler(StatesReply reply) {
  assertOnQueue(queue_);
  log::info("startConfigWithCompletionHandler: Starting configuration for session %u", sessionID());
  auto agent = delegate();
  std::optional<Value> storebag = agent ? agent->storebagForSession(shared_from_this()) : std::nullopt;
  if (!storebag) {
    if (reply) reply(std::nullopt, std::nullopt, std::nullopt);
    return;
  }
  bool hasBackends;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    hasBackends = backends_.has_value();
  }
  if (!hasBackends) {
    auto version = agent->storebagVersionForSession(shared_from_this());
    {
      std::lock_guard<std::mutex> lock(mutex_);
      storebagVersion_ = version;
    }
    createBackendsWithStorebag(*storebag);
    updateSessionWithDefaultSessionInfo();
    sendStartMessage();
  } else {
    log::error("startConfigWithCompletionHandler: has been called more than once for session %u", sessionID());
  }
  if (reply) reply(fetchReportingStates(), fetchWhitelistedEvents(), fetchBlacklistedEvents());
}

void TelvanedSession::fetchStatesWithUserInfo(const Value& userInfo, StatesReply reply) {
  assertOnQueue(queue_);
  auto agent = delegate();
  if (!agent || agent->isActiveClientLimitReachedForSession(shared_from_this(), sessionInfo())) {
    if (reply) reply(std::nullopt, std::nullopt, std::nullopt);
    return;
  }
  log::info("fetchStatesWithUserInfo: Fetching states for session %u", sessionID());
  receivedUserInfo(userInfo);
  if (reply) reply(fetchReportingStates(), fetchWhitelistedEvents(), fetchBlacklistedEvents());
}

void TelvanedSession::sendStartMessage() {
  TimeValue timestamp = now();
  Dictionary payload;
  if (*environment_.internalBuild) {
    const DeviceInfo& device = *environment_.deviceInfo;
    payload.set("SerialNum", textOrUnknown(device.serialNumber()));
    payload.set("Version", textOrUnknown(device.productVersion()));
    payload.set("Build", textOrUnknown(device.buildVersion()));
    payload.set("Hardware", textOrUnknown(device.hwModelStr()));
    payload.set("Product", textOrUnknown(device.deviceName()));
    auto version = environment_.frameworkBundleVersion();
    payload.set("ReportVers", Value(version ? *version : std::string(kDefaultReportVersion)));
  }
  payload.set("Locale", textOrUnknown(environment_.localeCountryCode()));
  auto automaticTime = environment_.settings->read(kTimedSettingsDomain, kAutomaticTimeZoneEnabledKey);
  payload.set("AutomaticTimeSet", Value(automaticTime ? automaticTime->boolValue() : true));
  internalSendMessage(Value(std::move(payload)), timestamp, kInternalMessageMethod, kStartMessageRespCode);
}

void TelvanedSession::fetchDisplayURL(TextReply reply) {
  assertOnQueue(queue_);
  log::info("fetchDisplayURL: Fetching display URL for session %u", sessionID());
  std::shared_ptr<TelvaneBackend> chosen;
  auto backends = this->backends();
  if (backends) {
    for (const auto& [name, backend] : *backends) {
      if (name.find("splunk") == std::string::npos) continue;
      chosen = backend;
      if (backend->displayURL()) break;
    }
    if (!chosen || !chosen->displayURL()) {
      chosen = backendNamed("brindle");
      if (!chosen || !chosen->displayURL()) chosen = backendNamed("dashboard");
    }
  }
  std::optional<std::string> url = chosen ? chosen->displayURL() : std::nullopt;
  if (reply) reply(url ? *url : std::string(kURLNotAvailableText));
}

void TelvanedSession::finishSessionGracefully() {
  assertOnQueue(queue_);
  {
    std::lock_guard<std::mutex> lock(mutex_);
    hasFinishedGracefully_ = true;
  }
  log::info("finishSessionGracefully: Session %u has been finished gracefully", sessionID());
}

void TelvanedSession::updateSharedDataWithDictionary(const Value& sharedData) {
  assertOnQueue(queue_);
  auto agent = delegate();
  if (!agent) return;
  std::lock_guard<std::recursive_mutex> lock(agent->agentLock());
  agent->updateSharedDataForSession(shared_from_this(), sharedData.isDictionary() ? sharedData : Value::dictionary());
}

void TelvanedSession::updateSharedDataForKey(const std::string& key, const Value& value) {
  assertOnQueue(queue_);
  auto agent = delegate();
  if (!agent) return;
  std::lock_guard<std::recursive_mutex> lock(agent->agentLock());
  if (!value.isNull()) {
    agent->updateSharedDataForSession(shared_from_this(), Value(Dictionary{{key, value}}));
  } else {
    agent->removeObjectFromSharedDataForSession(shared_from_this(), key);
  }
}

}  // namespace telvane
