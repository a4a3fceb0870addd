// FakeConnectivityHelper: records what a session asks of its shared helper.
#pragma once

#include <mutex>
#include <optional>
#include <vector>

#include "connectivity/ReportingSessionConnectivityHelper.h"

namespace telvane::test {

class FakeConnectivityHelper : public ReportingSessionConnectivityHelper {
 public:
  void activate(std::uint32_t releaseTimeoutSeconds) override {
    std::lock_guard<std::mutex> lock(mutex_);
    activations_.push_back(releaseTimeoutSeconds);
  }
  void setReleaseTimeout(std::uint32_t releaseTimeoutSeconds) override {
    std::lock_guard<std::mutex> lock(mutex_);
    releaseTimeouts_.push_back(releaseTimeoutSeconds);
  }
  void incrementTotalSessionsServedCount() override {
    std::lock_guard<std::mutex> lock(mutex_);
    ++totalSessionsServed_;
  }
  std::string webSessionDescription() const override { return "inactive"; }

  std::vector<std::uint32_t> activations() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return activations_;
  }
  std::vector<std::uint32_t> releaseTimeouts() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return releaseTimeouts_;
  }
  int totalSessionsServed() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return totalSessionsServed_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::uint32_t> activations_;
  std::vector<std::uint32_t> releaseTimeouts_;
  int totalSessionsServed_ = 0;
};

}  // namespace telvane::test
