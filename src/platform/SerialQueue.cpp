#include "platform/SerialQueue.h"

#include "platform/Log.h"

#include <asio/post.hpp>
#include <asio/steady_timer.hpp>

#include <algorithm>
#include <cstdlib>
#include <vector>

namespace telvane {

namespace {

// The queues whose work the current thread is running, innermost last. More than one
// when that work called sync() into another queue.
thread_local std::vector<const SerialQueue*> tRunningQueues;

class RunningScope {
 public:
  explicit RunningScope(const SerialQueue* queue) { tRunningQueues.push_back(queue); }
  ~RunningScope() { tRunningQueues.pop_back(); }
  RunningScope(const RunningScope&) = delete;
  RunningScope& operator=(const RunningScope&) = delete;
};

}  // namespace

// The work posted to the executor to run the queue. Owns a reference to the queue; if
// the executor is destroyed before running it, the queue's waiting work is dropped so
// that work holding the queue does not keep it (and itself) alive for ever.
class SerialQueue::DrainTask {
 public:
  explicit DrainTask(std::shared_ptr<SerialQueue> queue) : queue_(std::move(queue)) {}
  DrainTask(DrainTask&& other) noexcept : queue_(std::move(other.queue_)) {}
  DrainTask& operator=(DrainTask&&) = delete;
  ~DrainTask() {
    if (queue_) queue_->abandon();
  }
  void operator()() {
    std::shared_ptr<SerialQueue> queue = std::move(queue_);
    queue->drain();
  }

 private:
  std::shared_ptr<SerialQueue> queue_;  // null once run or moved from
};

SerialQueue::SerialQueue(std::string label, Executor& executor) : label_(std::move(label)), executor_(executor) {}

std::shared_ptr<SerialQueue> SerialQueue::create(std::string label) {
  return create(std::move(label), Executors::main());
}

std::shared_ptr<SerialQueue> SerialQueue::create(std::string label, Executor& executor) {
  return std::shared_ptr<SerialQueue>(new SerialQueue(std::move(label), executor));
}

bool SerialQueue::isCurrent() const {
  return std::find(tRunningQueues.begin(), tRunningQueues.end(), this) != tRunningQueues.end();
}

void SerialQueue::async(std::function<void()> work) {
  std::lock_guard<std::mutex> lock(mutex_);
  items_.push_back(std::move(work));
  if (state_ == State::Idle) scheduleLocked();
}

void SerialQueue::scheduleLocked() {
  state_ = State::Scheduled;
  // The posted drain keeps the queue alive until its work has run.
  asio::post(executor_.context(), DrainTask(shared_from_this()));
}

void SerialQueue::abandon() {
  std::deque<std::function<void()>> dropped;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    // Only the drain in charge drops work; a thread running the queue keeps it.
    if (state_ != State::Scheduled) return;
    dropped.swap(items_);
    state_ = State::Idle;
    changed_.notify_all();
  }
  // Destroyed here, outside the lock: their destructors may submit work again.
}

void SerialQueue::drain() {
  std::unique_lock<std::mutex> lock(mutex_);
  // A sync() caller may have taken the queue since this drain was posted.
  if (state_ != State::Scheduled) return;
  state_ = State::Running;
  RunningScope scope(this);
  for (int ran = 0;; ++ran) {
    if (items_.empty()) {
      state_ = State::Idle;
      changed_.notify_all();
      return;
    }
    if (ran == kBatchSize) {
      // Let other queues' work in; a waiting sync() caller may take over meanwhile.
      scheduleLocked();
      changed_.notify_all();
      return;
    }
    std::function<void()> item = std::move(items_.front());
    items_.pop_front();
    lock.unlock();
    item();
    item = nullptr;  // its captures go before the next item runs, outside the lock
    lock.lock();
  }
}

void SerialQueue::sync(const std::function<void()>& work) {
#ifndef NDEBUG
  detail::checkNotOnQueue(*this, "sync");
#endif
  std::unique_lock<std::mutex> lock(mutex_);
  if (state_ == State::Idle) {
    // Nothing waits and nobody runs: run it here.
    state_ = State::Running;
    lock.unlock();
    {
      RunningScope scope(this);
      work();
    }
    lock.lock();
  } else {
    bool done = false;
    items_.push_back([this, &work, &done] {
      work();
      // Under the lock: once it is released the caller may return and end the life
      // of everything referenced here.
      std::lock_guard<std::mutex> doneLock(mutex_);
      done = true;
      changed_.notify_all();
    });
    // Wait while another thread runs the queue; take the queue over as soon as it
    // only waits for a worker, and run up to and including this work here.
    while (!done && state_ == State::Running) changed_.wait(lock);
    if (done) return;
    state_ = State::Running;
    lock.unlock();
    runUntil(done);
    lock.lock();
  }
  if (items_.empty()) {
    state_ = State::Idle;
  } else {
    scheduleLocked();
  }
  changed_.notify_all();
}

void SerialQueue::runUntil(const bool& done) {
  RunningScope scope(this);
  std::unique_lock<std::mutex> lock(mutex_);
  // The work runs out before this caller's only if the executor is being destroyed
  // and dropped it (see abandon()).
  while (!done && !items_.empty()) {
    std::function<void()> item = std::move(items_.front());
    items_.pop_front();
    lock.unlock();
    item();
    item = nullptr;
    lock.lock();
  }
}

void SerialQueue::after(std::chrono::milliseconds delay, std::function<void()> work) {
  // The pending wait owns its timer and the queue, so both may lose their owners
  // before it fires.
  auto timer = std::make_shared<asio::steady_timer>(executor_.context(), delay);
  timer->async_wait(
      [timer, self = shared_from_this(), work = std::move(work)](const std::error_code& error) mutable {
        if (!error) self->async(std::move(work));
      });
}

namespace detail {

void checkOnQueue(const SerialQueue& queue, const char* file, int line, const char* function) {
  if (queue.isCurrent()) return;
  log::error("assertOnQueue: %s:%d %s() does not run on queue %s", file, line, function, queue.label());
  std::abort();
}

void checkNotOnQueue(const SerialQueue& queue, const char* what) {
  if (!queue.isCurrent()) return;
  log::error("SerialQueue %s: %s called on the queue itself would wait for ever", queue.label(), what);
  std::abort();
}

}  // namespace detail

}  // namespace telvane
