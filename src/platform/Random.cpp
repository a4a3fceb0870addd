#include "platform/Random.h"

#include <fcntl.h>
#include <unistd.h>
#include <sys/random.h>

#include <cerrno>
#include <cstdlib>

#include "platform/Log.h"

namespace telvane {

namespace {

// Reads the rest from /dev/urandom: the stand-in for kernels without getrandom(2).
bool readUrandom(std::uint8_t* data, std::size_t size) {
  int fd = ::open("/dev/urandom", O_RDONLY | O_CLOEXEC);
  if (fd < 0) return false;
  std::size_t done = 0;
  while (done < size) {
    ssize_t n = ::read(fd, data + done, size - done);
    if (n > 0) {
      done += static_cast<std::size_t>(n);
    } else if (n < 0 && errno == EINTR) {
      continue;
    } else {
      break;
    }
  }
  ::close(fd);
  return done == size;
}

// Randomness from the kernel (getrandom(2)); /dev/urandom stands in should the system
// call be unavailable. Stateless, so safe from any thread.
class SystemRandom final : public Random {
 public:
  std::uint32_t uniform(std::uint32_t upperBound) override {
    if (upperBound <= 1) return 0;
    // Reject the low values that would make some residues more likely than others:
    // 2^32 mod upperBound of them, computed in 32-bit arithmetic as (-upperBound) mod
    // upperBound.
    const std::uint32_t threshold = static_cast<std::uint32_t>(-upperBound) % upperBound;
    for (;;) {
      std::uint32_t r = 0;
      fill(reinterpret_cast<std::uint8_t*>(&r), sizeof r);
      if (r >= threshold) return r % upperBound;
    }
  }

  void fill(std::uint8_t* data, std::size_t size) override {
    std::size_t done = 0;
    while (done < size) {
      ssize_t n = getrandom(data + done, size - done, 0);
      if (n > 0) {
        done += static_cast<std::size_t>(n);
      } else if (n < 0 && errno == EINTR) {
        continue;
      } else {
        break;
      }
    }
    if (done == size) return;
    // Bytes that are not random would be a silent disaster (identical UUIDs); when
    // neither source works the process cannot go on.
    if (!readUrandom(data + done, size - done)) {
      log::error("no source of random bytes is available");
      std::abort();
    }
  }
};

}  // namespace

std::shared_ptr<Random> Random::system() {
  static const std::shared_ptr<Random> random = std::make_shared<SystemRandom>();
  return random;
}

Bytes Random::uuidBytes() {
  Bytes bytes(16);
  fill(bytes.data(), bytes.size());
  bytes[6] = static_cast<std::uint8_t>((bytes[6] & 0x0F) | 0x40);  // version 4
  bytes[8] = static_cast<std::uint8_t>((bytes[8] & 0x3F) | 0x80);  // RFC 4122 variant
  return bytes;
}

std::string Random::uuidString() { return uuidText(uuidBytes()); }

std::string uuidText(const Bytes& bytes) {
  if (bytes.size() != 16) return {};
  static const char kDigits[] = "0123456789ABCDEF";
  std::string out;
  out.reserve(36);
  for (std::size_t i = 0; i < 16; ++i) {
    if (i == 4 || i == 6 || i == 8 || i == 10) out += '-';
    out += kDigits[bytes[i] >> 4];
    out += kDigits[bytes[i] & 15];
  }
  return out;
}

}  // namespace telvane
