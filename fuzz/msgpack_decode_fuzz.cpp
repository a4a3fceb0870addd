// libFuzzer entry point: MessagePack decoding must fail cleanly on any input, and
// whatever decodes must encode again to bytes that decode to the same description.
#include <cstddef>
#include <cstdint>
#include <cstdlib>
#include <string>

#include "platform/MessagePack.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
  auto decoded = telvane::msgpack_codec::decode(data, size);
  if (!decoded.ok()) return 0;
  std::string again;
  if (!telvane::msgpack_codec::encode(decoded.value(), again)) std::abort();
  auto twice = telvane::msgpack_codec::decode(again);
  if (!twice.ok() || twice.value().description() != decoded.value().description()) std::abort();
  return 0;
}
