#include "client/PeriodicTaskRun.h"

#include <algorithm>
#include <limits>
#include <utility>

namespace telvane {

void mergePeriodicContribution(Dictionary& result, const Dictionary& contribution) {
  for (const auto& [key, value] : contribution) {
    Value* existing = result.find(key);
    if (existing && value.isDictionary() && existing->isDictionary()) {
      Dictionary* entries = existing->asDictionary();
      for (const auto& [innerKey, innerValue] : *value.asDictionary()) entries->set(innerKey, innerValue);
    } else if (existing && value.isArray() && existing->isArray()) {
      Array* elements = existing->asArray();
      const Array& added = *value.asArray();
      elements->insert(elements->end(), added.begin(), added.end());
    } else {
      // A container of the result is its own, so that merging into it later leaves the
      // module's container as the module made it.
      result.set(key, value.copy());
    }
  }
}

std::int64_t periodicTaskWaitNanoseconds(std::uint64_t timeout) {
  const std::uint64_t nanoseconds = timeout * 1'000'000'000ULL;  // wraps on purpose
  const double scaled = static_cast<double>(nanoseconds) * 0.95;
  // 2^63: converting anything from there on would be undefined.
  if (scaled >= 9223372036854775808.0) return std::numeric_limits<std::int64_t>::max();
  return static_cast<std::int64_t>(scaled);
}

PeriodicTaskRun::Deadline PeriodicTaskRun::deadlineAfter(std::int64_t waitNanoseconds) {
  const Clock::time_point now = Clock::now();
  if (waitNanoseconds <= 0) return now;
  if (waitNanoseconds >= (Clock::time_point::max() - now).count()) return std::nullopt;
  return now + std::chrono::nanoseconds(waitNanoseconds);
}

PeriodicTaskRun::Deadline PeriodicTaskRun::effectiveDeadlineLocked(Deadline deadline) const {
  if (!cutOff_) return deadline;
  if (!deadline) return cutOff_;
  return std::min(*deadline, *cutOff_);
}

bool PeriodicTaskRun::acquireSlot(Deadline deadline) {
  for (;;) {
    Deadline until;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      if (cutOff_ && Clock::now() >= *cutOff_) return false;
      until = effectiveDeadlineLocked(deadline);
    }
    if (until) {
      if (!slots_.try_acquire_until(*until)) return false;
    } else {
      slots_.acquire();
    }
    std::lock_guard<std::mutex> lock(mutex_);
    if (wakeUps_ == 0) return true;
    // The permit was (or stands in for) the one released to wake us: take it back and
    // wait again, now bounded by the cut-off.
    --wakeUps_;
  }
}

void PeriodicTaskRun::releaseSlot() { slots_.release(); }

void PeriodicTaskRun::enter() {
  std::lock_guard<std::mutex> lock(mutex_);
  ++outstanding_;
}

void PeriodicTaskRun::leave() {
  std::lock_guard<std::mutex> lock(mutex_);
  if (outstanding_ > 0 && --outstanding_ == 0) changed_.notify_all();
}

bool PeriodicTaskRun::waitForTasks(Deadline deadline) {
  std::unique_lock<std::mutex> lock(mutex_);
  for (;;) {
    if (outstanding_ == 0) return true;
    // Evaluated again after every wake-up: the cut-off may have come meanwhile.
    const Deadline until = effectiveDeadlineLocked(deadline);
    if (!until) {
      changed_.wait(lock);
    } else {
      if (Clock::now() >= *until) return false;
      changed_.wait_until(lock, *until);
    }
  }
}

void PeriodicTaskRun::cutOffAt(Clock::time_point cutOff) {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (cutOff_) return;
    cutOff_ = cutOff;
    ++wakeUps_;
    changed_.notify_all();
  }
  slots_.release();
}

bool PeriodicTaskRun::isCutOff() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return cutOff_.has_value();
}

void PeriodicTaskRun::merge(const Value& contribution) {
  const Dictionary* entries = contribution.asDictionary();
  std::lock_guard<std::mutex> lock(resultMutex_);
  if (entries) mergePeriodicContribution(result_, *entries);
  ++mergeCount_;
}

void PeriodicTaskRun::withResult(const std::function<void(const Dictionary& result)>& body) {
  std::lock_guard<std::mutex> lock(resultMutex_);
  body(result_);
}

std::size_t PeriodicTaskRun::mergeCount() const {
  std::lock_guard<std::mutex> lock(resultMutex_);
  return mergeCount_;
}

}  // namespace telvane
