// TelvanedSessionDelegate: what a reporting session asks of the agent that owns it.
//
// The session reaches the agent only through this interface: its configuration
// (storebag and its version), its place in a hierarchy (parent chain, parent,
// aggregating ancestor, downstream updates), the data shared by its hierarchy, the
// daemon-wide state for the health report, the keep-alive transaction count, the
// shared connectivity helper of its client and the per-component-type session limit.
//
// Locking: `agentLock()` is the agent's recursive mutex. Operations documented as
// "caller holds the agent lock" are called only with it held; the others take it
// themselves. Sessions take it for the shared-data operations, the aggregation
// forwarding and the transaction release of their teardown.
//
// Threading: every operation may be called from any thread.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "telvane/Value.h"

namespace telvane {

class TelvanedSession;

// The daemon-wide state a session's health report reads.
struct ReportingAgentState {
  // Every session in the registry, in creation order.
  std::vector<std::shared_ptr<TelvanedSession>> sessionList;
  // The cached storebags (a dictionary).
  Value cachedStorebags;
};

class TelvanedSessionDelegate {
 public:
  using SessionRef = std::shared_ptr<TelvanedSession>;

  virtual ~TelvanedSessionDelegate() = default;

  // The storebag section for the session's client type, or nothing.
  virtual std::optional<Value> storebagForSession(const SessionRef& session) = 0;
  virtual std::optional<std::string> storebagVersionForSession(const SessionRef& session) = 0;
  // The dotted identifier chain of the session's ancestors, root first, or nothing.
  virtual std::optional<std::string> parentSessionIDStringForSession(const SessionRef& session) = 0;
  virtual void updateCorrelatedSessions(const SessionRef& session) = 0;
  // Caller holds the agent lock.
  virtual SessionRef getAncestorWithAggregatorForSession(const SessionRef& session) = 0;
  virtual void updateDownstreamSessions(const SessionRef& session) = 0;
  // Caller holds the agent lock.
  virtual SessionRef parentSessionForChild(const SessionRef& session) = 0;
  // Caller holds the agent lock.
  virtual void updateSharedDataForSession(const SessionRef& session, const Value& sharedData) = 0;
  // Caller holds the agent lock.
  virtual void removeObjectFromSharedDataForSession(const SessionRef& session, const std::string& key) = 0;
  // The hierarchy's live shared-data map (not a copy), or nothing. Caller holds the
  // agent lock for as long as it uses the map.
  virtual std::optional<Value> sharedDataForSession(const SessionRef& session) = 0;
  virtual ReportingAgentState copyReportingAgentState() = 0;
  virtual void releaseIPCTransactions(std::uint32_t count) = 0;
  // A helper the caller holds one usage of, or nullptr.
  virtual std::shared_ptr<ReportingSessionConnectivityHelper> copySharedConnectivityHelperForReportingSession(
      const SessionRef& session, std::int32_t mode) = 0;
  virtual void releaseSharedConnectivityHelperForReportingSession(const SessionRef& session) = 0;
  // True when the session is refused (it has invalidated itself then).
  virtual bool isActiveClientLimitReachedForSession(const SessionRef& session, const Value& sessionInfo) = 0;

  virtual std::recursive_mutex& agentLock() = 0;
  // For log lines.
  virtual std::string description() const = 0;
};

}  // namespace telvane
