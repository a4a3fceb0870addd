#include "client/TelvaneImpl.h"

#include <algorithm>

#include "client/ClientErrors.h"
#include "platform/Log.h"
#include "telvane/TelvaneKeys.h"

namespace telvane {

namespace {

using Restore = TelvaneConnection::Restore;

// The reply text of the display-URL query that means there is none.
constexpr const char* kURLNotAvailable = "URL not available";

std::string describeList(const Value& list) { return list.isNull() ? std::string("(null)") : list.description(); }

std::string textOrNull(const Value& text) { return text.isString() ? *text.asString() : std::string("(null)"); }

}  // namespace

Telvane::Impl::Impl(std::shared_ptr<SerialQueue> reportingQueue, std::shared_ptr<TelvaneConnection> connection,
                    std::shared_ptr<TelvaneAggregationObject> aggregationObject)
    : reportingQueue_(std::move(reportingQueue)),
      connection_(std::move(connection)),
      aggregationObject_(std::move(aggregationObject)),
      reportingPeriodicTasksQueue_(ConcurrentQueue::create(kPeriodicTaskQueueLabel)) {}

void Telvane::Impl::setOwner(Telvane* owner) {
  std::lock_guard<std::recursive_mutex> lock(ownerMutex_);
  owner_ = owner;
}

void Telvane::Impl::teardown() {
  log::info("aboutToDealloc: Client stops logging...");
  stopPeriodicTasks();
  const std::shared_ptr<SerialQueue>& connectionQueue = connection_->connectionQueue();
  if (!reportingQueue_->isCurrent() && !connectionQueue->isCurrent()) {
    // Let the queued calls run and hand their messages to the connection, give the
    // daemon a moment to answer them (so that their completions still run and the
    // daemon is not writing to a closed socket), then end the connection behind them
    // and wait until that has happened.
    reportingQueue_->sync([] {});
    connection_->waitForReplies(kTeardownReplyWaitMs);
    reportingQueue_->sync([this] {
      setOwner(nullptr);
      connection_->close();
    });
    connectionQueue->sync([] {});
    // Replies that arrived meanwhile were handed to the reporting queue.
    reportingQueue_->sync([] {});
    return;
  }
  // Destroyed from our own queue (a block or the delegate let the object go): waiting
  // here would wait for ourselves, so the connection ends after the work queued so far.
  setOwner(nullptr);
  reportingQueue_->async([self = shared_from_this()] { self->connection_->close(); });
}

void Telvane::Impl::cacheStates(const Array& reply) {
  assertOnQueue(reportingQueue_);
  const Value& states = reply.size() > 0 ? reply[0] : Value();
  const Value& whitelist = reply.size() > 1 ? reply[1] : Value();
  const Value& blacklist = reply.size() > 2 ? reply[2] : Value();
  std::vector<std::string> names;
  if (const Array* list = states.asArray()) {
    for (const Value& name : *list) names.push_back(name.isString() ? *name.asString() : name.description());
  }
  auto numbers = [](const Value& value) {
    std::vector<std::int64_t> out;
    if (const Array* list = value.asArray()) {
      for (const Value& number : *list) out.push_back(number.integerValue());
    }
    return out;
  };
  const int count = static_cast<int>(names.size());
  {
    std::lock_guard<std::mutex> lock(stateMutex_);
    enabledBackendNames_ = std::move(names);
    whitelistedEvents_ = numbers(whitelist);
    blacklistedEvents_ = numbers(blacklist);
  }
  log::info("Cached %d enabled backends, (%s, %s) listed events", count, describeList(whitelist),
            describeList(blacklist));
}

void Telvane::Impl::startConfiguration(StatesCompletion completion) {
  reportingQueue_->async([self = shared_from_this(), completion = std::move(completion)] {
    auto remote = self->connection_->remote(Restore::ExceptStart);
    if (!remote) {
      log::info("startConfigurationWithCompletionHandler: Failed to get remote object proxy: %s", remote.error());
      if (completion) completion(false);
      return;
    }
    self->connection_->noteStarted();
    self->connection_->call(
        remote.value(), ipc::Operation::StartConfig, Array{},
        [weak = self->weak_from_this(), completion](Array reply) {
          auto impl = weak.lock();
          if (!impl) return;
          impl->cacheStates(reply);
          if (completion) completion(!reply.empty() && reply[0].isArray());
        },
        [completion] {
          if (completion) completion(false);
        });
    self->fetchDisplayURL(remote.value());
  });
}

void Telvane::Impl::fetchReportingStates(const Value& userInfo, StatesCompletion completion) {
  Value info = userInfo.isDictionary() ? userInfo.deepCopy() : Value();
  reportingQueue_->async([self = shared_from_this(), info, completion = std::move(completion)] {
    auto remote = self->connection_->remote(Restore::ExceptFetch);
    if (!remote) {
      log::info("fetchReportingStatesWithUserInfo: Failed to get remote object proxy: %s", remote.error());
      if (completion) completion(false);
      return;
    }
    self->connection_->noteFetchedUserInfo(info);
    self->connection_->call(
        remote.value(), ipc::Operation::FetchStates, Array{info},
        [weak = self->weak_from_this(), completion](Array reply) {
          auto impl = weak.lock();
          if (!impl) return;
          impl->cacheStates(reply);
          if (completion) completion(!reply.empty() && reply[0].isArray());
        },
        [completion] {
          if (completion) completion(false);
        });
    self->fetchDisplayURL(remote.value());
  });
}

void Telvane::Impl::fetchDisplayURL(const std::shared_ptr<IpcConnection>& remote) {
  connection_->call(
      remote, ipc::Operation::FetchDisplayURL, Array{},
      [weak = weak_from_this()](Array reply) {
        auto impl = weak.lock();
        if (!impl || reply.empty() || !reply[0].isString()) return;
        const std::string& url = *reply[0].asString();
        impl->logToBlock(url == kURLNotAvailable ? url : "URL for the session is: " + url);
      },
      nullptr);
}

void Telvane::Impl::setLoggingBlock(LoggingBlock block) {
  std::lock_guard<std::mutex> lock(stateMutex_);
  loggingBlock_ = std::move(block);
}

Telvane::LoggingBlock Telvane::Impl::loggingBlock() const {
  std::lock_guard<std::mutex> lock(stateMutex_);
  return loggingBlock_;
}

void Telvane::Impl::logToBlock(const std::string& text) const {
  LoggingBlock block = loggingBlock();
  if (block) block(text);
}

void Telvane::Impl::setDelegate(std::weak_ptr<TelvaneMessageSentDelegate> delegate) {
  std::lock_guard<std::mutex> lock(stateMutex_);
  delegate_ = std::move(delegate);
}

std::shared_ptr<TelvaneMessageSentDelegate> Telvane::Impl::delegate() const {
  std::lock_guard<std::mutex> lock(stateMutex_);
  return delegate_.lock();
}

void Telvane::Impl::notifyDelegate(const Value& event) {
  reportingQueue_->async([self = shared_from_this(), event] {
    auto delegate = self->delegate();
    if (!delegate) return;
    std::lock_guard<std::recursive_mutex> lock(self->ownerMutex_);
    if (self->owner_) delegate->didSendMessageForReportingClient(*self->owner_, event);
  });
}

bool Telvane::Impl::isWhitelistedEvent(std::uint16_t category) const {
  std::lock_guard<std::mutex> lock(stateMutex_);
  // An empty whitelist lets everything through; the blacklist is the only refusal then.
  return whitelistedEvents_.empty() ||
         std::find(whitelistedEvents_.begin(), whitelistedEvents_.end(), category) != whitelistedEvents_.end();
}

bool Telvane::Impl::isBlacklistedEvent(std::uint16_t category) const {
  std::lock_guard<std::mutex> lock(stateMutex_);
  return std::find(blacklistedEvents_.begin(), blacklistedEvents_.end(), category) != blacklistedEvents_.end();
}

std::vector<std::string> Telvane::Impl::enabledBackendNames() const {
  std::lock_guard<std::mutex> lock(stateMutex_);
  return enabledBackendNames_;
}

std::vector<std::int64_t> Telvane::Impl::whitelistedEvents() const {
  std::lock_guard<std::mutex> lock(stateMutex_);
  return whitelistedEvents_;
}

std::vector<std::int64_t> Telvane::Impl::blacklistedEvents() const {
  std::lock_guard<std::mutex> lock(stateMutex_);
  return blacklistedEvents_;
}

bool Telvane::Impl::sendMessageWithDictionary(const Value& message, Error* error, SendReply sendReply) {
  const Value& categoryValue = message[kTelvaneMessageParametersCategory];
  if (categoryValue.isNull()) {
    if (error) *error = client::missingParameterError("Missing mandatory parameter 'category'");
    return false;
  }
  if (message[kTelvaneMessageParametersType].isNull()) {
    if (error) *error = client::missingParameterError("Missing mandatory parameter 'type'");
    return false;
  }
  const std::uint16_t category = categoryValue.unsignedShortValue();
  if (category == 0) {
    if (error) *error = client::makeError(Error::kCodeCategoryZero, "category 0 is reserved");
    return false;
  }
  // The daemon's copy must not change when the caller reuses its map.
  Value event = message.deepCopy();
  notifyDelegate(event);
  if (!isWhitelistedEvent(category) || isBlacklistedEvent(category)) {
    log::info("Event %u is filtered by storebag", static_cast<unsigned>(category));
    return false;
  }
  reportingQueue_->async([self = shared_from_this(), event, sendReply = std::move(sendReply)] {
    auto remote = self->connection_->remote();
    if (!remote) {
      log::info("sendMessageWithDictionary: Failed to get remote object proxy: %s", remote.error());
      if (sendReply) sendReply(false, std::nullopt);
      return;
    }
    TelvaneConnection::LostHandler lost;
    if (sendReply) lost = [sendReply] { sendReply(false, std::nullopt); };
    self->connection_->call(
        remote.value(), ipc::Operation::SendMessageWithDictionary, Array{event},
        [weak = self->weak_from_this(), sendReply](Array reply) {
          const Value text = reply.empty() ? Value() : reply[0];
          log::info("sendMessageWithDictionary: %s", textOrNull(text));
          auto impl = weak.lock();
          if (impl && text.isString()) impl->logToBlock(*text.asString());
          if (sendReply) sendReply(true, text.isString() ? std::optional<std::string>(*text.asString()) : std::nullopt);
        },
        std::move(lost));
  });
  return true;
}

void Telvane::Impl::flushMessagesWithCompletion(FlushCompletion completion) {
  reportingQueue_->async([self = shared_from_this(), completion = std::move(completion)] {
    auto remote = self->connection_->remote();
    if (!remote) {
      log::info("flushMessagesWithCompletion: Failed to get remote object proxy: %s", remote.error());
      if (completion) completion(client::makeError(-1, "Failed to get remote object proxy: " + remote.error()));
      return;
    }
    self->connection_->call(
        remote.value(), ipc::Operation::FlushMessages, Array{},
        [weak = self->weak_from_this(), completion](Array reply) {
          const Value text = reply.size() > 0 ? reply[0] : Value();
          std::optional<Error> error = client::errorFromReplyValue(reply.size() > 1 ? reply[1] : Value());
          auto impl = weak.lock();
          if (!error) {
            log::info("flushMessagesWithCompletion: flushed session successfully with reply %s", textOrNull(text));
            if (impl && text.isString()) impl->logToBlock(*text.asString());
          } else {
            log::info("flushMessagesWithCompletion: flush failed with error '%s'", error->description);
          }
          if (completion) completion(error);
        },
        [completion] {
          // The daemon went away before it answered: the flush did not happen.
          if (completion) completion(client::makeError(-1, "IPC connection interrupted"));
        });
  });
}

void Telvane::Impl::finishSession() {
  reportingQueue_->async([self = shared_from_this()] {
    auto remote = self->connection_->remote();
    if (!remote) {
      log::info("finishSession: Failed to get remote object proxy: %s", remote.error());
      return;
    }
    self->connection_->send(remote.value(), ipc::Operation::FinishSessionGracefully, Array{});
  });
}

void Telvane::Impl::updateSharedDataWithDictionary(const Value& sharedData) {
  Value data = sharedData.isDictionary() ? sharedData.deepCopy() : Value();
  reportingQueue_->async([self = shared_from_this(), data] {
    auto remote = self->connection_->remote();
    if (!remote) {
      log::info("updateSharedDataWithDictionary: Failed to get remote object proxy: %s", remote.error());
      return;
    }
    self->connection_->send(remote.value(), ipc::Operation::UpdateSharedDataWithDictionary, Array{data});
  });
}

void Telvane::Impl::updateSharedDataForKey(const std::string& key, const Value& value) {
  Value copy = value.deepCopy();
  reportingQueue_->async([self = shared_from_this(), key, copy] {
    auto remote = self->connection_->remote();
    if (!remote) {
      log::info("updateSharedDataForKey: Failed to get remote object proxy: %s", remote.error());
      return;
    }
    self->connection_->send(remote.value(), ipc::Operation::UpdateSharedDataForKey, Array{Value(key), copy});
  });
}

}  // namespace telvane
