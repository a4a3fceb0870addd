// ScriptedRandom: randomness that answers from a script, then from a counter, so that
// tests can set sampling draws, delays and UUIDs.
#pragma once

#include <deque>
#include <mutex>

#include "platform/Random.h"

namespace telvane::test {

class ScriptedRandom : public Random {
 public:
  // The next uniform() calls answer these values (each taken modulo the bound).
  void pushUniform(std::uint32_t v) {
    std::lock_guard<std::mutex> lock(mutex_);
    uniforms_.push_back(v);
  }
  std::uint32_t uniform(std::uint32_t upperBound) override {
    std::lock_guard<std::mutex> lock(mutex_);
    if (upperBound == 0) return 0;
    std::uint32_t v;
    if (!uniforms_.empty()) {
      v = uniforms_.front();
      uniforms_.pop_front();
    } else {
      v = next_++;
    }
    return v % upperBound;
  }
  void fill(std::uint8_t* data, std::size_t size) override {
    std::lock_guard<std::mutex> lock(mutex_);
    for (std::size_t i = 0; i < size; ++i) data[i] = static_cast<std::uint8_t>(byte_++);
  }

 private:
  std::mutex mutex_;
  std::deque<std::uint32_t> uniforms_;
  std::uint32_t next_ = 0;
  std::uint8_t byte_ = 0;
};

}  // namespace telvane::test
