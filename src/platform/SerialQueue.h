// SerialQueue: a labelled serial work queue on an Executor.
//
// Work submitted to one queue runs one item at a time, in submission order; different
// queues on one Executor run in parallel. Asynchronous work runs on the Executor's
// workers. TimerSource, ReadSource and any asio I/O object whose completion handler
// is bound with asio::bind_executor(queue->strand(), handler) deliver through the queue
// too, so a class whose state lives on one queue sees its timer and socket events in
// the same serial order as its other work.
//
// sync() runs the work on the calling thread whenever it can: when the queue is idle,
// or has work waiting that no worker has picked up yet (the caller then runs that
// earlier work first, in order, then its own). It only blocks while another thread is
// running the queue's work. So a task that waits in sync() for another queue never
// needs a second worker, and sessions that each sync() with their backend's queue
// cannot starve a pool of a fixed size.
//
// Ownership: held by std::shared_ptr. Work already submitted keeps the queue alive,
// so it still runs (and nothing crashes) when the queue object's owner is gone by
// then; work that must not run after its owner died captures a weak reference. The
// queue's Executor must outlive it (always true for the process-wide executors).
// After the Executor stops, async work no longer runs; sync() still does.
//
// Threading: every member function may be called from any thread. sync() from the
// queue itself (also from a queue whose work called sync() into this one) is a
// programmer error: debug builds abort with a message, release builds deadlock.
// Entry points of classes that keep their state on a queue check it with
// assertOnQueue(queue).
//
// Delays are std::chrono::milliseconds throughout (seconds convert implicitly:
// `queue->after(std::chrono::seconds(30), ...)`).
#pragma once

#include "platform/Executors.h"

#include <asio/execution.hpp>
#include <asio/execution_context.hpp>

#include <chrono>
#include <condition_variable>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <utility>

namespace telvane {

class SerialQueue : public std::enable_shared_from_this<SerialQueue> {
 public:
  // The queue seen as an asio executor: completion handlers bound to it run as work
  // of the queue (never inline).
  class AsioExecutor {
   public:
    explicit AsioExecutor(std::shared_ptr<SerialQueue> queue) noexcept : queue_(std::move(queue)) {}

    template <typename F>
    void execute(F&& f) const {
      // Completion handlers may be move-only (and asio's wrappers claim to be
      // copyable even then), while queue work is a std::function: share the handler.
      auto shared = std::make_shared<std::decay_t<F>>(std::forward<F>(f));
      queue_->async([shared] { std::move(*shared)(); });
    }
    asio::execution_context& query(asio::execution::context_t) const noexcept {
      return queue_->executor().context();
    }
    static constexpr asio::execution::blocking_t query(asio::execution::blocking_t) noexcept {
      return asio::execution::blocking.never;
    }
    bool running_in_this_thread() const noexcept { return queue_->isCurrent(); }
    const std::shared_ptr<SerialQueue>& queue() const noexcept { return queue_; }

    friend bool operator==(const AsioExecutor& a, const AsioExecutor& b) noexcept { return a.queue_ == b.queue_; }
    friend bool operator!=(const AsioExecutor& a, const AsioExecutor& b) noexcept { return a.queue_ != b.queue_; }

   private:
    std::shared_ptr<SerialQueue> queue_;
  };
  using Strand = AsioExecutor;

  // The most items a worker runs for one queue before it lets other queues' work in.
  static constexpr int kBatchSize = 32;

  // A queue on the process-wide main executor.
  static std::shared_ptr<SerialQueue> create(std::string label);
  // A queue on the given executor, which must outlive it.
  static std::shared_ptr<SerialQueue> create(std::string label, Executor& executor);

  SerialQueue(const SerialQueue&) = delete;
  SerialQueue& operator=(const SerialQueue&) = delete;

  // Runs the work later on the queue; never runs it inline, even from the queue.
  void async(std::function<void()> work);
  // Runs the work on the queue and returns when it has run, so its effects are
  // visible to the caller; see above for the thread it runs on. Must not be called
  // from this queue. Work on queue A that calls B->sync() while B's work calls
  // A->sync() deadlocks too.
  void sync(const std::function<void()>& work);
  // Runs the work on the queue once the delay has passed (zero or negative: as soon as
  // possible, after work already submitted).
  void after(std::chrono::milliseconds delay, std::function<void()> work);

  // True while the calling thread runs work of this queue (also inside a sync() into
  // another queue made from that work).
  bool isCurrent() const;
  const std::string& label() const { return label_; }
  Executor& executor() const { return executor_; }
  // The queue as an asio executor, for asio::bind_executor.
  AsioExecutor strand() const { return AsioExecutor(std::const_pointer_cast<SerialQueue>(shared_from_this())); }

 private:
  // Idle: no work and nobody runs it. Scheduled: a drain is posted to the executor
  // (whoever comes first, that drain or a sync() caller, takes the queue). Running:
  // one thread runs the queue's work.
  enum class State { Idle, Scheduled, Running };
  class DrainTask;

  SerialQueue(std::string label, Executor& executor);
  void drain();
  // The executor is being destroyed with this queue's drain never run: drop the
  // waiting work, whose captures may hold the queue itself.
  void abandon();
  void scheduleLocked();
  void runUntil(const bool& done);

  // Constant after construction.
  const std::string label_;
  Executor& executor_;

  std::mutex mutex_;
  std::condition_variable changed_;              // signalled when a sync item ran or State changed
  std::deque<std::function<void()>> items_;      // guarded by mutex_
  State state_ = State::Idle;                    // guarded by mutex_
};

namespace detail {
// Aborts with a message naming the call site when the caller is not on the queue.
void checkOnQueue(const SerialQueue& queue, const char* file, int line, const char* function);
inline void checkOnQueue(const SerialQueue* queue, const char* file, int line, const char* function) {
  checkOnQueue(*queue, file, line, function);
}
inline void checkOnQueue(const std::shared_ptr<SerialQueue>& queue, const char* file, int line,
                         const char* function) {
  checkOnQueue(*queue, file, line, function);
}
// Aborts when called on the queue: sync() would wait for itself.
void checkNotOnQueue(const SerialQueue& queue, const char* what);
}  // namespace detail

}  // namespace telvane

// In debug builds, aborts unless the caller runs on the queue (a SerialQueue, a pointer
// to one or a shared_ptr to one). Compiles to nothing with NDEBUG.
#ifdef NDEBUG
#define assertOnQueue(queue) ((void)0)
#else
#define assertOnQueue(queue) ::telvane::detail::checkOnQueue((queue), __FILE__, __LINE__, __func__)
#endif
