// TelvaneAggregationObject: the object a Telvane client exports to the daemon. An
// aggregating daemon session hands it the messages of its own session and of its
// descendant sessions, and a last message with everything empty and zero when
// aggregation ends.
//
// Without a block the object ignores messages. A block that throws is dropped for
// good: later messages are only logged. The daemon is not told.
//
// Threading: thread-safe; the daemon's calls arrive on the connection queue. The block
// runs outside the object's lock, so it may call back into the client.
#pragma once

#include <cstdint>
#include <mutex>

#include "telvane/Telvane.h"
#include "telvane/Value.h"

namespace telvane {

class TelvaneAggregationObject {
 public:
  explicit TelvaneAggregationObject(Telvane::AggregationBlock aggregationBlock);

  void sendMessageToClient(const Value& message, double timestamp, std::uint16_t category, std::uint16_t type,
                           const Value& payload);

  bool hasAggregationBlock() const;

 private:
  mutable std::mutex mutex_;
  Telvane::AggregationBlock aggregationBlock_;  // guarded by mutex_; empty once disabled
};

}  // namespace telvane
