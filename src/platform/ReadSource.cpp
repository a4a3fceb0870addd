#include "platform/ReadSource.h"

#include "platform/Log.h"
#include "platform/SourceCancellation.h"

#include <asio/bind_executor.hpp>

namespace telvane {

std::shared_ptr<ReadSource> ReadSource::create(std::shared_ptr<SerialQueue> queue, int fd, Handler handler) {
  if (fd < 0) {
    log::error("ReadSource: invalid descriptor %d", fd);
    return nullptr;
  }
  std::shared_ptr<ReadSource> source(new ReadSource(std::move(queue), fd, std::move(handler)));
  std::error_code error;
  {
    std::lock_guard<std::mutex> lock(source->mutex_);
    source->stream_.assign(fd, error);
  }
  if (error) {
    log::error("ReadSource: can't watch descriptor %d: %s", fd, error.message());
    return nullptr;
  }
  return source;
}

ReadSource::ReadSource(std::shared_ptr<SerialQueue> queue, int fd, Handler handler)
    : queue_(std::move(queue)),
      fd_(fd),
      stream_(queue_->executor().context()),
      handler_(std::make_shared<const Handler>(std::move(handler))) {}

ReadSource::~ReadSource() {
  // Give the descriptor back instead of letting the stream object close it.
  std::lock_guard<std::mutex> lock(mutex_);
  if (stream_.is_open()) stream_.release();
}

void ReadSource::setCancelHandler(Handler cancelHandler) {
  std::lock_guard<std::mutex> lock(mutex_);
  if (!canceled_) cancelHandler_ = std::move(cancelHandler);
}

void ReadSource::resume() {
  std::lock_guard<std::mutex> lock(mutex_);
  if (resumed_ || canceled_) return;
  resumed_ = true;
  waitLocked();
}

void ReadSource::cancel() {
  Handler cancelHandler;
  std::shared_ptr<const Handler> handler;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (canceled_) return;
    canceled_ = true;
    // Leaves the event loop now (a pending wait ends as aborted), so the owner may
    // close the descriptor as soon as the cancel action runs.
    if (stream_.is_open()) stream_.release();
    cancelHandler = std::move(cancelHandler_);
    handler = std::move(handler_);
  }
  detail::runCancelActionOnQueue(*queue_, shared_from_this(), std::move(cancelHandler), std::move(handler));
}

bool ReadSource::isCanceled() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return canceled_;
}

void ReadSource::waitLocked() {
  // Starting a wait re-checks readiness, so data left unread by the previous call (or
  // arriving meanwhile) completes it at once.
  stream_.async_wait(asio::posix::stream_descriptor::wait_read,
                     asio::bind_executor(queue_->strand(), [weak = weak_from_this()](const std::error_code& error) {
                       if (auto self = weak.lock()) self->readable(error);
                     }));
}

void ReadSource::readable(const std::error_code& error) {
  std::shared_ptr<const Handler> handler;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (canceled_) return;
    if (error) {
      if (error != asio::error::operation_aborted) {
        log::error("ReadSource: waiting on descriptor %d failed: %s", fd_, error.message());
      }
      return;
    }
    handler = handler_;
  }
  if (handler && *handler) (*handler)();

  std::lock_guard<std::mutex> lock(mutex_);
  if (!canceled_) waitLocked();
}

}  // namespace telvane
