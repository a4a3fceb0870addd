#include "platform/Clock.h"

namespace telvane {

namespace {

// The real clock: wall time from the system clock, intervals from the steady clock.
class SystemClock final : public Clock {
 public:
  double now() const override {
    return std::chrono::duration<double>(std::chrono::system_clock::now().time_since_epoch()).count();
  }
  std::chrono::steady_clock::time_point steadyNow() const override { return std::chrono::steady_clock::now(); }
};

}  // namespace

std::shared_ptr<Clock> Clock::system() {
  static const std::shared_ptr<Clock> clock = std::make_shared<SystemClock>();
  return clock;
}

}  // namespace telvane
