// TelvaneBackendBase: the common base of every backend (TelvaneBackendFactory makes
// the concrete ones from storebag entries).
//
// It holds the per-session identity that a backend stamps on what it sends (session
// number, component, client version, device and build facts, user information), the
// sampling and filtering settings of the server configuration, a running event
// counter, the byte counters of what was posted, and the reporting state behind the
// backend's private serial state queue. The base behaviour of every operation is
// deliberately plain (state 2, nothing sent, flushes complete at once with nothing);
// the concrete backends override what they do.
//
// Ownership: the session owns its backends through std::shared_ptr; the connectivity
// delegate is held weakly and never owned.
//
// Threading:
// - `state` lives on the state queue: `state()` reads it synchronously there and
//   `setState()` writes it asynchronously, so a read that follows a write from the
//   same thread sees it. Neither may be called from the state queue itself.
// - The identity and settings below are guarded by settingsMutex_. Work on the state
//   queue may take settingsMutex_; code holding settingsMutex_ never waits for the
//   state queue (lock order: state queue, then settingsMutex_).
// - The event id and the byte counters are atomics (post completions run on the
//   connectivity helper's queue).
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>

#include "backends/BackendPlatform.h"
#include "backends/TelvaneBackend.h"
#include "platform/SerialQueue.h"
#include "telvane/Value.h"

namespace telvane {

class TelvaneBackendBase : public TelvaneBackend {
 public:
  static constexpr const char* kStateQueueLabel = "com.zembra.TelvaneBackendStateQueue";
  // The sampling draw is an integer below this, divided by it: four decimal places,
  // never 1.0.
  static constexpr std::uint32_t kSamplingDrawRange = 10000;

  // initWithName:profile:productFamily: of the base class (a backend that sends
  // nothing). The platform is resolved with its system defaults.
  static std::shared_ptr<TelvaneBackendBase> create(const std::string& name, const Value& profile,
                                                    const std::optional<std::string>& productFamily,
                                                    const BackendPlatform& platform = {});
  ~TelvaneBackendBase() override;

  // The SHA-256 digest of the text as 64 lower-case hexadecimal digits.
  static std::string convertIntoSHA256(std::string_view text);

  // ---- TelvaneBackend ----
  BackendKind kind() const override { return BackendKind::Other; }
  std::string name() const override { return name_; }
  std::optional<std::string> displayURL() const override;
  std::int32_t state() const override;
  void setState(std::int32_t state) override;
  // The base reporting state is always 2.
  std::int32_t updateState() override;
  std::optional<double> samplingThreshold() const override;
  void setSamplingThreshold(std::optional<double> threshold) override;
  std::optional<Array> eventWhitelist() const override;
  std::optional<Array> eventBlacklist() const override;
  bool isWhitelistedEvent(std::int32_t category) const override;
  bool isBlacklistedEvent(std::int32_t category) const override;
  // The five-argument send: raises the event id by one (wrapping from 65535 to 0) and
  // hands the event to the six-argument send with the new value, so a backend's first
  // event carries id 1.
  std::optional<std::string> sendMessage(const Value& blob, TimeValue timestamp, std::uint16_t method,
                                         std::uint16_t respCode, std::uint32_t flag) override;
  // The base calls the completion at once with no result and no error.
  void flushMessagesWithCompletion(FlushCompletion completion) override;
  bool uploadFileAtPath(const std::string& path, FileAccessToken& token) override;
  bool uploadLogData(const Array& logData) override;
  std::int64_t batchedEventsSize() const override;
  void setUserInfoDict(const Value& userInfo) override;
  void setDigestKey(const std::optional<Bytes>& key) override;
  void setDigestAlgorithm(std::int32_t algorithm) override;
  void setCombinedSessionIDString(const std::string& identifier) override;
  void setCorrelatedSessionID(const std::string& identifier) override;
  void setReportingSessionConnectivityDelegate(
      const std::shared_ptr<ReportingSessionConnectivityHelper>& helper) override;
  void cleanup() override;

  // The six-argument send, which the concrete backends override; the base sends
  // nothing. It overloads the five-argument send on purpose but never overrides it:
  // the five-argument one counts the event, this one carries it out.
  virtual std::optional<std::string> sendMessage(const Value& blob, TimeValue timestamp, std::uint16_t method,
                                                 std::uint16_t respCode, std::uint16_t eventID, std::uint32_t flag);

  // ---- Identity and settings (set by the factory in the order of BackendSettings) ----
  void setSessionID(std::uint32_t sessionID);
  std::uint32_t sessionID() const;
  std::optional<std::string> combinedSessionIDString() const;
  void setCompType(std::int32_t compType);
  std::int32_t compType() const;
  void setClientVersion(std::uint16_t clientVersion);
  std::uint16_t clientVersion() const;
  void setUdid(const std::string& udid);
  std::string udid() const;
  void setDisplayURL(std::optional<std::string> url);
  void setProductVersion(std::optional<std::string> version);
  std::optional<std::string> productVersion() const;
  void setBuildVersion(std::optional<std::string> version);
  std::optional<std::string> buildVersion() const;
  void setHardwareType(std::optional<std::string> hardwareType);
  std::optional<std::string> hardwareType() const;
  const std::optional<std::string>& productFamily() const { return productFamily_; }
  Value userInfoDict() const;
  void setIsInternal(bool internal);
  bool isInternal() const;
  void setRequireUserInfo(bool require);
  bool requireUserInfo() const;
  void setBatchEvents(bool batch);
  bool batchEvents() const;
  void setAllowNestedData(bool allow);
  bool allowNestedData() const;
  void setEventWhitelist(std::optional<Array> list);
  void setEventBlacklist(std::optional<Array> list);
  std::optional<Bytes> digestKey() const;
  std::int32_t digestAlgorithm() const;
  // "major.middle.minor": each present element's integer value cut to 8 bits, missing
  // ones 0.
  void setSelfVersion(const std::string& version);
  std::uint8_t selfVersionMajor() const;
  std::uint8_t selfVersionMiddle() const;
  std::uint8_t selfVersionMinor() const;
  // Stores seconds + microseconds / 1,000,000.
  void setStartTimestamp(TimeValue timestamp);
  double startTimeStamp() const;
  bool shouldUseWiFiOnly() const;
  std::shared_ptr<ReportingSessionConnectivityHelper> reportingSessionConnectivityDelegate() const;

  // ---- Counters ----
  double samplingFactor() const { return samplingFactor_; }
  std::uint16_t eventID() const { return eventID_.load(); }
  // Sets the running event counter (the next event gets the value plus one).
  void setEventID(std::uint16_t eventID) { eventID_.store(eventID); }
  std::uint32_t totalBytesSent() const { return totalBytesSent_.load(); }
  std::uint32_t bytesSentSinceLastReport() const { return bytesSentSinceLastReport_.load(); }

  const Value& profile() const { return profile_; }
  const BackendPlatform& platform() const { return platform_; }
  const std::shared_ptr<SerialQueue>& stateQueue() const { return stateQueue_; }

 protected:
  // What a POST came back with from the connectivity helper.
  struct PostAnswer {
    std::optional<std::string> data;
    std::optional<TelvaneError> error;
  };
  // Hands the request to the helper and blocks the caller until its completion has run
  // (on the helper's queue). Nothing when no answer came within the limit: a helper
  // that is inactive or in another mode never answers, and an unbounded wait would
  // block the caller's queue for good.
  static std::optional<PostAnswer> postAndWait(ReportingSessionConnectivityHelper& helper, HttpRequest request,
                                               std::chrono::milliseconds limit);

  // The state and whatever else a backend keeps on its state queue. Shared with the
  // work queued there, so that work queued asynchronously outlives the backend safely.
  struct QueueState {
    std::int32_t state = kBackendStatePending;
  };

  // initWithName:profile:productFamily:: copies name, profile and product family,
  // draws the sampling factor and creates the state queue. The platform must be
  // resolved.
  TelvaneBackendBase(std::string name, Value profile, std::optional<std::string> productFamily,
                     BackendPlatform platform);

  // The state read on the state queue (also from work running there).
  std::int32_t stateOnQueue() const;
  const std::shared_ptr<QueueState>& queueState() const { return queueState_; }

  // Byte counters: added to after a post is built, read and cleared in one step.
  void addBytesSent(std::uint32_t bytes);
  std::uint32_t takeTotalBytesSent() { return totalBytesSent_.exchange(0); }
  std::uint32_t takeBytesSentSinceLastReport() { return bytesSentSinceLastReport_.exchange(0); }

  bool isWhitelistedEventLocked(std::int32_t category) const;
  bool isBlacklistedEventLocked(std::int32_t category) const;
  // userInfoDict_ is a dictionary (an absent or non-map value counts as none).
  bool hasUserInfoLocked() const { return userInfoDict_.isDictionary(); }

  // Constant after construction.
  const std::string name_;
  const Value profile_;
  const std::optional<std::string> productFamily_;
  const BackendPlatform platform_;
  const double samplingFactor_;
  const std::shared_ptr<SerialQueue> stateQueue_;
  const std::shared_ptr<QueueState> queueState_;

  // Guarded by settingsMutex_.
  mutable std::mutex settingsMutex_;
  std::uint32_t sessionID_ = 0;
  std::optional<std::string> combinedSessionIDString_;
  std::int32_t compType_ = 0;
  std::uint16_t clientVersion_ = 0;
  std::string udid_;
  std::optional<std::string> displayURL_;
  std::optional<std::string> productVersion_;
  std::optional<std::string> buildVersion_;
  std::optional<std::string> hardwareType_;
  Value userInfoDict_;
  bool isInternal_ = false;
  bool requireUserInfo_ = false;
  bool batchEvents_ = false;
  std::optional<double> samplingThreshold_;
  std::optional<Bytes> digestKey_;
  std::int32_t digestAlgorithm_ = 0;
  bool allowNestedData_ = false;
  std::optional<Array> eventWhitelist_;
  std::optional<Array> eventBlacklist_;
  double startTimeStamp_ = 0;
  std::uint8_t selfVersionMajor_ = 0;
  std::uint8_t selfVersionMiddle_ = 0;
  std::uint8_t selfVersionMinor_ = 0;
  bool shouldUseWiFiOnly_ = false;
  std::weak_ptr<ReportingSessionConnectivityHelper> reportingSessionConnectivityDelegate_;

 private:
  std::atomic<std::uint16_t> eventID_{0};
  std::atomic<std::uint32_t> totalBytesSent_{0};
  std::atomic<std::uint32_t> bytesSentSinceLastReport_{0};
};

}  // namespace telvane
