// FakeBackend: a backend whose answers a test sets and whose calls it records.
//
// Filters follow the backend base rules (no whitelist: everything passes; an empty
// whitelist refuses everything; no or an empty blacklist refuses nothing). Flushes
// complete at once with the configured result and error, or, when deferred, wait for
// the test to complete them. Thread-safe: sessions of a hierarchy call each other's
// backends from their own queues.
#pragma once

#include <unistd.h>

#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "backends/TelvaneBackend.h"
#include "session/SessionEnvironment.h"

namespace telvane::test {

class FakeBackend : public TelvaneBackend {
 public:
  struct SentMessage {
    Value blob;
    TimeValue timestamp;
    std::uint16_t method = 0;
    std::uint16_t respCode = 0;
    std::uint32_t flag = 0;
  };
  struct Upload {
    std::string path;
    std::optional<Bytes> token;
    // What the descriptor read during the call (empty when none was passed).
    std::string contents;
  };

  explicit FakeBackend(std::string name, BackendKind kind = BackendKind::HTTPSPost)
      : name_(std::move(name)), kind_(kind) {}

  // ---- What the test sets ----
  void setUpdateStateResult(std::int32_t state) { locked([&] { updateStateResult_ = state; }); }
  void setWhitelist(std::optional<Array> list) { locked([&] { whitelist_ = std::move(list); }); }
  void setBlacklist(std::optional<Array> list) { locked([&] { blacklist_ = std::move(list); }); }
  void setSendResult(std::optional<std::string> result) { locked([&] { sendResult_ = std::move(result); }); }
  void setFlushAnswer(std::optional<std::string> result, std::optional<TelvaneError> error) {
    locked([&] {
      flushResult_ = std::move(result);
      flushError_ = std::move(error);
    });
  }
  void setDeferFlush(bool defer) { locked([&] { deferFlush_ = defer; }); }
  void setUploadResult(bool result) { locked([&] { uploadResult_ = result; }); }
  // Whether an upload leaves the file's removal to the client.
  void setUploadLeavesRemovalToClient(bool leave) { locked([&] { uploadLeavesRemoval_ = leave; }); }
  void setLogDataResult(bool result) { locked([&] { logDataResult_ = result; }); }
  void setBatchedSize(std::int64_t size) { locked([&] { batchedSize_ = size; }); }
  void setDisplayURLValue(std::optional<std::string> url) { locked([&] { displayURL_ = std::move(url); }); }

  // Completes the flushes that were deferred, in order.
  void completeDeferredFlushes() {
    std::vector<FlushCompletion> pending;
    std::optional<std::string> result;
    std::optional<TelvaneError> error;
    locked([&] {
      pending.swap(deferred_);
      result = flushResult_;
      error = flushError_;
    });
    for (auto& completion : pending) {
      if (completion) completion(result, error);
    }
  }

  // ---- What the test reads ----
  std::vector<SentMessage> sent() const { return get(sent_); }
  int flushCount() const { return get(flushCount_); }
  std::vector<Upload> uploads() const { return get(uploads_); }
  std::vector<Array> logData() const { return get(logData_); }
  Value userInfoDict() const { return get(userInfo_); }
  int userInfoUpdates() const { return get(userInfoUpdates_); }
  std::optional<Bytes> digestKey() const { return get(digestKey_); }
  std::optional<std::int32_t> digestAlgorithm() const { return get(digestAlgorithm_); }
  std::optional<std::string> combinedSessionIDString() const { return get(combinedSessionIDString_); }
  std::optional<std::string> correlatedSessionID() const { return get(correlatedSessionID_); }
  int connectivityDelegateSets() const { return get(connectivityDelegateSets_); }
  std::shared_ptr<ReportingSessionConnectivityHelper> connectivityDelegate() const { return get(helper_).lock(); }
  int cleanupCount() const { return get(cleanupCount_); }
  int updateStateCount() const { return get(updateStateCount_); }

  // ---- TelvaneBackend ----
  BackendKind kind() const override { return kind_; }
  std::string name() const override { return name_; }
  std::optional<std::string> displayURL() const override { return get(displayURL_); }
  std::int32_t state() const override { return get(state_); }
  void setState(std::int32_t state) override { locked([&] { state_ = state; }); }
  std::int32_t updateState() override {
    std::lock_guard<std::mutex> lock(mutex_);
    ++updateStateCount_;
    state_ = updateStateResult_;
    return state_;
  }
  std::optional<double> samplingThreshold() const override { return get(samplingThreshold_); }
  void setSamplingThreshold(std::optional<double> threshold) override {
    locked([&] { samplingThreshold_ = threshold; });
  }
  std::optional<Array> eventWhitelist() const override { return get(whitelist_); }
  std::optional<Array> eventBlacklist() const override { return get(blacklist_); }
  bool isWhitelistedEvent(std::int32_t category) const override {
    std::lock_guard<std::mutex> lock(mutex_);
    if (!whitelist_) return true;
    for (const Value& v : *whitelist_) {
      if (v.integerValue() == category) return true;
    }
    return false;
  }
  bool isBlacklistedEvent(std::int32_t category) const override {
    std::lock_guard<std::mutex> lock(mutex_);
    if (!blacklist_) return false;
    for (const Value& v : *blacklist_) {
      if (v.integerValue() == category) return true;
    }
    return false;
  }
  std::optional<std::string> sendMessage(const Value& blob, TimeValue timestamp, std::uint16_t method,
                                         std::uint16_t respCode, std::uint32_t flag) override {
    std::lock_guard<std::mutex> lock(mutex_);
    sent_.push_back(SentMessage{blob.deepCopy(), timestamp, method, respCode, flag});
    return sendResult_;
  }
  void flushMessagesWithCompletion(FlushCompletion completion) override {
    std::optional<std::string> result;
    std::optional<TelvaneError> error;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      ++flushCount_;
      if (deferFlush_) {
        deferred_.push_back(std::move(completion));
        return;
      }
      result = flushResult_;
      error = flushError_;
    }
    if (completion) completion(result, error);
  }
  bool uploadFileAtPath(const std::string& path, FileAccessToken& token) override {
    std::string contents;
    if (token.descriptor >= 0) {
      char buffer[4096];
      ssize_t n;
      off_t offset = 0;
      while ((n = ::pread(token.descriptor, buffer, sizeof buffer, offset)) > 0) {
        contents.append(buffer, static_cast<std::size_t>(n));
        offset += n;
      }
    }
    std::lock_guard<std::mutex> lock(mutex_);
    uploads_.push_back(Upload{path, token.token, contents});
    if (uploadLeavesRemoval_) token.removalLeftToClient = true;
    return uploadResult_;
  }
  bool uploadLogData(const Array& logData) override {
    std::lock_guard<std::mutex> lock(mutex_);
    logData_.push_back(logData);
    return logDataResult_;
  }
  std::int64_t batchedEventsSize() const override { return get(batchedSize_); }
  void setUserInfoDict(const Value& userInfo) override {
    locked([&] {
      userInfo_ = userInfo;
      ++userInfoUpdates_;
    });
  }
  void setDigestKey(const std::optional<Bytes>& key) override { locked([&] { digestKey_ = key; }); }
  void setDigestAlgorithm(std::int32_t algorithm) override { locked([&] { digestAlgorithm_ = algorithm; }); }
  void setCombinedSessionIDString(const std::string& identifier) override {
    locked([&] { combinedSessionIDString_ = identifier; });
  }
  void setCorrelatedSessionID(const std::string& identifier) override {
    locked([&] { correlatedSessionID_ = identifier; });
  }
  void setReportingSessionConnectivityDelegate(
      const std::shared_ptr<ReportingSessionConnectivityHelper>& helper) override {
    locked([&] {
      helper_ = helper;
      ++connectivityDelegateSets_;
    });
  }
  void cleanup() override { locked([&] { ++cleanupCount_; }); }

 private:
  template <typename F>
  void locked(F&& f) {
    std::lock_guard<std::mutex> lock(mutex_);
    f();
  }
  template <typename T>
  T get(const T& field) const {
    std::lock_guard<std::mutex> lock(mutex_);
    return field;
  }

  const std::string name_;
  const BackendKind kind_;

  mutable std::mutex mutex_;
  std::int32_t state_ = kBackendStatePending;
  std::int32_t updateStateResult_ = kBackendStateEnabled;
  std::optional<double> samplingThreshold_;
  std::optional<Array> whitelist_;
  std::optional<Array> blacklist_;
  std::optional<std::string> sendResult_;
  std::optional<std::string> flushResult_;
  std::optional<TelvaneError> flushError_;
  bool deferFlush_ = false;
  std::vector<FlushCompletion> deferred_;
  bool uploadResult_ = false;
  bool uploadLeavesRemoval_ = false;
  bool logDataResult_ = false;
  std::int64_t batchedSize_ = 0;
  std::optional<std::string> displayURL_;

  std::vector<SentMessage> sent_;
  int flushCount_ = 0;
  std::vector<Upload> uploads_;
  std::vector<Array> logData_;
  Value userInfo_;
  int userInfoUpdates_ = 0;
  std::optional<Bytes> digestKey_;
  std::optional<std::int32_t> digestAlgorithm_;
  std::optional<std::string> combinedSessionIDString_;
  std::optional<std::string> correlatedSessionID_;
  std::weak_ptr<ReportingSessionConnectivityHelper> helper_;
  int connectivityDelegateSets_ = 0;
  int cleanupCount_ = 0;
  int updateStateCount_ = 0;
};

// A backend factory that yields the given backends (the same objects at each call)
// and counts its calls.
class FakeBackendFactory {
 public:
  void add(std::shared_ptr<FakeBackend> backend) {
    std::lock_guard<std::mutex> lock(mutex_);
    backends_.push_back(std::move(backend));
  }
  int calls() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return calls_;
  }
  Value lastSection() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return lastSection_;
  }

  static BackendFactory make(const std::shared_ptr<FakeBackendFactory>& factory) {
    return [factory](const Value& section, const Value&, const Value&, const std::string&) {
      std::lock_guard<std::mutex> lock(factory->mutex_);
      ++factory->calls_;
      factory->lastSection_ = section;
      BackendMap map;
      for (const auto& backend : factory->backends_) map[backend->name()] = backend;
      return map;
    };
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::shared_ptr<FakeBackend>> backends_;
  int calls_ = 0;
  Value lastSection_;
};

}  // namespace telvane::test
