// TelvanedAgent: session hierarchies (the correlation map by hierarchy token, parent
// chains, the aggregating ancestor, downstream updates) and the data shared by the
// sessions of one token. Everything here is guarded by the agent lock; a token's list
// and shared data, once made, stay for the life of the daemon.
#include <algorithm>

#include "daemon/TelvanedAgent.h"
#include "platform/Log.h"

namespace telvane {

TelvanedAgent::SessionRef TelvanedAgent::getFirstSessionWithHierarchy(std::int64_t level,
                                                                      const std::vector<SessionRef>& sessionList) {
  for (const auto& session : sessionList) {
    if (session->hierarchyLevel() == level) return session;
  }
  return nullptr;
}

void TelvanedAgent::updateCorrelatedSessions(const SessionRef& session) {
  auto token = session->hierarchyToken();
  if (!token) {
    log::info("updateCorrelatedSessions: Session %u has no correlated sessions as it is a standalone session",
              session->sessionID());
    return;
  }
  std::lock_guard<std::recursive_mutex> lock(lock_);
  // A session that changed token leaves its old list (the emptied list stays); a
  // repeated call moves it to the end of its list.
  for (auto& [otherToken, sessions] : correlatedSessions_) {
    sessions.erase(std::remove(sessions.begin(), sessions.end(), session), sessions.end());
  }
  auto& sessions = correlatedSessions_[*token];
  if (std::find(sessions.begin(), sessions.end(), session) == sessions.end()) {
    log::info("updateCorrelatedSessions: Adding session %u to list for hierarchyToken %s with hierarchyLevel %d",
              session->sessionID(), *token, session->hierarchyLevel());
    sessions.push_back(session);
  }
}

std::optional<std::string> TelvanedAgent::parentSessionIDStringForSession(const SessionRef& session) {
  auto token = session->hierarchyToken();
  std::int64_t level = session->hierarchyLevel();
  if (level == 0 || !token) return std::nullopt;
  log::info("parentSessionIDStringForSession: Checking hierarchyToken '%s' for session %u", *token,
            session->sessionID());
  std::lock_guard<std::recursive_mutex> lock(lock_);
  auto list = correlatedSessions_.find(*token);
  if (list == correlatedSessions_.end() || list->second.empty()) {
    log::error("parentSessionIDStringForSession: ERROR: No sessions found for hierarchyToken %s", *token);
    return std::nullopt;
  }
  const auto& sessions = list->second;
  if (std::find(sessions.begin(), sessions.end(), session) == sessions.end()) {
    log::info("parentSessionIDStringForSession: Session %u not found for hierarchyToken %s", session->sessionID(),
              *token);
    return std::nullopt;
  }
  std::optional<std::string> chain;
  for (std::int64_t ancestorLevel = level - 1; ancestorLevel >= 0; --ancestorLevel) {
    auto ancestor = getFirstSessionWithHierarchy(ancestorLevel, sessions);
    if (!ancestor) {
      log::info("parentSessionIDStringForSession: Found a gap in hierarchy (one of parents missing): incomplete "
                "parentSessionID is '%s'",
                chain ? *chain : std::string("(null)"));
      break;
    }
    chain = chain ? ancestor->sessionIDString() + "." + *chain : ancestor->sessionIDString();
  }
  return chain;
}

TelvanedAgent::SessionRef TelvanedAgent::parentSessionForChild(const SessionRef& session) {
  auto token = session->hierarchyToken();
  std::int64_t level = session->hierarchyLevel();
  if (level == 0 || !token) return nullptr;
  log::info("parentSessionForChild: Checking hierarchyToken '%s' for session %u", *token, session->sessionID());
  std::lock_guard<std::recursive_mutex> lock(lock_);
  auto list = correlatedSessions_.find(*token);
  if (list == correlatedSessions_.end() || list->second.empty()) {
    log::error("parentSessionForChild: ERROR: No sessions found for hierarchyToken %s", *token);
    return nullptr;
  }
  const auto& sessions = list->second;
  if (std::find(sessions.begin(), sessions.end(), session) == sessions.end()) {
    log::error("parentSessionForChild: ERROR: Session %u not found for hierarchyToken %s", session->sessionID(),
               *token);
    return nullptr;
  }
  auto parent = getFirstSessionWithHierarchy(level - 1, sessions);
  if (!parent) {
    log::info("parentSessionForChild: Unable to find session with hierarchy of %d for hierarchyToken '%s'", level - 1,
              *token);
  }
  return parent;
}

TelvanedAgent::SessionRef TelvanedAgent::getAncestorWithAggregatorForSession(const SessionRef& session) {
  auto token = session->hierarchyToken();
  std::int64_t level = session->hierarchyLevel();
  if (!token || level < 1) return nullptr;
  std::lock_guard<std::recursive_mutex> lock(lock_);
  auto list = correlatedSessions_.find(*token);
  if (list == correlatedSessions_.end()) return nullptr;
  // Root first: the topmost aggregating ancestor wins.
  for (std::int64_t ancestorLevel = 0; ancestorLevel < level; ++ancestorLevel) {
    auto ancestor = getFirstSessionWithHierarchy(ancestorLevel, list->second);
    if (ancestor && ancestor->hasAggregator()) return ancestor;
  }
  return nullptr;
}

void TelvanedAgent::updateDownstreamSessions(const SessionRef& session) {
  auto token = session->hierarchyToken();
  if (!token) return;
  std::int64_t level = session->hierarchyLevel();
  std::lock_guard<std::recursive_mutex> lock(lock_);
  session->updateCombinedSessionID();
  session->syncReportingStates();
  bool ancestorAggregates = false;
  if (level >= 1 && getAncestorWithAggregatorForSession(session)) {
    session->shutdownSessionAggregation();
    ancestorAggregates = true;
  }
  auto list = correlatedSessions_.find(*token);
  if (list == correlatedSessions_.end()) return;
  // A copy: the sessions updated below may re-enter the agent.
  std::vector<SessionRef> sessions = list->second;
  // Every descendant, not only the children, in list order. Only the topmost
  // aggregator of a tree keeps aggregating.
  for (const auto& descendant : sessions) {
    if (descendant->hierarchyLevel() <= level) continue;
    log::info("updateDownstreamSessions: Updating combined session ID and syncing reporting states for session %u",
              descendant->sessionID());
    descendant->updateCombinedSessionID();
    descendant->syncReportingStates();
    if ((ancestorAggregates || session->hasAggregator()) && descendant->hasAggregator()) {
      descendant->shutdownSessionAggregation();
    }
  }
}

// ---- Shared data ----

void TelvanedAgent::updateSharedDataForSession(const SessionRef& session, const Value& sharedData) {
  auto token = session->hierarchyToken();
  // Standalone sessions cannot share data.
  if (!token) return;
  std::lock_guard<std::recursive_mutex> lock(lock_);
  Value& map = sharedData_[*token];
  if (!map.isDictionary()) map = Value::dictionary();
  if (const Dictionary* entries = sharedData.asDictionary()) {
    for (const auto& [key, value] : *entries) map.asDictionary()->set(key, value);
  }
  log::debug("updateSharedDataForSession: hierarchyToken %s now shares %lu keys", *token,
             static_cast<unsigned long>(map.asDictionary()->size()));
}

void TelvanedAgent::removeObjectFromSharedDataForSession(const SessionRef& session, const std::string& key) {
  auto token = session->hierarchyToken();
  if (!token) return;
  std::lock_guard<std::recursive_mutex> lock(lock_);
  auto map = sharedData_.find(*token);
  if (map == sharedData_.end()) return;
  if (Dictionary* entries = map->second.asDictionary()) {
    entries->erase(key);
    log::debug("removeObjectFromSharedDataForSession: hierarchyToken %s now shares %lu keys", *token,
               static_cast<unsigned long>(entries->size()));
  }
}

std::optional<Value> TelvanedAgent::sharedDataForSession(const SessionRef& session) {
  auto token = session->hierarchyToken();
  if (!token) return std::nullopt;
  std::lock_guard<std::recursive_mutex> lock(lock_);
  auto map = sharedData_.find(*token);
  if (map == sharedData_.end()) return std::nullopt;
  // The live map: callers hold the agent lock while they use it.
  return map->second;
}

// ---- For tests ----

std::vector<TelvanedAgent::SessionRef> TelvanedAgent::correlatedSessions(const std::string& token) const {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  auto list = correlatedSessions_.find(token);
  return list == correlatedSessions_.end() ? std::vector<SessionRef>{} : list->second;
}

bool TelvanedAgent::hasCorrelationList(const std::string& token) const {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  return correlatedSessions_.count(token) != 0;
}

std::optional<Value> TelvanedAgent::sharedDataForToken(const std::string& token) const {
  std::lock_guard<std::recursive_mutex> lock(lock_);
  auto map = sharedData_.find(token);
  if (map == sharedData_.end()) return std::nullopt;
  return map->second.copy();
}

}  // namespace telvane
