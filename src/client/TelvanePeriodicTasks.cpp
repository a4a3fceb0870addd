// The periodic metrics tasks of a Telvane object: module registration, the log timer
// and its ticks. The public functions forward to the Impl, whose periodic state lives
// on the reporting queue (see TelvaneImpl.h).
#include <exception>
#include <utility>

#include "client/PeriodicTaskRun.h"
#include "client/TelvaneImpl.h"
#include "client/UpdateAndReportServices.h"
#include "platform/Log.h"
#include "telvane/TelvaneKeys.h"

namespace telvane {

namespace {

// The flag of the event that carries the merged contributions: sent at once.
constexpr int kRealtimeEventFlag = 1;

// Runs a module's block with a fresh dictionary. A block that throws contributes
// nothing (its dictionary is dropped); false then.
bool runServiceBlock(std::uint32_t module, const UpdateAndReportServices& service, Value& dictionary) {
  try {
    service.block()(dictionary);
    return true;
  } catch (const std::exception& exception) {
    log::error("periodic task of module %u threw: %s", module, exception.what());
  } catch (...) {
    log::error("periodic task of module %u threw", module);
  }
  return false;
}

}  // namespace

// ---- Telvane ----

bool Telvane::registerPeriodicTaskForModule(std::uint32_t module, bool needToUpdate, bool needToReport,
                                            PeriodicServiceBlock serviceBlock) {
  return impl_->registerPeriodicTaskForModule(module, needToUpdate, needToReport, std::move(serviceBlock));
}

bool Telvane::unregisterPeriodTaskForModule(std::uint32_t module) {
  return impl_->unregisterPeriodTaskForModule(module);
}

void Telvane::startLogTimerWithInterval(std::uint32_t intervalSeconds, std::uint32_t reportingMultiplier,
                                        std::uint16_t category, std::uint16_t type) {
  impl_->startLogTimerWithInterval(intervalSeconds, reportingMultiplier, category, type);
}

void Telvane::stopLogTimer() { impl_->stopLogTimer(); }

// ---- Telvane::Impl ----

bool Telvane::Impl::registerPeriodicTaskForModule(std::uint32_t module, bool needToUpdate, bool needToReport,
                                                  PeriodicServiceBlock serviceBlock) {
  auto service = UpdateAndReportServices::create(needToUpdate, needToReport, std::move(serviceBlock));
  if (!service) return false;
  reportingQueue_->async([self = shared_from_this(), module, service = std::move(service)] {
    // A second registration of the number replaces the first.
    self->periodicServiceDict_[module] = service;
    log::info("registerPeriodicTaskForModule: %u,%s update,%s reporting", module, service->update() ? "" : " no",
              service->report() ? "" : " no");
  });
  return true;
}

bool Telvane::Impl::unregisterPeriodTaskForModule(std::uint32_t module) {
  bool removed = false;
  // Waits for a tick in progress, which occupies the reporting queue.
  reportingQueue_->sync([this, module, &removed] {
    if (periodicServiceDict_.erase(module) > 0) {
      log::info("unregisterPeriodTaskForModule: %u removed", module);
      removed = true;
    } else {
      log::info("unregisterPeriodTaskForModule: %u doesn't exist", module);
    }
  });
  return removed;
}

void Telvane::Impl::startLogTimerWithInterval(std::uint32_t intervalSeconds, std::uint32_t reportingMultiplier,
                                              std::uint16_t category, std::uint16_t type) {
  reportingQueue_->async([self = shared_from_this(), intervalSeconds, reportingMultiplier, category, type] {
    if (self->timer_) return;
    // The timer holds the Impl weakly: the Impl owns the timer.
    self->timer_ = TimerSource::create(self->reportingQueue_, [weak = self->weak_from_this()] {
      if (auto impl = weak.lock()) impl->logTimerFired();
    });
    self->counter_ = 0;
    // Each firing hands the tick the interval in nanoseconds, which the tick reads as
    // seconds: the ticks of the log timer wait for their modules practically for ever.
    self->logTimerTick_ = LogTimerTick{category, type, reportingMultiplier,
                                       static_cast<std::uint64_t>(intervalSeconds) * 1'000'000'000ULL};
    // The first firing comes at once, then one every interval. The leeway of 100 ms
    // that lets other systems batch wake-ups has no counterpart here: the timer fires
    // on time.
    self->timer_->schedule(std::chrono::milliseconds(0), std::chrono::seconds(intervalSeconds));
    self->timer_->resume();
    log::info("startLogTimerWithInterval: %d, %d", intervalSeconds, reportingMultiplier);
  });
}

void Telvane::Impl::stopLogTimer() {
  reportingQueue_->async([self = shared_from_this()] {
    if (!self->timer_) {
      log::info("stopLogTimer: No timer is present.");
      return;
    }
    self->timer_->cancel();
    self->timer_.reset();
    self->counter_ = 0;
    log::info("stopLogTimer.");
  });
}

void Telvane::Impl::logTimerFired() {
  assertOnQueue(reportingQueue_);
  {
    std::lock_guard<std::mutex> lock(periodicRunMutex_);
    if (periodicCutOff_) return;
  }
  const LogTimerTick tick = logTimerTick_;
  myPeriodicTask(tick.category, tick.type, tick.intervalMultiplier, tick.updateTimeout);
}

void Telvane::Impl::myPeriodicTask(std::uint16_t category, std::uint16_t type, std::uint32_t intervalMultiplier,
                                   std::uint64_t updateTimeoutSeconds) {
  assertOnQueue(reportingQueue_);
  ++counter_;
  log::info("_myPeriodicTask: Started RT periodic task");
  const std::int64_t waitNanoseconds = periodicTaskWaitNanoseconds(updateTimeoutSeconds);
  auto run = std::make_shared<PeriodicTaskRun>();
  {
    std::lock_guard<std::mutex> lock(periodicRunMutex_);
    runningPeriodicTask_ = run;
    // A firing that came just before teardown is bounded like a tick already running.
    if (periodicCutOff_) run->cutOffAt(*periodicCutOff_);
  }
  if (counter_ != intervalMultiplier) {
    // The counter keeps its value: the report tick comes when it reaches the multiplier.
    runPeriodicUpdates(run, waitNanoseconds);
  } else {
    runPeriodicReports(run, waitNanoseconds, category, type);
    counter_ = 0;
  }
  std::lock_guard<std::mutex> lock(periodicRunMutex_);
  runningPeriodicTask_.reset();
}

void Telvane::Impl::runPeriodicUpdates(const std::shared_ptr<PeriodicTaskRun>& run, std::int64_t waitNanoseconds) {
  for (const auto& [module, service] : periodicServiceDict_) {
    if (!service->update()) continue;
    if (!run->acquireSlot(PeriodicTaskRun::deadlineAfter(waitNanoseconds))) {
      log::info("_myPeriodicTask: Timeout scheduling RT metrics update tasks");
      break;
    }
    run->enter();
    reportingPeriodicTasksQueue_->async([run, module = module, service = service] {
      // What a module keeps from an update is its own business; the dictionary goes.
      Value dictionary = Value::dictionary();
      runServiceBlock(module, *service, dictionary);
      run->releaseSlot();
      run->leave();
    });
  }
  if (!run->waitForTasks(PeriodicTaskRun::deadlineAfter(waitNanoseconds))) {
    log::error("_myPeriodicTask: Timeout during RT metrics update");
  }
  log::info("_myPeriodicTask: Finished RT updates for all registered modules.");
}

void Telvane::Impl::runPeriodicReports(const std::shared_ptr<PeriodicTaskRun>& run, std::int64_t waitNanoseconds,
                                       std::uint16_t category, std::uint16_t type) {
  // The registry is ordered by module number, so modules are scheduled in ascending order.
  for (const auto& [module, service] : periodicServiceDict_) {
    if (!service->report()) continue;
    if (!run->acquireSlot(PeriodicTaskRun::deadlineAfter(waitNanoseconds))) {
      log::info("_myPeriodicTask: Timeout scheduling RT metrics report tasks");
      break;
    }
    run->enter();
    reportingPeriodicTasksQueue_->async([run, module = module, service = service] {
      Value dictionary = Value::dictionary();
      // Contributions merge in the order their blocks finish.
      if (runServiceBlock(module, *service, dictionary)) run->merge(dictionary);
      run->releaseSlot();
      run->leave();
    });
  }
  if (!run->waitForTasks(PeriodicTaskRun::deadlineAfter(waitNanoseconds))) {
    // A module that finishes later merges into a result that is gone by then.
    log::info("_myPeriodicTask: Timeout during periodic tasks metrics collection. Not all stats will be reported");
  } else {
    log::info("_myPeriodicTask: All RT metrics collected");
  }
  run->withResult([&](const Dictionary& result) {
    if (result.empty()) return;
    log::info("_myPeriodicTask: Sent realtime event after collection all RT metrics");
    Value message(Dictionary{{kTelvaneMessageParametersFlag, Value(kRealtimeEventFlag)},
                             {kTelvaneMessageParametersCategory, Value(static_cast<unsigned>(category))},
                             {kTelvaneMessageParametersType, Value(static_cast<unsigned>(type))},
                             {kTelvaneMessageParametersPayload, Value(result)}});
    // Through the object's own send, so that the local white- and blacklist apply.
    sendMessageWithDictionary(message, nullptr);
  });
  log::info("_myPeriodicTask: Finished RT metrics collection");
}

void Telvane::Impl::stopPeriodicTasks() {
  {
    std::lock_guard<std::mutex> lock(periodicRunMutex_);
    if (!periodicCutOff_) periodicCutOff_ = PeriodicTaskRun::Clock::now() + kPeriodicTaskTeardownWaitMs;
    if (runningPeriodicTask_) runningPeriodicTask_->cutOffAt(*periodicCutOff_);
  }
  auto cancelTimer = [self = shared_from_this()] {
    if (!self->timer_) return;
    self->timer_->cancel();
    self->timer_.reset();
  };
  // Firings already queued find the periodic tasks stopped and do nothing.
  if (reportingQueue_->isCurrent()) {
    cancelTimer();
  } else {
    reportingQueue_->async(std::move(cancelTimer));
  }
}

void Telvane::Impl::fireLogTimerForTesting() {
  reportingQueue_->async([self = shared_from_this()] {
    if (self->timer_) self->logTimerFired();
  });
}

std::uint32_t Telvane::Impl::periodicTaskCounterForTesting() {
  std::uint32_t counter = 0;
  reportingQueue_->sync([this, &counter] { counter = counter_; });
  return counter;
}

std::shared_ptr<PeriodicTaskRun> Telvane::Impl::runningPeriodicTaskForTesting() const {
  std::lock_guard<std::mutex> lock(periodicRunMutex_);
  return runningPeriodicTask_;
}

}  // namespace telvane
