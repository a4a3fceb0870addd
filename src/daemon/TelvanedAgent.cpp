// TelvanedAgent: connection acceptance, the session registry, the keep-alive
// transaction count and the per-component-type session limit. The hierarchy and the
// shared data live in TelvanedAgentHierarchy.cpp.
#include "daemon/TelvanedAgent.h"

#include <algorithm>
#include <cstdio>
#include <string>

#include "platform/EntitlementPolicy.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "session/ClientSessionInterface.h"
#include "session/SessionKeys.h"

namespace telvane {

std::shared_ptr<TelvanedAgent> TelvanedAgent::create(Options options) {
  options.environment = options.environment.withSystemDefaults();
  return std::shared_ptr<TelvanedAgent>(new TelvanedAgent(std::move(options)));
}

TelvanedAgent::TelvanedAgent(Options options)
    : options_(std::move(options)),
      stateQueue_(SerialQueue::create(kStateQueueLabel)),
      storebagCache_(lock_, options_.storebagSelector, options_.storebagFileTime, options_.environment.clock) {}

TelvanedAgent::~TelvanedAgent() = default;

std::string TelvanedAgent::description() const {
  char buffer[48];
  std::snprintf(buffer, sizeof buffer, "<TelvanedAgent: %p>", static_cast<const void*>(this));
  return buffer;
}

// ---- Accepting connections ----

std::shared_ptr<TelvanedSession> TelvanedAgent::acceptConnection(UniqueFd socket) {
  auto connection =
      IpcConnection::adopt(std::move(socket), SerialQueue::create(kSessionQueueLabel), IpcConnection::Side::Daemon);
  auto session = acceptNewConnection(connection);
  if (!session) connection->refuse(kNotEntitledRefusal);
  return session;
}

std::optional<bool> TelvanedAgent::entitlementValue(const IpcConnection& connection) const {
  if (options_.entitlementLookup) return options_.entitlementLookup(connection, kEntitlement);
  return EntitlementPolicy::load(entitlementsDir()).valueFor(kEntitlement, connection.peer());
}

bool TelvanedAgent::shouldAcceptNewConnection(const std::shared_ptr<IpcConnection>& connection) {
  return acceptNewConnection(connection) != nullptr;
}

std::shared_ptr<TelvanedSession> TelvanedAgent::acceptNewConnection(const std::shared_ptr<IpcConnection>& connection) {
  std::optional<bool> entitled = entitlementValue(*connection);
  if (!entitled.value_or(false)) {
    log::info("listener: new IPC connection %s does not have required telvane entitlement. Closing connection...",
              connection->description());
    return nullptr;
  }
  {
    std::lock_guard<std::recursive_mutex> lock(lock_);
    log::info("listener: Accepting new IPC connection %s as it has proper entitlement, %d(%d) connections.",
              connection->description(), sessionList_.size(), correlatedSessions_.size());
  }
  auto session = createReportingSessionWithDelegate(shared_from_this(), connection);
  ClientSessionInterface::exportSession(connection, session);
  // Interruption leaves the session alive and registered.
  connection->setInterruptionHandler([session] {
    log::info("listener: IPC connection to %s was interrupted", session->description());
  });
  connection->setInvalidationHandler([agent = shared_from_this(), session] {
    log::info("listener: IPC connection to %s was invalidated", session->description());
    agent->invalidateReportingSession(session);
  });
  if (options_.helloTimeout) connection->setHelloTimeout(*options_.helloTimeout);
  connection->resume();
  return session;
}

std::shared_ptr<TelvanedSession> TelvanedAgent::createReportingSessionWithDelegate(
    const std::shared_ptr<TelvanedSessionDelegate>& delegate, const std::shared_ptr<IpcConnection>& connection) {
  auto session = TelvanedSession::create(delegate, connection, options_.environment);
  std::lock_guard<std::recursive_mutex> lock(lock_);
  if (IPCTransactionReference_ == 0) {
    if (options_.keepAlive) options_.keepAlive->beginTransaction();
    log::info("createReportingSessionWithDelegate: IPC transaction started with session %s", session->description());
  }
  sessionList_.push_back(session);
  ++IPCTransactionReference_;
  log::info("createReportingSessionWithDelegate: retained IPC Transaction. Ref count is %d", IPCTransactionReference_);
  return session;
}

void TelvanedAgent::releaseIPCTransactions(std::uint32_t count) {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  if (IPCTransactionReference_ < 1) return;
  // No clamping: a release of more than is held takes the count below zero.
  IPCTransactionReference_ =
      static_cast<std::int32_t>(static_cast<std::int64_t>(IPCTransactionReference_) - static_cast<std::int64_t>(count));
  log::info("releaseIPCTransactions: IPC transaction ref count is %d, decremented by %d", IPCTransactionReference_,
            count);
  if (IPCTransactionReference_ < 1) {
    if (options_.keepAlive) options_.keepAlive->endTransaction();
    log::info("releaseIPCTransactions: IPC transaction ended");
  }
}

void TelvanedAgent::invalidateReportingSession(const std::shared_ptr<TelvanedSession>& session) {
  if (!session) return;
  {
    std::lock_guard<std::recursive_mutex> lock(lock_);
    if (auto token = session->hierarchyToken()) {
      auto list = correlatedSessions_.find(*token);
      if (list != correlatedSessions_.end()) {
        auto& sessions = list->second;
        sessions.erase(std::remove(sessions.begin(), sessions.end(), session), sessions.end());
      }
      // The test is on the whole map, which still holds this token's entry: a token's
      // (possibly empty) list and its shared data outlive all its sessions. Intended.
      if (correlatedSessions_.empty()) {
        correlatedSessions_.erase(*token);
        sharedData_.erase(*token);
      }
    }
    std::string description = session->description();
    sessionList_.erase(std::remove(sessionList_.begin(), sessionList_.end(), session), sessionList_.end());
    log::info("invalidateReportingSession: TelvanedSession %s was invalidated", description);

    // Done whether or not the session was ever counted.
    Value sessionInfo = session->sessionInfo();
    const Value& componentType = sessionInfo[keys::kSessionInfoComponentType];
    if (!componentType.isNull()) {
      long index = static_cast<long>(componentType.integerValue());
      std::uint8_t& slot = activeClientSlotLocked(index);
      if (slot != 0) {
        --slot;
        log::debug("invalidateReportingSession: active session count for clientType %d got decremented to %d", index,
                   static_cast<unsigned>(slot));
      }
    }
  }
  // The registry's reference is gone; what remains is the session's teardown.
  session->scheduleTeardown();
}

std::uint8_t& TelvanedAgent::activeClientSlotLocked(long componentType) {
  if (componentType >= 0 && componentType < static_cast<long>(kActiveClientSlots)) {
    return activeClients_[static_cast<std::size_t>(componentType)];
  }
  return otherActiveClients_[componentType];
}

bool TelvanedAgent::isActiveClientLimitReachedForSession(const SessionRef& session, const Value& sessionInfo) {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  // Each session is counted at most once, however often it is asked.
  if (session->isCounted()) return false;
  session->setCounted(true);
  const Value& componentType = sessionInfo[keys::kSessionInfoComponentType];
  if (componentType.isNull()) {
    log::error("isActiveClientLimitReachedForSession: session %u missing clientType in its sessionInfo %s. Session "
               "terminated...",
               session->sessionID(), objectDescription(sessionInfo));
    session->refuse(kNoClientTypeRefusal);
    return true;
  }
  long index = static_cast<long>(componentType.integerValue());
  std::uint8_t& slot = activeClientSlotLocked(index);
  std::uint8_t old = slot;
  if (old >= kMaxActiveClientsPerType) {
    log::error("isActiveClientLimitReachedForSession: session %u exceeds number of allowed active connections for "
               "clientType %s. Session terminated...",
               session->sessionID(), objectDescription(componentType));
  }
  // A refused session raises the counter too; its invalidation brings it back.
  slot = static_cast<std::uint8_t>(old + 1);
  log::debug("isActiveClientLimitReachedForSession: active session count for clientType %d got incremented to %d",
             index, static_cast<unsigned>(slot));
  if (old < kMaxActiveClientsPerType) return false;
  session->refuse("too many active sessions for client type " + std::to_string(index) + " (at most " +
                  std::to_string(kMaxActiveClientsPerType) + ")");
  return true;
}

// ---- Daemon-wide state ----

ReportingAgentState TelvanedAgent::copyReportingAgentState() {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  ReportingAgentState state;
  state.sessionList = sessionList_;
  state.cachedStorebags = storebagCache_.copyCachedStorebags();
  return state;
}

std::optional<Value> TelvanedAgent::storebagForSession(const SessionRef& session) {
  if (!session || !options_.storebagSelector) return std::nullopt;
  const std::int32_t clientType = session->sessionInfo()[keys::kSessionInfoComponentType].intValue();
  return storebagCache_.storebagForSession(session->sessionID(), clientType);
}

std::optional<std::string> TelvanedAgent::storebagVersionForSession(const SessionRef& session) {
  if (!session) return std::nullopt;
  const std::int32_t clientType = session->sessionInfo()[keys::kSessionInfoComponentType].intValue();
  return storebagCache_.storebagVersionForSession(clientType);
}

void TelvanedAgent::fetchAndCacheStorebag(std::int32_t clientType) {
  if (options_.storebagSelector) storebagCache_.fetchAndCacheStorebag(clientType);
}

// The registry of shared connectivity helpers lives on the state queue. A session
// asks synchronously (it must not call from that queue) and gives back asynchronously.
std::shared_ptr<ReportingSessionConnectivityHelper> TelvanedAgent::copySharedConnectivityHelperForReportingSession(
    const SessionRef& session, std::int32_t mode) {
  if (!session) return nullptr;
  const Value userInfo = session->userInfo();
  if (!ReportingSessionConnectivityHelper::isValidUserInfo(userInfo)) return nullptr;
  const std::string key = ReportingSessionConnectivityHelper::userInfoKey(userInfo);
  std::shared_ptr<ReportingSessionConnectivityHelperImpl> helper;
  stateQueue_->sync([&] {
    log::info("requestSharedConnectivityHelperForReportingSession: Requesting shared connectivity helper for "
              "userInfoKey %s",
              key);
    auto it = sharedConnectivityHelpers_.find(key);
    if (it == sharedConnectivityHelpers_.end()) {
      log::info("requestSharedConnectivityHelperForReportingSession: Creating shared connectivity helper for "
                "userInfoKey %s",
                key);
      helper = ReportingSessionConnectivityHelperImpl::create(weak_from_this(), mode, userInfo);
      sharedConnectivityHelpers_[key] = helper;
    } else {
      // An existing helper keeps its own mode.
      log::info("requestSharedConnectivityHelperForReportingSession: Found existing shared connectivity helper for "
                "userInfoKey %s",
                key);
      helper = it->second;
    }
    log::info("requestSharedConnectivityHelperForReportingSession: Incrementing usage of shared connectivity helper "
              "for userInfoKey %s",
              key);
    helper->ownerIncrementUsageCount();
  });
  return helper;
}

void TelvanedAgent::releaseSharedConnectivityHelperForReportingSession(const SessionRef& session) {
  if (!session) return;
  const std::string key = ReportingSessionConnectivityHelper::userInfoKey(session->userInfo());
  stateQueue_->async([self = shared_from_this(), key] {
    log::info("releaseSharedConnectivityHelperForReportingSession: Releasing shared connectivity helper for "
              "userInfoKey %s",
              key);
    auto it = self->sharedConnectivityHelpers_.find(key);
    if (it == self->sharedConnectivityHelpers_.end()) return;
    log::info("releaseSharedConnectivityHelperForReportingSession: Decrementing usage count of shared connectivity "
              "helper for userInfoKey %s",
              key);
    std::weak_ptr<TelvanedAgent> weakAgent = self;
    it->second->ownerDecrementUsageCountWithBlock(
        [weakAgent, key](std::uint32_t usageCount) {
          auto agent = weakAgent.lock();
          if (!agent || usageCount != 0) return;
          // Runs on the state queue.
          log::info("releaseSharedConnectivityHelperForReportingSession: Usage count of shared connectivity helper "
                    "for userInfoKey %s reached zero. Invalidating the helper",
                    key);
          auto found = agent->sharedConnectivityHelpers_.find(key);
          if (found == agent->sharedConnectivityHelpers_.end()) return;
          auto helper = found->second;
          agent->sharedConnectivityHelpers_.erase(found);
          helper->invalidate();
        },
        self->stateQueue_);
  });
}

std::shared_ptr<ReportingSessionConnectivityHelperImpl> TelvanedAgent::sharedConnectivityHelperForKey(
    const std::string& userInfoKey) const {
  std::shared_ptr<ReportingSessionConnectivityHelperImpl> helper;
  stateQueue_->sync([&] {
    auto it = sharedConnectivityHelpers_.find(userInfoKey);
    if (it != sharedConnectivityHelpers_.end()) helper = it->second;
  });
  return helper;
}

// ---- For tests and logs ----

std::size_t TelvanedAgent::sessionCount() const {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return sessionList_.size();
}

int TelvanedAgent::ipcTransactionReference() const {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return IPCTransactionReference_;
}

int TelvanedAgent::activeClientCount(long componentType) const {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  if (componentType >= 0 && componentType < static_cast<long>(kActiveClientSlots)) {
    return activeClients_[static_cast<std::size_t>(componentType)];
  }
  auto it = otherActiveClients_.find(componentType);
  return it == otherActiveClients_.end() ? 0 : it->second;
}

}  // namespace telvane
