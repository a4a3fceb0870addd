// libFuzzer entry point: property-list decoding must fail cleanly on any input, and
// whatever decodes must encode again (when it holds no value without a form).
#include <cstddef>
#include <cstdint>

#include "platform/PropertyList.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  auto decoded = telvane::plist::decode(data, size);
  if (decoded.ok()) {
    auto binary = telvane::plist::encodeBinary(decoded.value());
    if (binary.ok()) (void)telvane::plist::decode(binary.value());
    (void)telvane::plist::encodeXml(decoded.value());
  }
  return 0;
}
