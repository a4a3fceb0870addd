#include "telvane/Telvane.h"

#include <mutex>

#include "client/ClientErrors.h"
#include "client/DaemonIdentifiers.h"
#include "client/OneShotSender.h"
#include "client/TelvaneAggregationObject.h"
#include "client/TelvaneConnection.h"
#include "client/TelvaneImpl.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/Random.h"
#include "telvane/TelvaneKeys.h"

namespace telvane {

TelvaneMessageSentDelegate::~TelvaneMessageSentDelegate() = default;

namespace {

constexpr const char* kReportingQueueLabel = "com.zembra.Telvane.main";

}  // namespace

std::unique_ptr<Telvane> Telvane::create(const Value& sessionInfo, const Value& userInfo,
                                         const Value& frameworksToCheck, AggregationBlock aggregationBlock,
                                         Error* error) {
  if (auto refused = client::validateSessionInfo(sessionInfo)) {
    if (error) *error = *refused;
    return nullptr;
  }
  log::info("startLogging: Client starts logging...");
  const Value& enableFlag = sessionInfo[kTelvaneSessionInfoEnableFlag];
  if (!enableFlag.isNull() && enableFlag.integerValue() == 0) {
    log::info("initWithSessionInfo: the session is disabled");
    return nullptr;
  }
  const std::string socketPath = ipcSocketPath();
  if (int denied = TelvaneConnection::sandboxLookupCheck(socketPath)) {
    log::info("initWithSessionInfo: IPC not entitled, %d", denied);
    return nullptr;
  }

  auto reportingQueue = SerialQueue::create(kReportingQueueLabel);
  const bool hasAggregationBlock = static_cast<bool>(aggregationBlock);
  auto aggregationObject = std::make_shared<TelvaneAggregationObject>(std::move(aggregationBlock));
  TelvaneConnection::SessionSetup setup;
  setup.sessionInfo = sessionInfo.deepCopy();
  setup.userInfo = userInfo.isDictionary() ? userInfo.deepCopy() : Value();
  setup.frameworksToCheck = frameworksToCheck.deepCopy();
  setup.hasAggregationBlock = hasAggregationBlock;
  auto connection = TelvaneConnection::create(std::move(setup), reportingQueue, aggregationObject);
  // Connects, exports the aggregation object and says setSessionInfo before anything
  // else can be sent.
  Status opened = connection->open();
  if (!opened) {
    log::info("initWithSessionInfo: Failed to connect to daemon");
    log::debug("initWithSessionInfo: %s", opened.error());
    return nullptr;
  }

  auto impl = std::make_shared<Impl>(reportingQueue, connection, aggregationObject);
  connection->setRestoredStatesHandler([weak = std::weak_ptr<Impl>(impl)](Array reply) {
    // A restoring start or fetch on a new connection: only a real answer replaces the
    // lists (the new session may not have its configuration yet).
    auto self = weak.lock();
    if (self && !reply.empty() && reply[0].isArray()) self->cacheStates(reply);
  });
  std::unique_ptr<Telvane> telvane(new Telvane(impl));
  impl->setOwner(telvane.get());
  return telvane;
}

Telvane::Telvane(std::shared_ptr<Impl> impl) : impl_(std::move(impl)) {}

Telvane::~Telvane() { impl_->teardown(); }

void Telvane::startConfigurationWithCompletionHandler(StatesCompletion completion) {
  impl_->startConfiguration(std::move(completion));
}

void Telvane::fetchReportingStatesWithUserInfo(const Value& userInfo, StatesCompletion fetchComplete) {
  impl_->fetchReportingStates(userInfo, std::move(fetchComplete));
}

void Telvane::setMessageLoggingBlock(LoggingBlock block) { impl_->setLoggingBlock(std::move(block)); }

Telvane::LoggingBlock Telvane::messageLoggingBlock() const { return impl_->loggingBlock(); }

void Telvane::setMessageSentDelegate(std::weak_ptr<TelvaneMessageSentDelegate> delegate) {
  impl_->setDelegate(std::move(delegate));
}

std::shared_ptr<TelvaneMessageSentDelegate> Telvane::messageSentDelegate() const { return impl_->delegate(); }

bool Telvane::setDigestKey(const std::optional<Bytes>& digestKey, std::int32_t algorithm) {
  return impl_->setDigestKey(digestKey, algorithm);
}

bool Telvane::sendMessageWithCategory(std::uint16_t category, std::uint16_t type, const Value& payload,
                                      Error* error) {
  if (category == 0) {
    if (error) *error = client::makeError(Error::kCodeCategoryZero, "category 0 is reserved");
    return false;
  }
  Dictionary message{{kTelvaneMessageParametersCategory, Value(static_cast<unsigned>(category))},
                     {kTelvaneMessageParametersType, Value(static_cast<unsigned>(type))},
                     {kTelvaneMessageParametersFlag, Value(0)}};
  if (!payload.isNull()) message.set(kTelvaneMessageParametersPayload, payload);
  // A locally filtered event is still a successful send for the caller.
  impl_->sendMessageWithDictionary(Value(std::move(message)), error);
  return true;
}

bool Telvane::sendMessageWithDictionary(const Value& message, Error* error) {
  return impl_->sendMessageWithDictionary(message, error);
}

bool Telvane::sendMessageWithDictionary(const Value& message, Error* error, SendReply reply) {
  return impl_->sendMessageWithDictionary(message, error, std::move(reply));
}

std::optional<Error> Telvane::connectionError() const { return impl_->connectionError(); }

bool Telvane::flushMessages() {
  log::info("flushMessages:");
  impl_->flushMessagesWithCompletion(nullptr);
  return true;
}

void Telvane::flushMessagesWithCompletion(FlushCompletion completion) {
  impl_->flushMessagesWithCompletion(std::move(completion));
}

void Telvane::finishSession() { impl_->finishSession(); }

void Telvane::updateSharedDataWithDictionary(const Value& sharedData) {
  impl_->updateSharedDataWithDictionary(sharedData);
}

void Telvane::updateSharedDataForKey(const std::string& key, const Value& value) {
  impl_->updateSharedDataForKey(key, value);
}

bool Telvane::serverSupportsFileUpload() { return impl_->serverSupportsFileUpload(); }

bool Telvane::uploadFileWithURL(const std::optional<std::string>& fileURL, UploadCompletion completion) {
  return impl_->uploadFileWithURL(fileURL, std::move(completion));
}

bool Telvane::uploadDataArray(const Value& logDataArray, UploadDataCompletion completion) {
  return impl_->uploadDataArray(logDataArray, std::move(completion));
}

bool Telvane::isWhitelistedEvent(std::uint16_t category) const { return impl_->isWhitelistedEvent(category); }

bool Telvane::isBlacklistedEvent(std::uint16_t category) const { return impl_->isBlacklistedEvent(category); }

std::vector<std::string> Telvane::enabledBackendNames() const { return impl_->enabledBackendNames(); }

std::vector<std::int64_t> Telvane::whitelistedEvents() const { return impl_->whitelistedEvents(); }

std::vector<std::int64_t> Telvane::blacklistedEvents() const { return impl_->blacklistedEvents(); }

bool Telvane::sendOneMessageWithSessionInfo(const Value& sessionInfo, const Value& userInfo, std::uint16_t category,
                                            std::uint16_t type, const Value& payload, Error* error,
                                            OneShotReply replyHandler) {
  return OneShotSender::send(sessionInfo, userInfo, category, type, payload, error, std::move(replyHandler));
}

Value Telvane::newHierarchyTokenFromParentToken(const Value& parentToken) {
  if (parentToken.isNull()) {
    return Value(Dictionary{{kTelvaneHierarchyTokenTokenID, Value(Random::system()->uuidString())},
                            {kTelvaneHierarchyTokenLevel, Value(0)}});
  }
  if (!parentToken.isDictionary()) return Value();
  Dictionary token;
  const Value& parentID = parentToken[kTelvaneHierarchyTokenTokenID];
  if (!parentID.isNull()) token.set(kTelvaneHierarchyTokenTokenID, parentID.deepCopy());
  token.set(kTelvaneHierarchyTokenLevel,
            Value(static_cast<long long>(parentToken[kTelvaneHierarchyTokenLevel].integerValue() + 1)));
  return Value(std::move(token));
}

std::string Telvane::getPersistentIdentifierForDNU(bool respect) { return DaemonIdentifiers::get(respect); }

std::string Telvane::regeneratePersistentIdentifierForDNU(bool respect) {
  return DaemonIdentifiers::regenerate(respect);
}

}  // namespace telvane
