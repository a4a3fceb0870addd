#include "platform/KeepAlive.h"

#include <cstdlib>
#include <string>

#include "platform/Log.h"

namespace telvane {

std::shared_ptr<IdleExitKeepAlive> IdleExitKeepAlive::create(std::shared_ptr<SerialQueue> queue,
                                                             std::optional<std::chrono::milliseconds> idlePeriod,
                                                             std::function<void()> onIdle) {
  auto keepAlive =
      std::shared_ptr<IdleExitKeepAlive>(new IdleExitKeepAlive(std::move(queue), idlePeriod, std::move(onIdle)));
  std::lock_guard<std::mutex> lock(keepAlive->mutex_);
  keepAlive->armLocked();
  return keepAlive;
}

IdleExitKeepAlive::IdleExitKeepAlive(std::shared_ptr<SerialQueue> queue,
                                     std::optional<std::chrono::milliseconds> idlePeriod,
                                     std::function<void()> onIdle)
    : queue_(std::move(queue)), idlePeriod_(idlePeriod), onIdle_(std::move(onIdle)) {}

IdleExitKeepAlive::~IdleExitKeepAlive() {
  std::lock_guard<std::mutex> lock(mutex_);
  if (timer_) timer_->cancel();
}

void IdleExitKeepAlive::armLocked() {
  if (!idlePeriod_ || fired_) return;
  if (timer_) timer_->cancel();
  std::weak_ptr<IdleExitKeepAlive> weak = weak_from_this();
  timer_ = TimerSource::create(queue_, [weak] {
    auto self = weak.lock();
    if (!self) return;
    {
      std::lock_guard<std::mutex> lock(self->mutex_);
      if (self->open_ > 0 || self->fired_) return;
      self->fired_ = true;
    }
    log::info("main: No IPC transaction for %lld seconds, exiting while idle",
              static_cast<long long>(std::chrono::duration_cast<std::chrono::seconds>(*self->idlePeriod_).count()));
    if (self->onIdle_) self->onIdle_();
  });
  timer_->schedule(*idlePeriod_);
  timer_->resume();
}

void IdleExitKeepAlive::beginTransaction() {
  std::lock_guard<std::mutex> lock(mutex_);
  if (open_++ == 0 && timer_) {
    timer_->cancel();
    timer_.reset();
  }
}

void IdleExitKeepAlive::endTransaction() {
  std::lock_guard<std::mutex> lock(mutex_);
  if (open_ == 0) return;
  if (--open_ == 0) armLocked();
}

int IdleExitKeepAlive::openTransactions() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return open_;
}

std::optional<std::chrono::milliseconds> IdleExitKeepAlive::idlePeriodFromEnvironment(bool socketActivated) {
  if (const char* v = std::getenv("TELVANED_IDLE_EXIT_SECONDS"); v && *v) {
    char* end = nullptr;
    double seconds = std::strtod(v, &end);
    if (end && *end == '\0' && seconds >= 0) {
      if (seconds == 0) return std::nullopt;
      return std::chrono::milliseconds(static_cast<long long>(seconds * 1000));
    }
    log::error("main: ignoring TELVANED_IDLE_EXIT_SECONDS='%s': not a number of seconds", v);
  }
  if (socketActivated) return std::chrono::milliseconds(60'000);
  return std::nullopt;
}

}  // namespace telvane
