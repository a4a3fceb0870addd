// WaitGroup: counts outstanding pieces of work and lets callers wait for all of them.
//
// enter() before starting a piece of work, leave() when it is done. wait() blocks
// until the count is zero ("wait without a time limit"); waitFor()/waitUntil() give up
// at a deadline and say whether the count reached zero. notify() runs work on a queue
// the next time the count is zero (at once, asynchronously, if it is zero already);
// each notification runs once.
//
// Work that may outlive a timed-out wait must keep the group alive: hold the group in
// a std::shared_ptr and capture that in the work.
//
// Semaphore is the counting semaphore the system's "semaphore" maps to.
//
// Threading: all member functions are thread-safe. leave() without a matching enter()
// is a programmer error (debug builds abort).
#pragma once

#include "platform/SerialQueue.h"

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <functional>
#include <memory>
#include <mutex>
#include <semaphore>
#include <utility>
#include <vector>

namespace telvane {

using Semaphore = std::counting_semaphore<>;

class WaitGroup {
 public:
  WaitGroup() = default;
  WaitGroup(const WaitGroup&) = delete;
  WaitGroup& operator=(const WaitGroup&) = delete;

  void enter();
  void leave();
  std::size_t count() const;

  void wait();
  // True when the count reached zero before the timeout / deadline.
  bool waitFor(std::chrono::milliseconds timeout);
  bool waitUntil(std::chrono::steady_clock::time_point deadline);

  void notify(std::shared_ptr<SerialQueue> queue, std::function<void()> work);

 private:
  using Notification = std::pair<std::shared_ptr<SerialQueue>, std::function<void()>>;

  mutable std::mutex mutex_;
  std::condition_variable zero_;
  std::size_t count_ = 0;                   // guarded by mutex_
  std::vector<Notification> notifications_;  // guarded by mutex_
};

}  // namespace telvane
