#include "backends/TelvaneBackendBase.h"

#include <future>
#include <utility>

#include "util/PersistentIdentifiers.h"

namespace telvane {

namespace {

double drawSamplingFactor(Random& random) {
  return static_cast<double>(random.uniform(TelvaneBackendBase::kSamplingDrawRange)) /
         static_cast<double>(TelvaneBackendBase::kSamplingDrawRange);
}

bool listHasInteger(const Array& list, std::int64_t value) {
  for (const Value& element : list) {
    if (element.integerValue() == value) return true;
  }
  return false;
}

}  // namespace

std::shared_ptr<TelvaneBackendBase> TelvaneBackendBase::create(const std::string& name, const Value& profile,
                                                               const std::optional<std::string>& productFamily,
                                                               const BackendPlatform& platform) {
  return std::shared_ptr<TelvaneBackendBase>(
      new TelvaneBackendBase(name, profile.copy(), productFamily, platform.withSystemDefaults()));
}

TelvaneBackendBase::TelvaneBackendBase(std::string name, Value profile, std::optional<std::string> productFamily,
                                       BackendPlatform platform)
    : name_(std::move(name)),
      profile_(std::move(profile)),
      productFamily_(std::move(productFamily)),
      platform_(std::move(platform)),
      samplingFactor_(drawSamplingFactor(*platform_.random)),
      stateQueue_(SerialQueue::create(kStateQueueLabel)),
      queueState_(std::make_shared<QueueState>()) {}

TelvaneBackendBase::~TelvaneBackendBase() = default;

std::string TelvaneBackendBase::convertIntoSHA256(std::string_view text) { return telvane::convertIntoSHA256(text); }

// ---- State ----

std::int32_t TelvaneBackendBase::state() const {
  std::int32_t state = kBackendStatePending;
  stateQueue_->sync([&] { state = queueState_->state; });
  return state;
}

std::int32_t TelvaneBackendBase::stateOnQueue() const {
  assertOnQueue(stateQueue_);
  return queueState_->state;
}

void TelvaneBackendBase::setState(std::int32_t state) {
  // The work holds the queue's data, not the backend: it may run after the backend
  // is gone.
  stateQueue_->async([data = queueState_, state] { data->state = state; });
}

std::int32_t TelvaneBackendBase::updateState() {
  setState(kBackendStateEnabled);
  return kBackendStateEnabled;
}

// ---- Sending ----

std::optional<std::string> TelvaneBackendBase::sendMessage(const Value& blob, TimeValue timestamp,
                                                           std::uint16_t method, std::uint16_t respCode,
                                                           std::uint32_t flag) {
  // Unsigned atomics wrap: 65535 + 1 is 0.
  std::uint16_t eventID = static_cast<std::uint16_t>(eventID_.fetch_add(1) + 1);
  return sendMessage(blob, timestamp, method, respCode, eventID, flag);
}

std::optional<std::string> TelvaneBackendBase::sendMessage(const Value& /*blob*/, TimeValue /*timestamp*/,
                                                           std::uint16_t /*method*/, std::uint16_t /*respCode*/,
                                                           std::uint16_t /*eventID*/, std::uint32_t /*flag*/) {
  return std::nullopt;
}

void TelvaneBackendBase::flushMessagesWithCompletion(FlushCompletion completion) {
  if (completion) completion(std::nullopt, std::nullopt);
}

bool TelvaneBackendBase::uploadFileAtPath(const std::string& /*path*/, FileAccessToken& /*token*/) {
  return false;
}

bool TelvaneBackendBase::uploadLogData(const Array& /*logData*/) { return false; }

std::int64_t TelvaneBackendBase::batchedEventsSize() const { return 0; }

void TelvaneBackendBase::cleanup() {}

void TelvaneBackendBase::addBytesSent(std::uint32_t bytes) {
  bytesSentSinceLastReport_.fetch_add(bytes);
  totalBytesSent_.fetch_add(bytes);
}

// ---- Category filters ----

bool TelvaneBackendBase::isWhitelistedEventLocked(std::int32_t category) const {
  // A present but empty whitelist refuses every category; this asymmetry with the
  // blacklist is intended.
  if (!eventWhitelist_) return true;
  return listHasInteger(*eventWhitelist_, category);
}

bool TelvaneBackendBase::isBlacklistedEventLocked(std::int32_t category) const {
  if (!eventBlacklist_ || eventBlacklist_->empty()) return false;
  return listHasInteger(*eventBlacklist_, category);
}

bool TelvaneBackendBase::isWhitelistedEvent(std::int32_t category) const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return isWhitelistedEventLocked(category);
}

bool TelvaneBackendBase::isBlacklistedEvent(std::int32_t category) const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return isBlacklistedEventLocked(category);
}

std::optional<Array> TelvaneBackendBase::eventWhitelist() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return eventWhitelist_;
}

std::optional<Array> TelvaneBackendBase::eventBlacklist() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return eventBlacklist_;
}

void TelvaneBackendBase::setEventWhitelist(std::optional<Array> list) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  eventWhitelist_ = std::move(list);
}

void TelvaneBackendBase::setEventBlacklist(std::optional<Array> list) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  eventBlacklist_ = std::move(list);
}

// ---- Identity and settings ----

std::optional<std::string> TelvaneBackendBase::displayURL() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return displayURL_;
}

void TelvaneBackendBase::setDisplayURL(std::optional<std::string> url) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  displayURL_ = std::move(url);
}

std::optional<double> TelvaneBackendBase::samplingThreshold() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return samplingThreshold_;
}

void TelvaneBackendBase::setSamplingThreshold(std::optional<double> threshold) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  samplingThreshold_ = threshold;
}

void TelvaneBackendBase::setUserInfoDict(const Value& userInfo) {
  // The backend keeps its own map: later changes to the session's do not reach it.
  Value copy = userInfo.copy();
  std::lock_guard<std::mutex> lock(settingsMutex_);
  userInfoDict_ = std::move(copy);
}

Value TelvaneBackendBase::userInfoDict() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return userInfoDict_;
}

void TelvaneBackendBase::setDigestKey(const std::optional<Bytes>& key) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  digestKey_ = key;
}

std::optional<Bytes> TelvaneBackendBase::digestKey() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return digestKey_;
}

void TelvaneBackendBase::setDigestAlgorithm(std::int32_t algorithm) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  digestAlgorithm_ = algorithm;
}

std::int32_t TelvaneBackendBase::digestAlgorithm() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return digestAlgorithm_;
}

void TelvaneBackendBase::setCombinedSessionIDString(const std::string& identifier) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  combinedSessionIDString_ = identifier;
}

void TelvaneBackendBase::setCorrelatedSessionID(const std::string& identifier) {
  setCombinedSessionIDString(identifier);
}

std::optional<std::string> TelvaneBackendBase::combinedSessionIDString() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return combinedSessionIDString_;
}

void TelvaneBackendBase::setReportingSessionConnectivityDelegate(
    const std::shared_ptr<ReportingSessionConnectivityHelper>& helper) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  reportingSessionConnectivityDelegate_ = helper;
}

std::shared_ptr<ReportingSessionConnectivityHelper> TelvaneBackendBase::reportingSessionConnectivityDelegate() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return reportingSessionConnectivityDelegate_.lock();
}

void TelvaneBackendBase::setSessionID(std::uint32_t sessionID) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  sessionID_ = sessionID;
}

std::uint32_t TelvaneBackendBase::sessionID() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return sessionID_;
}

void TelvaneBackendBase::setCompType(std::int32_t compType) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  compType_ = compType;
}

std::int32_t TelvaneBackendBase::compType() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return compType_;
}

void TelvaneBackendBase::setClientVersion(std::uint16_t clientVersion) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  clientVersion_ = clientVersion;
}

std::uint16_t TelvaneBackendBase::clientVersion() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return clientVersion_;
}

void TelvaneBackendBase::setUdid(const std::string& udid) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  udid_ = udid;
}

std::string TelvaneBackendBase::udid() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return udid_;
}

void TelvaneBackendBase::setProductVersion(std::optional<std::string> version) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  productVersion_ = std::move(version);
}

std::optional<std::string> TelvaneBackendBase::productVersion() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return productVersion_;
}

void TelvaneBackendBase::setBuildVersion(std::optional<std::string> version) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  buildVersion_ = std::move(version);
}

std::optional<std::string> TelvaneBackendBase::buildVersion() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return buildVersion_;
}

void TelvaneBackendBase::setHardwareType(std::optional<std::string> hardwareType) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  hardwareType_ = std::move(hardwareType);
}

std::optional<std::string> TelvaneBackendBase::hardwareType() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return hardwareType_;
}

void TelvaneBackendBase::setIsInternal(bool internal) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  isInternal_ = internal;
}

bool TelvaneBackendBase::isInternal() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return isInternal_;
}

void TelvaneBackendBase::setRequireUserInfo(bool require) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  requireUserInfo_ = require;
}

bool TelvaneBackendBase::requireUserInfo() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return requireUserInfo_;
}

void TelvaneBackendBase::setBatchEvents(bool batch) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  batchEvents_ = batch;
}

bool TelvaneBackendBase::batchEvents() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return batchEvents_;
}

void TelvaneBackendBase::setAllowNestedData(bool allow) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  allowNestedData_ = allow;
}

bool TelvaneBackendBase::allowNestedData() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return allowNestedData_;
}

void TelvaneBackendBase::setSelfVersion(const std::string& version) {
  std::uint8_t parts[3] = {0, 0, 0};
  std::size_t index = 0;
  std::size_t start = 0;
  while (index < 3) {
    std::size_t dot = version.find('.', start);
    std::string_view element(version.data() + start,
                             (dot == std::string::npos ? version.size() : dot) - start);
    parts[index++] = static_cast<std::uint8_t>(integerFromText(element));
    if (dot == std::string::npos) break;
    start = dot + 1;
  }
  std::lock_guard<std::mutex> lock(settingsMutex_);
  selfVersionMajor_ = parts[0];
  selfVersionMiddle_ = parts[1];
  selfVersionMinor_ = parts[2];
}

std::uint8_t TelvaneBackendBase::selfVersionMajor() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return selfVersionMajor_;
}

std::uint8_t TelvaneBackendBase::selfVersionMiddle() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return selfVersionMiddle_;
}

std::uint8_t TelvaneBackendBase::selfVersionMinor() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return selfVersionMinor_;
}

void TelvaneBackendBase::setStartTimestamp(TimeValue timestamp) {
  double seconds = timestamp.toSeconds();
  std::lock_guard<std::mutex> lock(settingsMutex_);
  startTimeStamp_ = seconds;
}

double TelvaneBackendBase::startTimeStamp() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return startTimeStamp_;
}

bool TelvaneBackendBase::shouldUseWiFiOnly() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return shouldUseWiFiOnly_;
}

std::optional<TelvaneBackendBase::PostAnswer> TelvaneBackendBase::postAndWait(
    ReportingSessionConnectivityHelper& helper, HttpRequest request, std::chrono::milliseconds limit) {
  auto promise = std::make_shared<std::promise<PostAnswer>>();
  std::future<PostAnswer> future = promise->get_future();
  helper.postURLRequestWithCompletionHandler(
      std::move(request), [promise](std::optional<std::string> data, std::optional<HttpResponse> /*response*/,
                                    std::optional<TelvaneError> error) {
        promise->set_value(PostAnswer{std::move(data), std::move(error)});
      });
  if (future.wait_for(limit) != std::future_status::ready) return std::nullopt;
  return future.get();
}

}  // namespace telvane
