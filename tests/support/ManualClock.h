// ManualClock: a clock that moves only when a test moves it.
#pragma once

#include <atomic>
#include <chrono>

#include "platform/Clock.h"

namespace telvane::test {

class ManualClock : public Clock {
 public:
  explicit ManualClock(double now = 1'700'000'000.0) : now_(now) {}
  double now() const override { return now_.load(); }
  std::chrono::steady_clock::time_point steadyNow() const override {
    return std::chrono::steady_clock::time_point(
        std::chrono::duration_cast<std::chrono::steady_clock::duration>(std::chrono::duration<double>(now_.load())));
  }
  void set(double now) { now_.store(now); }
  void advance(double seconds) { now_.store(now_.load() + seconds); }

 private:
  std::atomic<double> now_;
};

}  // namespace telvane::test
