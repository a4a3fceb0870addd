// FakeSessionDelegate: an agent stand-in whose answers a test sets and whose calls it
// records. It refuses sessions like the agent does (the session invalidates itself)
// when told to, and it tears a session down when its connection is invalidated.
#pragma once

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "session/TelvanedSession.h"
#include "session/TelvanedSessionDelegate.h"

namespace telvane::test {

class FakeSessionDelegate : public TelvanedSessionDelegate {
 public:
  // ---- What the test sets ----
  void setStorebag(std::optional<Value> storebag) { set(storebag_, std::move(storebag)); }
  void setStorebagVersion(std::optional<std::string> version) { set(storebagVersion_, std::move(version)); }
  void setParentIDString(std::optional<std::string> chain) { set(parentIDString_, std::move(chain)); }
  void setParent(SessionRef parent) { set(parent_, std::move(parent)); }
  void setAncestor(SessionRef ancestor) { set(ancestor_, std::move(ancestor)); }
  void setLimitReached(bool reached) { set(limitReached_, reached); }
  void setHelper(std::shared_ptr<ReportingSessionConnectivityHelper> helper) { set(helper_, std::move(helper)); }
  void setAgentState(std::vector<SessionRef> sessions, Value storebags) {
    std::lock_guard<std::mutex> lock(mutex_);
    stateSessions_ = std::move(sessions);
    stateStorebags_ = std::move(storebags);
  }
  // The shared data handed out (the live map); null: none.
  void setSharedData(Value sharedData) { set(sharedData_, std::move(sharedData)); }

  // The connection's invalidation: like the agent, drop the session and tear it down.
  void connectionInvalidated(const SessionRef& session) {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      ++invalidations_;
      stateSessions_.clear();
      parent_.reset();
      ancestor_.reset();
    }
    session->scheduleTeardown();
  }

  // ---- What the test reads ----
  std::vector<std::uint32_t> releasedTransactions() const { return get(released_); }
  int limitChecks() const { return get(limitChecks_); }
  int correlatedUpdates() const { return get(correlatedUpdates_); }
  int downstreamUpdates() const { return get(downstreamUpdates_); }
  int helperCopies() const { return get(helperCopies_); }
  int helperReleases() const { return get(helperReleases_); }
  int invalidations() const { return get(invalidations_); }
  Value sharedData() const { return get(sharedData_); }
  std::vector<std::string> removedSharedKeys() const { return get(removedKeys_); }

  // ---- TelvanedSessionDelegate ----
  std::optional<Value> storebagForSession(const SessionRef&) override { return get(storebag_); }
  std::optional<std::string> storebagVersionForSession(const SessionRef&) override { return get(storebagVersion_); }
  std::optional<std::string> parentSessionIDStringForSession(const SessionRef&) override {
    return get(parentIDString_);
  }
  void updateCorrelatedSessions(const SessionRef&) override { bump(correlatedUpdates_); }
  SessionRef getAncestorWithAggregatorForSession(const SessionRef&) override { return get(ancestor_); }
  void updateDownstreamSessions(const SessionRef&) override { bump(downstreamUpdates_); }
  SessionRef parentSessionForChild(const SessionRef&) override { return get(parent_); }
  void updateSharedDataForSession(const SessionRef&, const Value& sharedData) override {
    std::lock_guard<std::mutex> lock(mutex_);
    if (!sharedData_.isDictionary()) sharedData_ = Value::dictionary();
    if (const Dictionary* entries = sharedData.asDictionary()) {
      for (const auto& [key, value] : *entries) sharedData_.asDictionary()->set(key, value);
    }
  }
  void removeObjectFromSharedDataForSession(const SessionRef&, const std::string& key) override {
    std::lock_guard<std::mutex> lock(mutex_);
    removedKeys_.push_back(key);
    if (Dictionary* entries = sharedData_.asDictionary()) entries->erase(key);
  }
  std::optional<Value> sharedDataForSession(const SessionRef&) override {
    std::lock_guard<std::mutex> lock(mutex_);
    if (sharedData_.isNull()) return std::nullopt;
    return sharedData_;
  }
  ReportingAgentState copyReportingAgentState() override {
    std::lock_guard<std::mutex> lock(mutex_);
    return ReportingAgentState{stateSessions_, stateStorebags_};
  }
  void releaseIPCTransactions(std::uint32_t count) override {
    std::lock_guard<std::mutex> lock(mutex_);
    released_.push_back(count);
  }
  std::shared_ptr<ReportingSessionConnectivityHelper> copySharedConnectivityHelperForReportingSession(
      const SessionRef&, std::int32_t) override {
    std::lock_guard<std::mutex> lock(mutex_);
    ++helperCopies_;
    return helper_;
  }
  void releaseSharedConnectivityHelperForReportingSession(const SessionRef&) override { bump(helperReleases_); }
  bool isActiveClientLimitReachedForSession(const SessionRef& session, const Value&) override {
    bool reached;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      ++limitChecks_;
      if (session->isCounted()) return false;
      session->setCounted(true);
      reached = limitReached_;
    }
    if (reached) session->invalidate();
    return reached;
  }
  std::recursive_mutex& agentLock() override { return agentLock_; }
  std::string description() const override { return "<FakeSessionDelegate>"; }

 private:
  template <typename T, typename U>
  void set(T& field, U&& value) {
    std::lock_guard<std::mutex> lock(mutex_);
    field = std::forward<U>(value);
  }
  template <typename T>
  T get(const T& field) const {
    std::lock_guard<std::mutex> lock(mutex_);
    return field;
  }
  void bump(int& counter) {
    std::lock_guard<std::mutex> lock(mutex_);
    ++counter;
  }

  std::recursive_mutex agentLock_;
  mutable std::mutex mutex_;  // a leaf: guards everything below
  std::optional<Value> storebag_;
  std::optional<std::string> storebagVersion_;
  std::optional<std::string> parentIDString_;
  SessionRef parent_;
  SessionRef ancestor_;
  bool limitReached_ = false;
  std::shared_ptr<ReportingSessionConnectivityHelper> helper_;
  std::vector<SessionRef> stateSessions_;
  Value stateStorebags_ = Value::dictionary();
  Value sharedData_;
  std::vector<std::uint32_t> released_;
  std::vector<std::string> removedKeys_;
  int limitChecks_ = 0;
  int correlatedUpdates_ = 0;
  int downstreamUpdates_ = 0;
  int helperCopies_ = 0;
  int helperReleases_ = 0;
  int invalidations_ = 0;
};

}  // namespace telvane::test
