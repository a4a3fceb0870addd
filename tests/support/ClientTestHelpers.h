// Small helpers for client-library tests: session-information maps, and waiting for a
// completion with a deadline.
#pragma once

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <memory>
#include <optional>

#include "telvane/TelvaneKeys.h"
#include "telvane/Value.h"

namespace telvane::test {

inline constexpr std::chrono::seconds kClientWaitSeconds{10};

// Session information of a client of the component type, with a session ID.
inline Value clientSessionInfo(long long componentType = 7, long long sessionID = 42) {
  return Value(Dictionary{{kTelvaneSessionInfoClientType, Value(componentType)},
                          {kTelvaneSessionInfoSessionID, Value(sessionID)},
                          {kTelvaneSessionInfoClientVersion, Value("1.0")}});
}

inline Value clientUserInfo(const char* client = "app", const char* service = "svc") {
  return Value(Dictionary{{kTelvaneUserInfoClientName, Value(client)}, {kTelvaneUserInfoServiceName, Value(service)}});
}

// A value delivered once from another thread.
template <typename T>
class Awaited {
 public:
  Awaited() : promise_(std::make_shared<std::promise<T>>()), future_(promise_->get_future()) {}
  // A callable that delivers the value (later calls are ignored).
  auto setter() {
    auto promise = promise_;
    auto done = done_;
    return [promise, done](T value) {
      if (!done->exchange(true)) promise->set_value(std::move(value));
    };
  }
  // The value, or none when it did not come before the deadline.
  std::optional<T> wait(std::chrono::milliseconds timeout = kClientWaitSeconds) {
    if (future_.wait_for(timeout) != std::future_status::ready) return std::nullopt;
    return future_.get();
  }

 private:
  std::shared_ptr<std::promise<T>> promise_;
  std::shared_ptr<std::atomic<bool>> done_ = std::make_shared<std::atomic<bool>>(false);
  std::future<T> future_;
};

}  // namespace telvane::test
