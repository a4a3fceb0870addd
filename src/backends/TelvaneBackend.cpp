#include "backends/TelvaneBackend.h"

#include <cmath>

#include "util/DeviceInfo.h"

namespace telvane {

namespace {
constexpr double kMicrosecondsPerSecond = 1e6;
}  // namespace

TimeValue TimeValue::fromSeconds(double secondsSince1970) {
  TimeValue time;
  double whole = std::floor(secondsSince1970);
  time.seconds = static_cast<std::int64_t>(whole);
  time.microseconds = static_cast<std::int64_t>((secondsSince1970 - whole) * kMicrosecondsPerSecond);
  if (time.microseconds >= 1000000) time.microseconds = 999999;
  return time;
}

double TimeValue::toSeconds() const { return secondsFromTimeValue(seconds, microseconds); }

TelvaneBackend::~TelvaneBackend() = default;

}  // namespace telvane
