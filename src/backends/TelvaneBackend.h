// TelvaneBackend: a destination to which a reporting session forwards client events.
//
// This is the interface through which a session (and, for hierarchy synchronisation,
// the agent on behalf of another session) drives its backends: the reporting state,
// the sampling threshold and the category filters set by the server configuration,
// the send, flush and upload operations, and the per-session identity a backend
// stamps on what it sends. The concrete backends (HTTPS post, dashboard, upload,
// platform telemetry) and the factory that turns a storebag entry into one of them
// implement it.
//
// Reporting states: 0 pending (user information required but missing), 1 disabled,
// 2 enabled, 3 deferred (sampled out but kept by the sampling override). A backend
// counts as active in state 2.
//
// Ownership: a session owns its backends (std::shared_ptr); `cleanup` is called before
// the session lets them go. The connectivity delegate is never owned by a backend.
//
// Threading: every operation may be called from any thread. A session calls its own
// backends on its queue, but a parent's `updateDownstreamSessions` reaches a child's
// backends (state, sampling threshold, correlated identifier) from the parent's
// queue, and the health report of any ending session reads `batchedEventsSize` of all
// sessions. Implementations synchronise themselves: `state` is read synchronously and
// written asynchronously on the backend's serial state queue, so a read that follows
// a write from the same thread sees it.
#pragma once

#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "telvane/Value.h"
#include "util/TelvaneError.h"

namespace telvane {

// Reporting states of a backend.
inline constexpr std::int32_t kBackendStatePending = 0;
inline constexpr std::int32_t kBackendStateDisabled = 1;
inline constexpr std::int32_t kBackendStateEnabled = 2;
inline constexpr std::int32_t kBackendStateDeferred = 3;

// Message flags of the send operation.
inline constexpr std::uint32_t kMessageFlagOrdinary = 0;
inline constexpr std::uint32_t kMessageFlagRealtime = 1;
inline constexpr std::uint32_t kMessageFlagPromote = 2;
inline constexpr std::uint32_t kMessageFlagRealtimeAndPromote = 3;
inline constexpr std::uint32_t kMessageFlagHealthReport = 4;

// A wall-clock time of whole seconds and microseconds since 1970.
struct TimeValue {
  std::int64_t seconds = 0;
  std::int64_t microseconds = 0;

  // Splits floating seconds (the clock's reading) into seconds and microseconds.
  static TimeValue fromSeconds(double secondsSince1970);
  // Seconds plus microseconds / 1,000,000.
  double toSeconds() const;
  bool operator==(const TimeValue&) const = default;
};

// What a client hands over to let the daemon read one of its files: the opaque token
// text it sent (if any) and the descriptor it opened. The descriptor is borrowed for
// the duration of the call; the session closes it afterwards, so a backend that needs
// it later duplicates it.
struct FileAccessToken {
  std::optional<Bytes> token;
  int descriptor = -1;
  // Set by a backend whose server asked for the file's removal when the daemon could
  // not remove it itself (no right to unlink in the client's folder): the client then
  // removes it.
  bool removalLeftToClient = false;
};

// The exact class of a backend. Some rules apply to the HTTPS post backend itself
// but not to classes derived from it, so a subclass reports its own kind.
enum class BackendKind { HTTPSPost, Dashboard, Upload, Joulemeter, Metrix, Other };

class TelvaneBackend {
 public:
  using FlushCompletion = std::function<void(std::optional<std::string> result, std::optional<TelvaneError> error)>;

  virtual ~TelvaneBackend();

  virtual BackendKind kind() const = 0;
  // The backend name given to the factory (the key of the session's backend map).
  virtual std::string name() const = 0;
  // The server URL shown in status; nothing when the profile has none.
  virtual std::optional<std::string> displayURL() const = 0;

  virtual std::int32_t state() const = 0;
  virtual void setState(std::int32_t state) = 0;
  // Computes the state from the configuration, stores it and returns it.
  virtual std::int32_t updateState() = 0;
  // The server's sampling threshold (a number in [0, 1]), or nothing.
  virtual std::optional<double> samplingThreshold() const = 0;
  virtual void setSamplingThreshold(std::optional<double> threshold) = 0;

  // The categories the server allows or refuses; nothing when it sets no list.
  virtual std::optional<Array> eventWhitelist() const = 0;
  virtual std::optional<Array> eventBlacklist() const = 0;
  // Without a whitelist every category passes; a present but empty whitelist refuses
  // every category. This asymmetry with the blacklist is intended.
  virtual bool isWhitelistedEvent(std::int32_t category) const = 0;
  // Without a blacklist, or with an empty one, no category is refused.
  virtual bool isBlacklistedEvent(std::int32_t category) const = 0;

  // The five-argument send: counts the event and hands it on with its event id. The
  // method carries the category and the respCode the type. Returns the backend's
  // answer, or nothing.
  virtual std::optional<std::string> sendMessage(const Value& blob, TimeValue timestamp, std::uint16_t method,
                                                 std::uint16_t respCode, std::uint32_t flag) = 0;
  // Sends what is batched; the completion (which may be empty) runs once, on any
  // thread.
  virtual void flushMessagesWithCompletion(FlushCompletion completion) = 0;
  // Uploads a client's file. May block the caller until the upload has finished.
  virtual bool uploadFileAtPath(const std::string& path, FileAccessToken& token) = 0;
  virtual bool uploadLogData(const Array& logData) = 0;
  // The memory estimate of the events waiting in batches.
  virtual std::int64_t batchedEventsSize() const = 0;

  // The session's user information (null clears it).
  virtual void setUserInfoDict(const Value& userInfo) = 0;
  // The key of the request digest; none means no digest. A present key counts even
  // when it is empty.
  virtual void setDigestKey(const std::optional<Bytes>& key) = 0;
  virtual void setDigestAlgorithm(std::int32_t algorithm) = 0;
  // The session's own identifier, given when the backend is made.
  virtual void setCombinedSessionIDString(const std::string& identifier) = 0;
  // The dotted identifier chain of the session's hierarchy.
  virtual void setCorrelatedSessionID(const std::string& identifier) = 0;
  // The helper that performs HTTP requests for the session; held weakly.
  virtual void setReportingSessionConnectivityDelegate(
      const std::shared_ptr<ReportingSessionConnectivityHelper>& helper) = 0;

  // Called once before the session lets the backend go.
  virtual void cleanup() = 0;
};

// A session's backends by name. Every walk over the backends goes in this map's order.
using BackendMap = std::map<std::string, std::shared_ptr<TelvaneBackend>>;

}  // namespace telvane
