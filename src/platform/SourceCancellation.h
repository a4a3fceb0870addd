// The common end of a timer or read source: its cancel action runs once on the
// source's queue, and both handlers are released there afterwards, so that whatever
// they capture goes on the queue and after the action.
#pragma once

#include <functional>
#include <memory>
#include <utility>

#include "platform/SerialQueue.h"

namespace telvane::detail {

// `owner` keeps the source alive until the action has run.
inline void runCancelActionOnQueue(SerialQueue& queue, std::shared_ptr<const void> owner,
                                   std::function<void()> cancelHandler,
                                   std::shared_ptr<const std::function<void()>> handler) {
  queue.async([owner = std::move(owner), cancelHandler = std::move(cancelHandler),
               handler = std::move(handler)]() mutable {
    if (cancelHandler) cancelHandler();
    cancelHandler = nullptr;
    handler.reset();
  });
}

}  // namespace telvane::detail
