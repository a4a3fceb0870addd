#include "support/UdpTestCollector.h"

#include <filesystem>

namespace telvane::test {

std::size_t openDescriptorCount() {
  std::size_t count = 0;
  std::error_code error;
  for (auto it = std::filesystem::directory_iterator("/proc/self/fd", error);
       !error && it != std::filesystem::directory_iterator(); it.increment(error)) {
    ++count;
  }
  return count;
}

}  // namespace telvane::test
