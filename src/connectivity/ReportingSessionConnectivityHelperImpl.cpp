// The helper's life: creation, activation, usage counting, the release timer,
// invalidation and the hand-back of IPC transactions. Requests live in
// ReportingSessionConnectivityHelperRequests.cpp.
#include "connectivity/ReportingSessionConnectivityHelperImpl.h"

#include "platform/Executors.h"
#include "platform/Log.h"

namespace telvane {
namespace {

std::atomic<std::uint32_t> gTaskCounter{0};

}  // namespace

std::shared_ptr<ReportingSessionConnectivityHelperImpl> ReportingSessionConnectivityHelperImpl::create(
    std::weak_ptr<TelvanedSessionDelegate> delegate, std::int32_t mode, const Value& userInfo) {
  return create(std::move(delegate), mode, userInfo, Options{});
}

std::shared_ptr<ReportingSessionConnectivityHelperImpl> ReportingSessionConnectivityHelperImpl::create(
    std::weak_ptr<TelvanedSessionDelegate> delegate, std::int32_t mode, const Value& userInfo, Options options) {
  return std::shared_ptr<ReportingSessionConnectivityHelperImpl>(
      new ReportingSessionConnectivityHelperImpl(std::move(delegate), mode, userInfo, std::move(options)));
}

ReportingSessionConnectivityHelperImpl::ReportingSessionConnectivityHelperImpl(
    std::weak_ptr<TelvanedSessionDelegate> delegate, std::int32_t mode, const Value& userInfo, Options options)
    : delegate_(std::move(delegate)),
      hasDelegate_(!delegate_.expired()),
      mode_(mode),
      userInfo_(userInfo.copy()),
      options_(options),
      random_(options.random ? options.random : Random::system()),
      stateQueue_(SerialQueue::create(kStateQueueLabel, Executors::network())),
      delegateQueue_(SerialQueue::create(kDelegateQueueLabel, Executors::network())) {
  // The delegate is an object; its "%d" is non-zero when there is one.
  log::info("ReportingSessionConnectivityHelper created with delegate %d", hasDelegate_ ? 1 : 0);
}

ReportingSessionConnectivityHelperImpl::~ReportingSessionConnectivityHelperImpl() {
  // Only the destructor runs now: nothing else can touch the state.
  if (releaseTimer_) {
    releaseTimer_->cancel();
    releaseTimer_.reset();
  }
  if (releaseTimerBlock_) {
    auto queue = releaseTimerQueue_ ? releaseTimerQueue_ : stateQueue_;
    queue->async([block = std::move(releaseTimerBlock_), count = usageCount_] { block(count); });
  }
  log::info("ReportingSessionConnectivityHelper dealloced with ID <%s>", webSessionDescription());
}

std::uint32_t ReportingSessionConnectivityHelperImpl::taskCounter() { return gTaskCounter.load(); }

std::string ReportingSessionConnectivityHelperImpl::createHelperForTask(ConnectivityCompletion completion) {
  char description[32];
  std::snprintf(description, sizeof description, "Task_%08x", ++gTaskCounter);
  tasks_[description] = std::make_shared<ConnectivityHelperTask>(description, std::move(completion));
  log::info("createHelperForTask: created helperTask for task <%s>", description);
  return description;
}

std::chrono::milliseconds ReportingSessionConnectivityHelperImpl::helperSeconds(std::uint64_t seconds) const {
  return std::chrono::milliseconds(static_cast<std::int64_t>(seconds) * options_.secondDuration.count());
}

std::string ReportingSessionConnectivityHelperImpl::webSessionDescription() const {
  std::lock_guard<std::mutex> lock(descriptionMutex_);
  return sessionDescription_.empty() ? "inactive" : sessionDescription_;
}

std::string ReportingSessionConnectivityHelperImpl::description() const {
  return "<ReportingSessionConnectivityHelper: " + webSessionDescription() + ">";
}

// ---- Activation ----

void ReportingSessionConnectivityHelperImpl::activate(std::uint32_t releaseTimeoutSeconds) {
  stateQueue_->async([self = shared_from_this(), releaseTimeoutSeconds] { self->activateOnQueue(releaseTimeoutSeconds); });
}

void ReportingSessionConnectivityHelperImpl::activateOnQueue(std::uint32_t releaseTimeoutSeconds) {
  assertOnQueue(stateQueue_);
  releaseTimeout_ = releaseTimeoutSeconds;
  if (isActive_) {
    log::info("activate: connectivity helper is already active for WebSession with ID <%s>", webSessionDescription());
    return;
  }
  // Every mode's session gets a new UUID: the background configurations (mode & 3) as
  // their identifier, the default ones as their description.
  privateURLSession_ = HttpSession::create(delegateQueue_);
  {
    std::lock_guard<std::mutex> lock(descriptionMutex_);
    sessionDescription_ = random_->uuidString();
  }
  tasks_.clear();
  isActive_ = true;
  log::info("WebSession created and activated with ID <%s>, delegate %d", webSessionDescription(), hasDelegate_ ? 1 : 0);
}

void ReportingSessionConnectivityHelperImpl::setReleaseTimeout(std::uint32_t releaseTimeoutSeconds) {
  stateQueue_->async([self = shared_from_this(), releaseTimeoutSeconds] { self->releaseTimeout_ = releaseTimeoutSeconds; });
}

// ---- Usage counting and release ----

void ReportingSessionConnectivityHelperImpl::incrementTotalSessionsServedCount() {
  ++totalSessionsServedCount_;
  log::info("Total Sessions Served Count is incremented for WebSession with ID <%s>", webSessionDescription());
}

void ReportingSessionConnectivityHelperImpl::ownerIncrementUsageCount() {
  stateQueue_->async([self = shared_from_this()] {
    ++self->usageCount_;
    self->stopConnectivityHelperReleaseTimer();
    log::info(
        "ownerIncrementUsageCount: connectivity helper incremented usage count for WebSession with ID <%s>. "
        "_usageCount=%d, _totalSessionsServedCount=%d",
        self->webSessionDescription(), self->usageCount_, self->totalSessionsServedCount_.load());
  });
}

void ReportingSessionConnectivityHelperImpl::ownerDecrementUsageCountWithBlock(OwnerBlock block,
                                                                                std::shared_ptr<SerialQueue> queue) {
  stateQueue_->async([self = shared_from_this(), block = std::move(block), queue = std::move(queue)]() mutable {
    const std::string id = self->webSessionDescription();
    if (self->usageCount_ > 0) {
      --self->usageCount_;
      log::info(
          "ownerDecrementUsageCountWithBlock: connectivity helper decremented usage count for WebSession with ID "
          "<%s>. _usageCount=%d, _totalSessionsServedCount=%d",
          id, self->usageCount_, self->totalSessionsServedCount_.load());
    }
    if (self->usageCount_ > 0) {
      log::info(
          "ownerDecrementUsageCountWithBlock: Usage count for WebSession with ID <%s> is greater than 0. Notifying "
          "owner that _usageCount=%d, _totalSessionsServedCount=%d",
          id, self->usageCount_, self->totalSessionsServedCount_.load());
      auto target = queue ? queue : self->stateQueue_;
      target->async([block = std::move(block), count = self->usageCount_] {
        if (block) block(count);
      });
      return;
    }
    log::info(
        "ownerDecrementUsageCountWithBlock: Usage count for WebSession with ID <%s> is equal to 0. Starting "
        "connectivity helper release timer",
        id);
    self->startConnectivityHelperReleaseTimerWithBlock(std::move(block), std::move(queue));
  });
}

void ReportingSessionConnectivityHelperImpl::startConnectivityHelperReleaseTimerWithBlock(
    OwnerBlock block, std::shared_ptr<SerialQueue> queue) {
  assertOnQueue(stateQueue_);
  if (releaseTimeout_ == 0) {
    log::info("startConnectivityHelperReleaseTimerWithBlock: Special case of dealing with ever-lasting connectivity "
              "helper %s",
              description());
    // The owner hears 1, so it never invalidates an ever-lasting helper.
    auto target = queue ? queue : stateQueue_;
    target->async([block = std::move(block)] {
      if (block) block(1);
    });
    log::info("startConnectivityHelperReleaseTimerWithBlock: release %d IPC transactions for ever-lasting "
              "connectivity helper %s",
              totalSessionsServedCount_.load(), description());
    releaseAllIPCTransactions();
    return;
  }
  // A timer still running hands its owner the count before it is replaced.
  stopConnectivityHelperReleaseTimer();
  std::weak_ptr<ReportingSessionConnectivityHelperImpl> weak = weak_from_this();
  releaseTimer_ = TimerSource::create(stateQueue_, [weak] {
    if (auto self = weak.lock()) self->releaseTimerFired();
  });
  releaseTimerBlock_ = std::move(block);
  releaseTimerQueue_ = std::move(queue);
  // The platform timer's 100 ms leeway is a permission to fire late, which a
  // steady timer never needs.
  releaseTimer_->schedule(helperSeconds(releaseTimeout_));
  releaseTimer_->resume();
  log::info("startConnectivityHelperReleaseTimerWithBlock: started connectivity helper release timer for WebSession "
            "with ID <%s>",
            webSessionDescription());
}

void ReportingSessionConnectivityHelperImpl::releaseTimerFired() {
  assertOnQueue(stateQueue_);
  log::info("startConnectivityHelperReleaseTimerWithBlock: Connectivity helper release timer fired for WebSession "
            "with ID <%s>, timeout %ds",
            webSessionDescription(), releaseTimeout_);
  if (releaseTimer_) {
    releaseTimer_->cancel();
    releaseTimer_.reset();
  }
  OwnerBlock block = std::move(releaseTimerBlock_);
  releaseTimerBlock_ = nullptr;
  auto target = releaseTimerQueue_ ? releaseTimerQueue_ : stateQueue_;
  releaseTimerQueue_.reset();
  target->async([block = std::move(block), count = usageCount_] {
    log::info("startConnectivityHelperReleaseTimerWithBlock: Calling back owner of Connectivity helper with "
              "_usageCount=%d",
              count);
    if (block) block(count);
  });
}

void ReportingSessionConnectivityHelperImpl::stopConnectivityHelperReleaseTimer() {
  assertOnQueue(stateQueue_);
  log::info("stopConnectivityHelperReleaseTimer: stopping connectivity helper release timer for WebSession with ID "
            "<%s>",
            webSessionDescription());
  if (!releaseTimer_) return;
  // The cancellation hands a block still kept to its owner with the current count.
  releaseTimer_->cancel();
  releaseTimer_.reset();
  if (releaseTimerBlock_) {
    auto target = releaseTimerQueue_ ? releaseTimerQueue_ : stateQueue_;
    target->async([block = std::move(releaseTimerBlock_), count = usageCount_] { block(count); });
    releaseTimerBlock_ = nullptr;
  }
  releaseTimerQueue_.reset();
}

void ReportingSessionConnectivityHelperImpl::invalidate() {
  stateQueue_->async([self = shared_from_this()] {
    if (self->isActive_) {
      self->isActive_ = false;
      // The transactions go back when the session has become invalid.
      self->privateURLSession_->finishTasksAndInvalidate([self] {
        self->stateQueue_->async([self] { self->didBecomeInvalid(); });
      });
      log::info("ReportingSessionConnectivityHelper:invalidate: WebSession with ID <%s>", self->webSessionDescription());
      return;
    }
    log::info("ReportingSessionConnectivityHelper:invalidate: release %d IPC transactions for inactive connectivity "
              "helper",
              self->totalSessionsServedCount_.load());
    self->releaseAllIPCTransactions();
  });
}

void ReportingSessionConnectivityHelperImpl::didBecomeInvalid() {
  assertOnQueue(stateQueue_);
  log::info("didBecomeInvalidWithError: release %d IPC transactions for session %s", totalSessionsServedCount_.load(),
            webSessionDescription());
  releaseAllIPCTransactions();
  log::info("didBecomeInvalidWithError: session <%s> invalidated with error %s", webSessionDescription(), "(null)");
}

void ReportingSessionConnectivityHelperImpl::releaseAllIPCTransactions() {
  auto delegate = delegate_.lock();
  if (!delegate) {
    totalSessionsServedCount_ = 0;
    return;
  }
  std::lock_guard<std::recursive_mutex> lock(delegate->agentLock());
  delegate->releaseIPCTransactions(totalSessionsServedCount_.load());
  totalSessionsServedCount_ = 0;
}

// ---- For tests ----

std::uint32_t ReportingSessionConnectivityHelperImpl::usageCount() const {
  std::uint32_t count = 0;
  stateQueue_->sync([&] { count = usageCount_; });
  return count;
}

bool ReportingSessionConnectivityHelperImpl::isActive() const {
  bool active = false;
  stateQueue_->sync([&] { active = isActive_; });
  return active;
}

bool ReportingSessionConnectivityHelperImpl::hasReleaseTimer() const {
  bool running = false;
  stateQueue_->sync([&] { running = releaseTimer_ != nullptr; });
  return running;
}

std::size_t ReportingSessionConnectivityHelperImpl::runningTaskCount() const {
  std::size_t count = 0;
  stateQueue_->sync([&] { count = tasks_.size(); });
  return count;
}

}  // namespace telvane
