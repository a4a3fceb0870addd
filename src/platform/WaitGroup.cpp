#include "platform/WaitGroup.h"

#include <cassert>

namespace telvane {

void WaitGroup::enter() {
  std::lock_guard<std::mutex> lock(mutex_);
  ++count_;
}

void WaitGroup::leave() {
  std::vector<Notification> due;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    assert(count_ > 0 && "WaitGroup::leave without enter");
    if (count_ == 0) return;
    if (--count_ > 0) return;
    due.swap(notifications_);
    // Under the lock: a waiter that returns may destroy the group right away.
    zero_.notify_all();
  }
  for (auto& [queue, work] : due) queue->async(std::move(work));
}

std::size_t WaitGroup::count() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return count_;
}

void WaitGroup::wait() {
  std::unique_lock<std::mutex> lock(mutex_);
  zero_.wait(lock, [this] { return count_ == 0; });
}

bool WaitGroup::waitFor(std::chrono::milliseconds timeout) {
  return waitUntil(std::chrono::steady_clock::now() + timeout);
}

bool WaitGroup::waitUntil(std::chrono::steady_clock::time_point deadline) {
  std::unique_lock<std::mutex> lock(mutex_);
  return zero_.wait_until(lock, deadline, [this] { return count_ == 0; });
}

void WaitGroup::notify(std::shared_ptr<SerialQueue> queue, std::function<void()> work) {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (count_ > 0) {
      notifications_.emplace_back(std::move(queue), std::move(work));
      return;
    }
  }
  queue->async(std::move(work));
}

}  // namespace telvane
