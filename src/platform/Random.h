// Random: the source of randomness (sampling draws, delays, UUIDs). Tests inject a
// scripted one; the system one reads the operating system's random source.
// Implementations are thread-safe.
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "telvane/Value.h"

namespace telvane {

class Random {
 public:
  virtual ~Random() = default;
  // A uniformly distributed integer in [0, upperBound); 0 when upperBound is 0.
  virtual std::uint32_t uniform(std::uint32_t upperBound) = 0;
  // Fills the buffer with random bytes.
  virtual void fill(std::uint8_t* data, std::size_t size) = 0;

  // A random (version 4) UUID: 16 raw bytes, and its canonical upper-case text
  // (8-4-4-4-12 hexadecimal digits).
  Bytes uuidBytes();
  std::string uuidString();

  static std::shared_ptr<Random> system();
};

// The canonical upper-case text of 16 UUID bytes; empty for any other length.
std::string uuidText(const Bytes& bytes);

}  // namespace telvane
