// TelvanedSession: creation, teardown and the properties. Configuration, the message
// path, the backend set and the health report live in their own files.
#include "session/TelvanedSession.h"

#include <cstring>

#include "platform/Crypto.h"
#include "platform/Log.h"
#include "session/SessionKeys.h"

namespace telvane {

namespace {

// The end message: category (method) 0, type (respCode) 1.
constexpr std::uint16_t kInternalMessageMethod = 0;
constexpr std::uint16_t kEndMessageRespCode = 1;

}  // namespace

std::shared_ptr<TelvanedSession> TelvanedSession::create(std::shared_ptr<TelvanedSessionDelegate> delegate,
                                                         std::shared_ptr<IpcConnection> connection,
                                                         SessionEnvironment environment) {
  environment = environment.withSystemDefaults();
  log::info("initWithSessionDelegate: TelvanedSession initWithSessionDelegate:%s",
            delegate ? delegate->description() : std::string("(null)"));
  Bytes uuid = environment.random->uuidBytes();
  std::string identifier = crypto::base64Encode(uuid);
  auto session = std::shared_ptr<TelvanedSession>(
      new TelvanedSession(std::move(delegate), std::move(connection), std::move(environment), identifier));
  session->refreshDeviceID();
  log::info("initWithSessionDelegate: Initialized session with UUID %s", identifier);
  return session;
}

TelvanedSession::TelvanedSession(std::shared_ptr<TelvanedSessionDelegate> delegate,
                                 std::shared_ptr<IpcConnection> connection, SessionEnvironment environment,
                                 std::string sessionIDString)
    : environment_(std::move(environment)),
      queue_(connection ? connection->queue() : SerialQueue::create("com.zembra.TelvanedSession")),
      sessionIDString_(std::move(sessionIDString)),
      sessionDelegate_(std::move(delegate)),
      connection_(std::move(connection)) {}

TelvanedSession::~TelvanedSession() = default;

void TelvanedSession::refreshDeviceID() {
  char buffer[kDeviceIDBufferBytes] = {};
  std::lock_guard<std::mutex> lock(mutex_);
  std::memcpy(buffer, deviceid_, sizeof buffer);
  // Left as it was when the query fails.
  if (environment_.deviceInfo->copyUniqueDeviceID(buffer, sizeof buffer)) std::memcpy(deviceid_, buffer, sizeof buffer);
}

TimeValue TelvanedSession::now() const { return TimeValue::fromSeconds(environment_.clock->now()); }

std::shared_ptr<TelvanedSessionDelegate> TelvanedSession::delegate() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return sessionDelegate_;
}

void TelvanedSession::writeMessageLog(const std::string& line) const { environment_.messageLog(line); }

// ---- Lifecycle ----

void TelvanedSession::invalidate() {
  std::shared_ptr<IpcConnection> connection;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    connection = std::move(connection_);
    connection_.reset();
  }
  if (connection) connection->invalidate();
}

void TelvanedSession::refuse(const std::string& reason) {
  std::shared_ptr<IpcConnection> connection;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    connection = std::move(connection_);
    connection_.reset();
  }
  if (connection) connection->refuse(reason);
}

void TelvanedSession::scheduleTeardown() {
  if (teardownScheduled_.exchange(true)) return;
  queue_->async([self = shared_from_this()] { self->teardown(); });
}

void TelvanedSession::teardown() {
  assertOnQueue(queue_);
  log::info("dealloc: TelvanedSession dealloc: %u", sessionID());
  TimeValue timestamp = now();
  auto agent = delegate();

  Dictionary endPayload;
  bool hasBackends, hasSessionInfo;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (storebagVersion_) {
      endPayload.set("StorebagVersion", Value(*storebagVersion_));
      endPayload.set("GracefulTermination", Value(hasFinishedGracefully_));
    }
    hasBackends = backends_.has_value();
    hasSessionInfo = !sessionInfo_.isNull();
  }
  ReportingAgentState state = agent ? agent->copyReportingAgentState() : ReportingAgentState{};
  addSessionsAccumulatedHealthInfoToPayload(endPayload, state.sessionList, state.cachedStorebags);
  state = ReportingAgentState{};

  if (hasBackends && hasSessionInfo) {
    internalSendMessage(Value(std::move(endPayload)), timestamp, kInternalMessageMethod, kEndMessageRespCode);
    flushMessagesWithCompletion(nullptr);
  }
  shutdownSessionAggregation();

  auto helper = connectivityHelper();
  if (!helper) {
    log::info("TelvanedSession dealloc: release IPC transaction for session without connectivity helper for session %u",
              sessionID());
    if (agent) {
      std::lock_guard<std::recursive_mutex> lock(agent->agentLock());
      agent->releaseIPCTransactions(1);
    }
  } else {
    log::info("TelvanedSession dealloc: incrementing total sessions count for session %u", sessionID());
    helper->incrementTotalSessionsServedCount();
  }
  releaseUserInfo();

  std::optional<BackendMap> backends;
  std::shared_ptr<IpcConnection> connection;
  std::shared_ptr<TelvanedSessionDelegate> droppedDelegate;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    backends = std::move(backends_);
    backends_.reset();
    hierarchyDictionary_ = Value();
    periodicServices_ = Value();
    storebagVersion_.reset();
    connection = std::move(connection_);
    connection_.reset();
    droppedDelegate = std::move(sessionDelegate_);
    sessionDelegate_.reset();
    digestKey_.reset();
  }
  if (backends) {
    for (const auto& [name, backend] : *backends) backend->cleanup();
  }
  tornDown_.store(true);
}

// ---- Properties ----

std::uint32_t TelvanedSession::sessionID() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return sessionID_;
}

void TelvanedSession::setSessionID(std::uint32_t sessionID) {
  std::lock_guard<std::mutex> lock(mutex_);
  sessionID_ = sessionID;
}

Value TelvanedSession::sessionInfo() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return sessionInfo_;
}

Value TelvanedSession::userInfo() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return userInfo_;
}

std::optional<std::string> TelvanedSession::storebagVersion() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return storebagVersion_;
}

bool TelvanedSession::hasAggregator() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return hasAggregator_;
}

bool TelvanedSession::hasFinishedGracefully() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return hasFinishedGracefully_;
}

bool TelvanedSession::isCounted() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return counted_;
}

void TelvanedSession::setCounted(bool counted) {
  std::lock_guard<std::mutex> lock(mutex_);
  counted_ = counted;
}

std::optional<std::string> TelvanedSession::hierarchyToken() const {
  std::lock_guard<std::mutex> lock(mutex_);
  const Value& token = hierarchyDictionary_[keys::kHierarchyTokenToken];
  if (const std::string* text = token.asString()) return *text;
  return std::nullopt;
}

std::int64_t TelvanedSession::hierarchyLevel() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return hierarchyDictionary_[keys::kHierarchyTokenLevel].integerValue();
}

std::uint32_t TelvanedSession::connectivityHelperReleaseTimeout() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return connectivityHelperReleaseTimeout_;
}

std::string TelvanedSession::deviceID() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return std::string(deviceid_);
}

std::optional<BackendMap> TelvanedSession::backends() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return backends_;
}

std::shared_ptr<TelvaneBackend> TelvanedSession::backendNamed(const std::string& name) const {
  std::lock_guard<std::mutex> lock(mutex_);
  if (!backends_) return nullptr;
  auto it = backends_->find(name);
  return it == backends_->end() ? nullptr : it->second;
}

std::shared_ptr<ReportingSessionConnectivityHelper> TelvanedSession::connectivityHelper() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return connectivityHelper_;
}

std::string TelvanedSession::description() const {
  return "<TelvanedSession: session " + std::to_string(sessionID()) + ", " + sessionIDString_ + ">";
}

}  // namespace telvane
