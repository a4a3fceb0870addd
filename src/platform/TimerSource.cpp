#include "platform/TimerSource.h"
#include "platform/SourceCancellation.h"

#include <asio/bind_executor.hpp>

#include <algorithm>

namespace telvane {

std::shared_ptr<TimerSource> TimerSource::create(std::shared_ptr<SerialQueue> queue, Handler handler) {
  return std::shared_ptr<TimerSource>(new TimerSource(std::move(queue), std::move(handler)));
}

TimerSource::TimerSource(std::shared_ptr<SerialQueue> queue, Handler handler)
    : queue_(std::move(queue)),
      timer_(queue_->executor().context()),
      handler_(std::make_shared<const Handler>(std::move(handler))) {}

// The timer's destructor aborts a pending wait; its completion finds no source behind
// its weak reference and does nothing.
TimerSource::~TimerSource() = default;

void TimerSource::schedule(std::chrono::milliseconds startDelay, std::optional<std::chrono::milliseconds> repeatInterval) {
  std::lock_guard<std::mutex> lock(mutex_);
  startDelay_ = startDelay;
  if (repeatInterval) repeatInterval = std::max(*repeatInterval, kMinimumIntervalMs);
  interval_ = repeatInterval;
  scheduled_ = true;
  armLocked();
}

void TimerSource::setCancelHandler(Handler cancelHandler) {
  std::lock_guard<std::mutex> lock(mutex_);
  if (!canceled_) cancelHandler_ = std::move(cancelHandler);
}

void TimerSource::resume() {
  std::lock_guard<std::mutex> lock(mutex_);
  if (resumed_) return;
  resumed_ = true;
  armLocked();
}

void TimerSource::cancel() {
  Handler cancelHandler;
  std::shared_ptr<const Handler> handler;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (canceled_) return;
    canceled_ = true;
    ++generation_;
    timer_.cancel();
    cancelHandler = std::move(cancelHandler_);
    handler = std::move(handler_);
  }
  detail::runCancelActionOnQueue(*queue_, shared_from_this(), std::move(cancelHandler), std::move(handler));
}

bool TimerSource::isCanceled() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return canceled_;
}

void TimerSource::armLocked() {
  if (!resumed_ || !scheduled_ || canceled_) return;
  ++generation_;
  timer_.expires_after(startDelay_);
  waitLocked(generation_);
}

void TimerSource::waitLocked(std::uint64_t generation) {
  timer_.async_wait(asio::bind_executor(
      queue_->strand(), [weak = weak_from_this(), generation](const std::error_code& error) {
        if (auto self = weak.lock()) self->fired(generation, error);
      }));
}

void TimerSource::fired(std::uint64_t generation, const std::error_code& error) {
  std::shared_ptr<const Handler> handler;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (error || canceled_ || generation != generation_) return;
    handler = handler_;
  }
  if (handler && *handler) (*handler)();

  std::lock_guard<std::mutex> lock(mutex_);
  if (canceled_ || generation != generation_ || !interval_) return;
  // Keep the rhythm of the first firing; periods missed while the queue was busy
  // collapse into the firing just made.
  const auto now = asio::steady_timer::clock_type::now();
  auto next = timer_.expiry() + *interval_;
  if (next <= now) {
    auto missed = (now - timer_.expiry()) / *interval_;
    next = timer_.expiry() + (missed + 1) * *interval_;
  }
  timer_.expires_at(next);
  waitLocked(generation);
}

}  // namespace telvane
