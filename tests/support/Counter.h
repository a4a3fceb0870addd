// Counter: a count that tests raise from any thread and wait on with a deadline.
#pragma once

#include <chrono>
#include <condition_variable>
#include <mutex>

namespace telvane::test {

class Counter {
 public:
  void add() {
    std::lock_guard<std::mutex> lock(mutex_);
    ++count_;
    cv_.notify_all();
  }
  // True once the count has reached n; false when the deadline passed first.
  bool waitFor(int n, std::chrono::milliseconds timeout = std::chrono::seconds(10)) {
    std::unique_lock<std::mutex> lock(mutex_);
    return cv_.wait_for(lock, timeout, [&] { return count_ >= n; });
  }
  int value() {
    std::lock_guard<std::mutex> lock(mutex_);
    return count_;
  }

 private:
  std::mutex mutex_;
  std::condition_variable cv_;
  int count_ = 0;
};

}  // namespace telvane::test
