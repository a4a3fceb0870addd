// PeriodicTaskRun: what one tick of a Telvane object's periodic metrics tasks shares
// with the module tasks it starts: the four slots that bound how many module blocks
// run at once, the group of started tasks, and (on report ticks) the merged result.
//
// The tick owns a run; each module task holds it too, and nothing else: a task that
// outlives its tick (the tick timed out waiting for it, or the object went away) only
// ever touches the run, never the Telvane object.
//
// Cut-off: when the object goes away during a tick, cutOffAt() bounds every wait of
// the run, those in progress included, by the cut-off time, so that a module block that
// never returns cannot hold the object's teardown for ever. A wait ended by the
// cut-off reports a time-out, like one that reached its own deadline.
//
// Threading: thread-safe. acquireSlot() is called by one thread at a time (the tick).
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <cstdint>
#include <functional>
#include <mutex>
#include <optional>

#include "platform/WaitGroup.h"
#include "telvane/Value.h"

namespace telvane {

// The merge rule of report ticks, for one contribution: a dictionary under a key that
// holds a dictionary adds its entries to it, an array under a key that holds an array
// appends its elements to it, and any other value is set under the key (a later
// contribution wins). Containers are copied into the result before they are changed,
// so a module's own containers never change.
void mergePeriodicContribution(Dictionary& result, const Dictionary& contribution);

// How long each wait of a tick may last, in nanoseconds, for the tick's time-out
// argument: the argument times 10^9 in unsigned 64-bit arithmetic (wrapping), as a
// double, times 0.95, truncated. For an argument in seconds that is 0.95 of it. The
// log timer hands over its interval already in nanoseconds, so its ticks wait
// practically without a limit (years as a rule; the wrapping leaves days at the least
// for intervals up to a day): kept on purpose, a module that hangs holds such a tick
// until the object goes away. Values beyond the signed range give the largest count,
// which deadlineAfter() turns into no limit at all.
std::int64_t periodicTaskWaitNanoseconds(std::uint64_t timeout);

class PeriodicTaskRun {
 public:
  using Clock = std::chrono::steady_clock;
  // The end of a wait; none is a wait without a limit.
  using Deadline = std::optional<Clock::time_point>;

  static constexpr std::ptrdiff_t kMaxConcurrentModules = 4;

  // The deadline `waitNanoseconds` from now (zero or negative: now); none when that
  // lies beyond what the clock can express.
  static Deadline deadlineAfter(std::int64_t waitNanoseconds);

  PeriodicTaskRun() = default;
  PeriodicTaskRun(const PeriodicTaskRun&) = delete;
  PeriodicTaskRun& operator=(const PeriodicTaskRun&) = delete;

  // Takes one of the slots, waiting at most until the deadline (and the cut-off); false
  // when none became free in time.
  bool acquireSlot(Deadline deadline);
  // Gives back a slot taken with acquireSlot().
  void releaseSlot();

  // The group of started tasks: enter() before a task is started, leave() at its end.
  void enter();
  void leave();
  // True when every task that entered has left, waiting at most until the deadline
  // (and the cut-off).
  bool waitForTasks(Deadline deadline);

  // Ends every wait of the run by the given time at the latest. Only the first call
  // counts.
  void cutOffAt(Clock::time_point cutOff);
  bool isCutOff() const;

  // Merges a module's contribution into the result, under the result mutex; a value
  // that is not a dictionary contributes nothing.
  void merge(const Value& contribution);
  // Runs the body with the result, under the result mutex.
  void withResult(const std::function<void(const Dictionary& result)>& body);
  // How many contributions were merged so far.
  std::size_t mergeCount() const;

 private:
  // The earlier of the deadline and the cut-off, if any.
  Deadline effectiveDeadlineLocked(Deadline deadline) const;

  Semaphore slots_{kMaxConcurrentModules};

  mutable std::mutex mutex_;
  std::condition_variable changed_;       // a task left, or the cut-off was set
  std::size_t outstanding_ = 0;           // guarded by mutex_
  std::optional<Clock::time_point> cutOff_;  // guarded by mutex_
  // Permits that cutOffAt() released only to wake a waiting acquireSlot(); they are
  // taken back by the next acquisitions instead of being counted as slots.
  std::size_t wakeUps_ = 0;               // guarded by mutex_

  mutable std::mutex resultMutex_;
  Dictionary result_;              // guarded by resultMutex_
  std::size_t mergeCount_ = 0;     // guarded by resultMutex_
};

}  // namespace telvane
