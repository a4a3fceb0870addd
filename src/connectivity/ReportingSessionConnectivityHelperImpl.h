// ReportingSessionConnectivityHelperImpl: the connectivity helper that owns one
// private HTTP session (an HttpSession: its own connection pool) and runs the GET and
// POST requests of the sessions of one client, or of the storebag retrieval.
//
// Usage and release: each owner (a session, through the agent's registry) increments
// the usage count once and decrements it once. When the count falls to 0 the release
// timer starts; when it fires, the owner's block learns the count and the owner (the
// agent) invalidates the helper. Invalidation lets the running requests finish, then
// hands the IPC transactions of the sessions the helper served back to the agent in
// one call. A release timeout of 0 makes the helper ever-lasting: the owner is told 1
// at once and the transactions are handed back then.
//
// Requests: the HTTP session's callbacks arrive on the delegate queue (one at a time)
// and are hopped onto the state queue, where each request's record collects its bytes
// and its completion runs. GET requests are suppressed per URL for the helper's whole
// life (see getURLRequestWithCompletionHandler).
//
// Ownership: held by std::shared_ptr (the agent's registry and the sessions). Queued
// work holds the helper until it has run; the release timer and delayed pulls hold it
// weakly. The delegate (the agent) is held weakly.
//
// Threading: all state below is touched only on the state queue, except the served
// count (atomic), the HTTP session's description (its own mutex) and the class-wide
// duplicate map of GET requests (one lock for all helpers).
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>

#include "connectivity/ConnectivityHelperTask.h"
#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "platform/HttpEngine.h"
#include "platform/Random.h"
#include "platform/SerialQueue.h"
#include "platform/TimerSource.h"
#include "session/TelvanedSessionDelegate.h"

namespace telvane {

class ReportingSessionConnectivityHelperImpl : public ReportingSessionConnectivityHelper,
                                               public std::enable_shared_from_this<ReportingSessionConnectivityHelperImpl> {
 public:
  static constexpr const char* kStateQueueLabel = "com.zembra.ConnectivityHelperStateQueue";
  static constexpr const char* kDelegateQueueLabel = "com.zembra.ConnectivityHelperDelegateQueue";
  static constexpr std::uint32_t kDefaultReleaseTimeoutSeconds = 30;
  // Delayed storebag pulls wait a whole number of seconds below this.
  static constexpr std::uint32_t kPullDelayRangeSeconds = 7200;
  static constexpr std::chrono::milliseconds kReleaseTimerLeewayMs{100};

  struct Options {
    // The delay of non-urgent pulls. Unset: the system's randomness.
    std::shared_ptr<Random> random;
    // How long one of the helper's "seconds" lasts (release timeout, pull delay), so
    // that tests can run the timing rules quickly. Unset: one second.
    std::chrono::milliseconds secondDuration{1000};
    // Delayed pulls wait a random whole number of seconds below this (at least 1).
    std::uint32_t pullDelayRangeSeconds = kPullDelayRangeSeconds;
  };

  using OwnerBlock = std::function<void(std::uint32_t usageCount)>;

  // initWithDelegate:mode:userInfo:. Does not create the HTTP session.
  static std::shared_ptr<ReportingSessionConnectivityHelperImpl> create(std::weak_ptr<TelvanedSessionDelegate> delegate,
                                                                        std::int32_t mode, const Value& userInfo);
  static std::shared_ptr<ReportingSessionConnectivityHelperImpl> create(std::weak_ptr<TelvanedSessionDelegate> delegate,
                                                                        std::int32_t mode, const Value& userInfo,
                                                                        Options options);
  ~ReportingSessionConnectivityHelperImpl() override;

  // ---- ReportingSessionConnectivityHelper ----
  void activate(std::uint32_t releaseTimeoutSeconds) override;
  void setReleaseTimeout(std::uint32_t releaseTimeoutSeconds) override;
  // Runs on the caller's thread.
  void incrementTotalSessionsServedCount() override;
  std::string webSessionDescription() const override;
  void postURLRequestWithCompletionHandler(HttpRequest request, ConnectivityCompletion completion) override;
  void getURLRequestWithCompletionHandler(HttpRequest request, bool isUrgent,
                                          ConnectivityCompletion completion) override;

  // ---- Owners ----
  void ownerIncrementUsageCount();
  // The block runs on the queue (the state queue when none) with the usage count.
  void ownerDecrementUsageCountWithBlock(OwnerBlock block, std::shared_ptr<SerialQueue> queue);
  void invalidate();
  // Under the delegate's lock: hands the served count to the delegate's
  // releaseIPCTransactions and resets it (also without a delegate).
  void releaseAllIPCTransactions();

  // ---- For tests and logs ----
  std::int32_t mode() const { return mode_; }
  const Value& userInfo() const { return userInfo_; }
  const std::shared_ptr<SerialQueue>& stateQueue() const { return stateQueue_; }
  std::uint32_t totalSessionsServedCount() const { return totalSessionsServedCount_.load(); }
  // Read on the state queue (waits for it; not from the state queue).
  std::uint32_t usageCount() const;
  bool isActive() const;
  bool hasReleaseTimer() const;
  std::size_t runningTaskCount() const;
  // "<ReportingSessionConnectivityHelper: <web session ID>>".
  std::string description() const;
  // The process-wide task counter's current value.
  static std::uint32_t taskCounter();

 private:
  ReportingSessionConnectivityHelperImpl(std::weak_ptr<TelvanedSessionDelegate> delegate, std::int32_t mode,
                                         const Value& userInfo, Options options);

  // All on the state queue.
  void activateOnQueue(std::uint32_t releaseTimeoutSeconds);
  void postOnQueue(HttpRequest request, ConnectivityCompletion completion);
  void pullOnQueue(HttpRequest request, const std::string& key, ConnectivityCompletion completion);
  // createHelperForTask:completion: + starting the request; returns false when the
  // HTTP session refused it (invalidated).
  bool startRegisteredTask(HttpRequest request, ConnectivityCompletion completion);
  std::string createHelperForTask(ConnectivityCompletion completion);
  HttpTaskCallbacks callbacksForTask(const std::string& taskDescription);
  void didCompleteTask(const std::string& taskDescription, HttpResponse response);
  void didBecomeInvalid();
  void startConnectivityHelperReleaseTimerWithBlock(OwnerBlock block, std::shared_ptr<SerialQueue> queue);
  void releaseTimerFired();
  void stopConnectivityHelperReleaseTimer();
  void setRequestInProgress(const std::string& key, bool inProgress);
  std::chrono::milliseconds helperSeconds(std::uint64_t seconds) const;

  // Constant after construction.
  const std::weak_ptr<TelvanedSessionDelegate> delegate_;
  const bool hasDelegate_;
  const std::int32_t mode_;
  const Value userInfo_;
  const Options options_;
  const std::shared_ptr<Random> random_;
  const std::shared_ptr<SerialQueue> stateQueue_;
  const std::shared_ptr<SerialQueue> delegateQueue_;

  // State queue only.
  std::shared_ptr<HttpSession> privateURLSession_;
  std::map<std::string, std::shared_ptr<ConnectivityHelperTask>> tasks_;
  bool isActive_ = false;
  std::uint32_t usageCount_ = 0;
  std::uint32_t releaseTimeout_ = kDefaultReleaseTimeoutSeconds;
  std::shared_ptr<TimerSource> releaseTimer_;
  OwnerBlock releaseTimerBlock_;
  std::shared_ptr<SerialQueue> releaseTimerQueue_;

  std::atomic<std::uint32_t> totalSessionsServedCount_{0};

  mutable std::mutex descriptionMutex_;
  std::string sessionDescription_;  // guarded by descriptionMutex_; empty until activated

  // Guarded by the class-wide GET lock.
  std::map<std::string, bool> requestInProgress_;
};

}  // namespace telvane
