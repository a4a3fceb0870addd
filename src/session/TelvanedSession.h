// TelvanedSession: the daemon-side object of one client connection.
//
// The agent creates one session per accepted connection and exports it to the client
// (ClientSessionInterface dispatches the client's calls to it). The session keeps the
// client's session info and user info, takes its configuration (storebag) from the
// agent, builds its backends, forwards events to them, answers flushes and uploads,
// hands events to an aggregating ancestor, and when it ends sends a final message with
// the daemon's health report, flushes and releases what it holds.
//
// Lifetime: the agent's registry owns the session until its connection is
// invalidated; the agent then removes it and calls `scheduleTeardown()`, which runs
// the teardown once on the session's queue after all work already queued there. The
// session owns its connection, its backends and (until the teardown) its delegate.
//
// Threading: the session's queue is its connection's queue. The client operations
// run on it (asserted in debug builds). The agent and other sessions of the same
// hierarchy call a few operations from their own queues, always under the agent lock:
// `updateCombinedSessionID`, `syncReportingStates`, `shutdownSessionAggregation`,
// `sendToAggregator`, `batchedEventsSize` and the property getters. So every field
// that can change is guarded by `mutex_`, a leaf lock: nothing is called while it is
// held (backends, delegate and connection are copied out first). Lock order: agent
// lock, then a session's `mutex_`; never the other way round.
#pragma once

#include <atomic>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "backends/TelvaneBackend.h"
#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "platform/IpcConnection.h"
#include "platform/SerialQueue.h"
#include "session/SessionEnvironment.h"
#include "session/TelvanedSessionDelegate.h"
#include "telvane/Value.h"
#include "util/TelvaneError.h"

namespace telvane {

class TelvanedSession : public std::enable_shared_from_this<TelvanedSession> {
 public:
  using StatesReply = std::function<void(std::optional<Array> states, std::optional<Array> whitelist,
                                         std::optional<Array> blacklist)>;
  using TextReply = std::function<void(std::optional<std::string> text)>;
  using FlushReply = std::function<void(std::optional<std::string> result, std::optional<TelvaneError> error)>;
  // `removeFile`: the server asked for the file's removal and the daemon could not
  // remove it itself, so the client should.
  using UploadReply = std::function<void(bool succeeded, bool removeFile)>;
  using LogDataReply = std::function<void(bool succeeded, std::optional<TelvaneError> error)>;

  static constexpr std::uint32_t kDefaultConnectivityHelperReleaseTimeoutSeconds = 30;
  // The device identifier buffer: at most 40 characters and the terminator.
  static constexpr std::size_t kDeviceIDBufferBytes = 41;

  static constexpr const char* kNoBackendsText = "No backends available to send message";
  static constexpr const char* kURLNotAvailableText = "URL not available";
  static constexpr const char* kStorebagNotAvailableText = "storebag not available";
  static constexpr const char* kFinishedText = "finished";
  static constexpr const char* kMissingIdentifiersText = "Could not retrieve identifiers from sessionInfo";

  // initWithSessionDelegate:connection:. The environment is resolved with its system
  // defaults for every piece left unset.
  static std::shared_ptr<TelvanedSession> create(std::shared_ptr<TelvanedSessionDelegate> delegate,
                                                 std::shared_ptr<IpcConnection> connection,
                                                 SessionEnvironment environment);
  ~TelvanedSession();
  TelvanedSession(const TelvanedSession&) = delete;
  TelvanedSession& operator=(const TelvanedSession&) = delete;

  // ---- Client operations (ClientSessionInterface), on the session's queue ----
  void setSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& frameworks,
                      bool hasAggregationBlock);
  void startConfigWithCompletionHandler(StatesReply reply);
  void fetchStatesWithUserInfo(const Value& userInfo, StatesReply reply);
  void fetchDisplayURL(TextReply reply);
  void sendMessageWithDictionary(const Value& message, TextReply reply);
  void flushMessagesWithCompletion(FlushReply reply);
  void finishSessionGracefully();
  // The descriptor in the token is borrowed for the call; the caller closes it.
  void uploadFileAtPath(const std::string& fileURL, FileAccessToken& token, UploadReply reply);
  void uploadLogData(const Array& logData, LogDataReply reply);
  void sendMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                  std::uint16_t type, const Value& payload, TextReply reply);
  void updateSharedDataWithDictionary(const Value& sharedData);
  // A null value removes the key.
  void updateSharedDataForKey(const std::string& key, const Value& value);
  // None clears the key; an empty key is a key.
  void setDigestKey(const std::optional<Bytes>& key, std::int32_t algorithm);
  // The device's persistent identifier that respects (or overrides) the user's
  // diagnostics-sharing choice; with `regenerate` a new one is stored first. The client
  // class's identifier operations ask for it on a connection of their own.
  void persistentIdentifierForDNU(bool respect, bool regenerate, TextReply reply);

  // ---- Lifecycle ----
  // Closes the connection; the agent then removes the session. Any thread.
  void invalidate();
  // The same, telling the client first why the daemon ends its session (the reason
  // travels in the connection's refusal, see IpcConnection::refuse). Any thread.
  void refuse(const std::string& reason);
  // Runs the teardown once, on the queue, after the work already queued. Any thread;
  // later calls do nothing.
  void scheduleTeardown();
  bool isTornDown() const { return tornDown_.load(); }

  // ---- Message path ----
  // sendMessageWithDictionary:error: — the send path proper; the error is not set.
  std::optional<std::string> sendMessageWithDictionary(const Value& message, TelvaneError* error);
  // The session's own start and end messages; the timestamp is not used (the send
  // path takes its own).
  void internalSendMessage(const Value& payload, TimeValue timestamp, std::uint16_t method, std::uint16_t respCode);
  void internalFlushMessagesWithCompletion(FlushReply reply);
  void sendOneMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, const Value& storebag,
                                     std::uint16_t category, std::uint16_t type, const Value& payload);
  void uploadFileWithURL(const std::string& fileURL, FileAccessToken& token, UploadReply reply);
  // The sum over the backends; 0 without backends. Any thread.
  std::int64_t batchedEventsSize() const;

  // ---- Backend set ----
  void createBackendsWithStorebag(const Value& section);
  void updateUserInfoForBackends();
  // True when some backend became active (state 2).
  bool updateReportingStates();
  // Takes over the parent's backend states. Any thread; takes the agent lock.
  void syncReportingStates();
  std::optional<Array> fetchReportingStates() const;
  std::optional<Array> fetchWhitelistedEvents() const;
  std::optional<Array> fetchBlacklistedEvents() const;
  // Stamps the hierarchy's identifier chain on the backends. Any thread.
  void updateCombinedSessionID();

  // ---- Health report and aggregation ----
  // Counts the session into the report and returns its batched size.
  static std::uint64_t addSessionHealthInfo(const TelvanedSession& session, Dictionary& healthReport);
  void addSessionsAccumulatedHealthInfoToPayload(Dictionary& payload,
                                                 const std::vector<std::shared_ptr<TelvanedSession>>& sessionList,
                                                 const Value& storebags) const;
  void aggregateMessage(const Value& message, double timestamp, std::uint16_t category, std::uint16_t type,
                        const Value& payload);
  // Hands a message to this session's client over its connection. Any thread.
  void sendToAggregator(const Value& message, double timestamp, std::uint16_t category, std::uint16_t type,
                        const Value& payload);
  // Tells the client that aggregation has ended (once) and stops aggregating. Any thread.
  void shutdownSessionAggregation();

  // ---- Properties (any thread) ----
  std::uint32_t sessionID() const;
  void setSessionID(std::uint32_t sessionID);
  // The session info as stored (null until set); treat as immutable.
  Value sessionInfo() const;
  Value userInfo() const;
  const std::string& sessionIDString() const { return sessionIDString_; }
  std::optional<std::string> storebagVersion() const;
  bool hasAggregator() const;
  bool hasFinishedGracefully() const;
  bool isCounted() const;
  void setCounted(bool counted);
  // The hierarchy map's "token" text; nothing for a standalone session.
  std::optional<std::string> hierarchyToken() const;
  // The integer value of the hierarchy map's "level"; 0 without a map.
  std::int64_t hierarchyLevel() const;
  std::uint32_t connectivityHelperReleaseTimeout() const;
  std::string deviceID() const;
  // A copy of the backend map; nothing before the backends were made.
  std::optional<BackendMap> backends() const;
  std::shared_ptr<TelvaneBackend> backendNamed(const std::string& name) const;
  std::shared_ptr<ReportingSessionConnectivityHelper> connectivityHelper() const;
  // "<TelvanedSession: session 12, <identifier>>".
  std::string description() const;
  const std::shared_ptr<SerialQueue>& queue() const { return queue_; }
  const SessionEnvironment& environment() const { return environment_; }

 private:
  TelvanedSession(std::shared_ptr<TelvanedSessionDelegate> delegate, std::shared_ptr<IpcConnection> connection,
                  SessionEnvironment environment, std::string sessionIDString);

  void updateUserInfo(const Value& userInfo);
  void releaseUserInfo();
  void receivedUserInfo(const Value& userInfo);
  void updateSessionWithDefaultSessionInfo();
  void sendStartMessage();
  void teardown();
  // Fills the device identifier buffer from the device facts.
  void refreshDeviceID();
  TimeValue now() const;
  std::shared_ptr<TelvanedSessionDelegate> delegate() const;
  void writeMessageLog(const std::string& line) const;

  // Constant after construction.
  const SessionEnvironment environment_;
  const std::shared_ptr<SerialQueue> queue_;
  const std::string sessionIDString_;

  std::atomic<bool> teardownScheduled_{false};
  std::atomic<bool> tornDown_{false};

  // Guarded by mutex_ (a leaf lock, see above).
  mutable std::mutex mutex_;
  std::uint32_t sessionID_ = 0;
  Value sessionInfo_;
  Value userInfo_;
  Value frameworks_;
  std::optional<BackendMap> backends_;
  Value hierarchyDictionary_;
  Value periodicServices_ = Value::dictionary();
  std::shared_ptr<TelvanedSessionDelegate> sessionDelegate_;
  std::optional<std::string> storebagVersion_;
  char deviceid_[kDeviceIDBufferBytes] = {};
  std::shared_ptr<IpcConnection> connection_;
  bool hasAggregator_ = false;
  bool hasFinishedGracefully_ = false;
  std::optional<Bytes> digestKey_;
  std::int32_t digestAlgorithm_ = 0;
  std::shared_ptr<ReportingSessionConnectivityHelper> connectivityHelper_;
  std::uint32_t connectivityHelperReleaseTimeout_ = kDefaultConnectivityHelperReleaseTimeoutSeconds;
  bool counted_ = false;
};

}  // namespace telvane
