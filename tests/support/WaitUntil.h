// waitUntil: waits for a condition with a deadline, checking it every millisecond.
#pragma once

#include <chrono>
#include <functional>
#include <thread>

namespace telvane::test {

inline constexpr std::chrono::milliseconds kDefaultWaitMs{10000};

// True as soon as the condition holds; false when the deadline passes first.
inline bool waitUntil(const std::function<bool()>& condition, std::chrono::milliseconds timeout = kDefaultWaitMs) {
  auto deadline = std::chrono::steady_clock::now() + timeout;
  while (!condition()) {
    if (std::chrono::steady_clock::now() >= deadline) return condition();
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return true;
}

}  // namespace telvane::test
