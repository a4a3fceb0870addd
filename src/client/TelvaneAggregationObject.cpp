#include "client/TelvaneAggregationObject.h"

#include "platform/Log.h"

namespace telvane {

TelvaneAggregationObject::TelvaneAggregationObject(Telvane::AggregationBlock aggregationBlock)
    : aggregationBlock_(std::move(aggregationBlock)) {}

bool TelvaneAggregationObject::hasAggregationBlock() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return static_cast<bool>(aggregationBlock_);
}

void TelvaneAggregationObject::sendMessageToClient(const Value& message, double timestamp, std::uint16_t category,
                                                   std::uint16_t type, const Value& payload) {
  log::info("sendMessageToClient: %u, %u", static_cast<unsigned>(category), static_cast<unsigned>(type));
  Telvane::AggregationBlock block;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    block = aggregationBlock_;
  }
  if (!block) return;
  try {
    block(message, timestamp, category, type, payload);
  } catch (...) {
    log::error("sendMessageToClient: Exception during invocation of aggregation block. Disabling aggregation");
    std::lock_guard<std::mutex> lock(mutex_);
    aggregationBlock_ = nullptr;
  }
}

}  // namespace telvane
