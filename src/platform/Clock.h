// Clock: the source of time for everything that decides by time (max ages, throttles,
// file ages, time stamps). Tests inject a manual clock; the system clock reads the
// real time. Implementations are thread-safe.
#pragma once

#include <chrono>
#include <memory>

namespace telvane {

class Clock {
 public:
  virtual ~Clock() = default;
  // Wall-clock time in seconds since 1970.
  virtual double now() const = 0;
  // Monotonic time, for intervals.
  virtual std::chrono::steady_clock::time_point steadyNow() const = 0;

  // The process's real clock.
  static std::shared_ptr<Clock> system();
};

}  // namespace telvane
