// OneShotSender: sends a single event without a session object.
//
// Each send opens a fresh connection to the daemon and calls
// sendMessageWithSessionInfo on it; the connection ends when the daemon's reply has
// arrived (or after kReplyTimeout without one). All of this runs on one process-wide
// serial queue, "com.zembra.Telvane.sendOneMessageQueue", made on first use, which is
// also the queue of the one-shot connections.
//
// Threading: send() may be called from any thread; the reply handler runs on the
// one-shot queue.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>

#include "platform/SerialQueue.h"
#include "telvane/Telvane.h"

namespace telvane {

class OneShotSender {
 public:
  // How long a one-shot connection waits for the daemon's reply before it ends.
  static constexpr std::chrono::seconds kReplyTimeout{30};

  static bool send(const Value& sessionInfo, const Value& userInfo, std::uint16_t category, std::uint16_t type,
                   const Value& payload, Error* error, Telvane::OneShotReply replyHandler);

 private:
  static const std::shared_ptr<SerialQueue>& queue();
};

}  // namespace telvane
