// TelvanedAgent: the daemon's registry of reporting sessions and their delegate.
//
// The agent accepts client connections (entitlement check), creates one
// TelvanedSession per accepted connection, keeps the registry of live sessions in
// creation order, counts them per component type and refuses a sixth concurrent
// session of one type, and keeps the daemon alive with one keep-alive transaction
// while any session (or a shared helper that served sessions) holds a reference. It
// answers what sessions ask through TelvanedSessionDelegate: hierarchy (correlation
// map by hierarchy token, parent chain, aggregating ancestor, downstream updates),
// shared data per token, the daemon-wide state of the health report, storebags and
// shared connectivity helpers.
//
// Lock order: the agent lock (`lock_`, recursive), then the storebag lock, then a
// session's own field lock. The agent lock is recursive because
// `updateDownstreamSessions` holds it while the sessions it updates take it again.
//
// Ownership: created once by the entry point and kept for the life of the process.
// The registry owns the sessions; a session owns the agent (as its delegate) until its
// teardown.
//
// Threading: every operation may be called from any thread. Accept calls arrive on
// the listener's queue, the connection handlers on each connection's queue.
#pragma once

#include <array>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "connectivity/ReportingSessionConnectivityHelperImpl.h"
#include "platform/IpcConnection.h"
#include "platform/KeepAlive.h"
#include "platform/SerialQueue.h"
#include "platform/UniqueFd.h"
#include "session/SessionEnvironment.h"
#include "storebag/AgentStorebagCache.h"
#include "session/TelvanedSession.h"
#include "session/TelvanedSessionDelegate.h"
#include "telvane/Value.h"

namespace telvane {

class TelvanedAgent : public TelvanedSessionDelegate, public std::enable_shared_from_this<TelvanedAgent> {
 public:
  static constexpr const char* kServiceName = "com.zembra.telvaned";
  static constexpr const char* kEntitlement = "com.zembra.private.telvaned";
  static constexpr const char* kStateQueueLabel = "com.zembra.TelvaneAgentStateQueue";
  static constexpr const char* kSessionQueueLabel = "com.zembra.TelvanedSessionQueue";
  // Live counted sessions allowed per component type.
  static constexpr unsigned kMaxActiveClientsPerType = 5;
  // Component types 0..29 have a slot of the counter array.
  static constexpr std::size_t kActiveClientSlots = 30;
  // What a refused client is told (the log lines stay as they are): a caller without
  // the entitlement, and a session whose first counted call has no component type.
  // The limit's refusal names the type: "too many active sessions for client type 7
  // (at most 5)".
  static constexpr const char* kNotEntitledRefusal = "missing the entitlement com.zembra.private.telvaned";
  static constexpr const char* kNoClientTypeRefusal = "no ComponentType in the session information";

  using EntitlementLookup =
      std::function<std::optional<bool>(const IpcConnection& connection, const std::string& entitlement)>;

  struct Options {
    // Begins and ends the platform transaction. Null: no keep-alive is kept.
    std::shared_ptr<KeepAlive> keepAlive;
    // The entitlement value of the connection's peer. Default: the policy in
    // entitlementsDir(), loaded at each accept.
    EntitlementLookup entitlementLookup;
    // Handed to every session; unset pieces take the process's real services.
    SessionEnvironment environment;
    // How long a client may take to say hello; unset: the connection's default.
    std::optional<std::chrono::milliseconds> helloTimeout;
    // Selects a client type's storebag section (the signed retrieval and the choice
    // of environment). Unset: no storebag is ever found, so no session has backends.
    AgentStorebagCache::Selector storebagSelector;
    // The modification time of a storebag name's disk-cache file.
    AgentStorebagCache::FileTime storebagFileTime;
  };

  static std::shared_ptr<TelvanedAgent> create(Options options);
  ~TelvanedAgent() override;
  TelvanedAgent(const TelvanedAgent&) = delete;
  TelvanedAgent& operator=(const TelvanedAgent&) = delete;

  // ---- Listener delegate ----
  // The listener's accept handler: wraps the socket in a daemon-side connection on a
  // new serial queue and runs shouldAcceptNewConnection (a refusal tells the caller
  // kNotEntitledRefusal and closes the connection).
  // Returns the new session, or nullptr when the connection was refused.
  std::shared_ptr<TelvanedSession> acceptConnection(UniqueFd socket);
  // listener:shouldAcceptNewConnection:
  bool shouldAcceptNewConnection(const std::shared_ptr<IpcConnection>& connection);
  std::shared_ptr<TelvanedSession> createReportingSessionWithDelegate(
      const std::shared_ptr<TelvanedSessionDelegate>& delegate, const std::shared_ptr<IpcConnection>& connection);
  // Called from the connection's invalidation handler: removes the session and
  // schedules its teardown.
  void invalidateReportingSession(const std::shared_ptr<TelvanedSession>& session);

  // ---- TelvanedSessionDelegate ----
  std::optional<Value> storebagForSession(const SessionRef& session) override;
  std::optional<std::string> storebagVersionForSession(const SessionRef& session) override;
  // Refreshes the cache entry of the client type's storebag name.
  void fetchAndCacheStorebag(std::int32_t clientType);
  std::optional<std::string> parentSessionIDStringForSession(const SessionRef& session) override;
  void updateCorrelatedSessions(const SessionRef& session) override;
  SessionRef getAncestorWithAggregatorForSession(const SessionRef& session) override;
  void updateDownstreamSessions(const SessionRef& session) override;
  SessionRef parentSessionForChild(const SessionRef& session) override;
  void updateSharedDataForSession(const SessionRef& session, const Value& sharedData) override;
  void removeObjectFromSharedDataForSession(const SessionRef& session, const std::string& key) override;
  std::optional<Value> sharedDataForSession(const SessionRef& session) override;
  ReportingAgentState copyReportingAgentState() override;
  void releaseIPCTransactions(std::uint32_t count) override;
  std::shared_ptr<ReportingSessionConnectivityHelper> copySharedConnectivityHelperForReportingSession(
      const SessionRef& session, std::int32_t mode) override;
  void releaseSharedConnectivityHelperForReportingSession(const SessionRef& session) override;
  bool isActiveClientLimitReachedForSession(const SessionRef& session, const Value& sessionInfo) override;
  std::recursive_mutex& agentLock() override { return lock_; }
  std::string description() const override;

  // The first session of the given level in the list, or nullptr. Caller's lock.
  static SessionRef getFirstSessionWithHierarchy(std::int64_t level, const std::vector<SessionRef>& sessionList);

  // ---- For tests and logs ----
  std::size_t sessionCount() const;
  int ipcTransactionReference() const;
  // The counter of a component type's slot.
  int activeClientCount(long componentType) const;
  // The sessions filed under a token (empty when none); whether the token has a list.
  std::vector<SessionRef> correlatedSessions(const std::string& token) const;
  bool hasCorrelationList(const std::string& token) const;
  // A copy of the token's shared data, or nothing.
  std::optional<Value> sharedDataForToken(const std::string& token) const;
  const SessionEnvironment& environment() const { return options_.environment; }
  // The shared connectivity helper registered under the user-info key, or nullptr.
  std::shared_ptr<ReportingSessionConnectivityHelperImpl> sharedConnectivityHelperForKey(
      const std::string& userInfoKey) const;
  const std::shared_ptr<SerialQueue>& stateQueue() const { return stateQueue_; }

 private:
  explicit TelvanedAgent(Options options);

  // shouldAcceptNewConnection, giving the session it made (nullptr: refused).
  std::shared_ptr<TelvanedSession> acceptNewConnection(const std::shared_ptr<IpcConnection>& connection);
  // The counter slot of a component type; created for types outside 0..29.
  std::uint8_t& activeClientSlotLocked(long componentType);
  std::optional<bool> entitlementValue(const IpcConnection& connection) const;

  // Constant after construction.
  const Options options_;
  // Serves the shared-helper registry.
  const std::shared_ptr<SerialQueue> stateQueue_;

  // Shared connectivity helpers by user-info key; touched only on stateQueue_.
  std::map<std::string, std::shared_ptr<ReportingSessionConnectivityHelperImpl>> sharedConnectivityHelpers_;

  // Guarded by lock_.
  mutable std::recursive_mutex lock_;
  std::vector<SessionRef> sessionList_;
  // Takes lock_ itself.
  AgentStorebagCache storebagCache_;
  std::map<std::string, std::vector<SessionRef>> correlatedSessions_;
  std::map<std::string, Value> sharedData_;
  std::int32_t IPCTransactionReference_ = 0;
  std::array<std::uint8_t, kActiveClientSlots> activeClients_{};
  // Component types outside 0..29 each get a slot of their own here, with the same
  // limit of five, instead of reaching outside the array.
  std::map<long, std::uint8_t> otherActiveClients_;
};

}  // namespace telvane
