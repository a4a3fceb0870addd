// TimerSource: a one-shot or repeating timer whose handler runs on a serial queue.
//
// Life of a source: create() (suspended) → schedule() → resume() → firings → cancel()
// → the cancel action runs once on the queue. schedule() may come before or after
// resume(); a resumed source without a schedule never fires. Calling schedule() again
// re-arms the timer from now and forgets the old schedule. A repeating timer whose
// firings fall behind (a busy queue) fires once for all the missed periods and then
// keeps its original rhythm.
//
// Cancellation: cancel() may be called from any thread, also from the handler; it is
// idempotent. It stops further firings, then runs the cancel action (set with
// setCancelHandler(), if any) exactly once on the queue, also when the source was never
// resumed; both handlers are released on the queue after that. When cancel() is called
// on the queue, no firing of the handler happens after it returns; from another thread
// a firing that is already running may still finish.
//
// Release without cancel: when the last reference goes without cancel(), the source
// stops silently: no further firing, and the cancel action does NOT run (it could only
// run with its captures outliving the owner that just released the source). Owners
// whose cancel action frees something (a descriptor, a callback owed to somebody)
// cancel explicitly, typically in their destructor or clean-up.
//
// Ownership: held by std::shared_ptr; pending firings hold only a weak reference, the
// cancel action a strong one until it has run. The queue's executor must outlive it.
//
// Threading: all member functions are thread-safe; handlers run on the queue only.
#pragma once

#include "platform/SerialQueue.h"

#include <asio/steady_timer.hpp>

#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>

namespace telvane {

class TimerSource : public std::enable_shared_from_this<TimerSource> {
 public:
  using Handler = std::function<void()>;

  // The shortest repeat interval; shorter ones are raised to it.
  static constexpr std::chrono::milliseconds kMinimumIntervalMs{1};

  // A suspended source on the queue. The handler runs at each firing.
  static std::shared_ptr<TimerSource> create(std::shared_ptr<SerialQueue> queue, Handler handler);
  ~TimerSource();
  TimerSource(const TimerSource&) = delete;
  TimerSource& operator=(const TimerSource&) = delete;

  // First firing `startDelay` from now (zero or negative: at once), then every
  // `repeatInterval` when one is given, else only once.
  void schedule(std::chrono::milliseconds startDelay,
                std::optional<std::chrono::milliseconds> repeatInterval = std::nullopt);
  // The action run once on the queue after cancel(). Ignored after cancel().
  void setCancelHandler(Handler cancelHandler);
  // Starts the source (first call only; later calls do nothing).
  void resume();
  void cancel();
  bool isCanceled() const;

  const std::shared_ptr<SerialQueue>& queue() const { return queue_; }

 private:
  TimerSource(std::shared_ptr<SerialQueue> queue, Handler handler);
  void armLocked();
  void waitLocked(std::uint64_t generation);
  void fired(std::uint64_t generation, const std::error_code& error);

  // Constant after construction.
  const std::shared_ptr<SerialQueue> queue_;

  mutable std::mutex mutex_;
  // Everything below is guarded by mutex_ (the timer object included: asio objects
  // are not safe for concurrent use).
  asio::steady_timer timer_;
  std::shared_ptr<const Handler> handler_;  // shared so that a running firing keeps it
  Handler cancelHandler_;
  std::chrono::milliseconds startDelay_{0};
  std::optional<std::chrono::milliseconds> interval_;
  bool scheduled_ = false;
  bool resumed_ = false;
  bool canceled_ = false;
  // Bumped at each arming: a firing of an older arming that was already on its way
  // when the timer was re-armed or cancelled is dropped.
  std::uint64_t generation_ = 0;
};

}  // namespace telvane
