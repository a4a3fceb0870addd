#include "telvane/TelvaneFunctions.h"

namespace telvane {

namespace {

// The error handed back by the plain functions: always in "TelvaneErrorDomain", with
// the code and user information of the operation's error.
void handBack(const std::optional<Error>& produced, std::optional<Error>* error) {
  if (!produced || !error) return;
  *error = Error{Error::kDomain, produced->code, produced->description, produced->userInfo};
}

}  // namespace

bool TelvaneSendMessageWithError(Telvane* handle, std::uint16_t category, std::uint16_t type, const Value& payload,
                                 std::optional<Error>* error) {
  if (!handle) return false;
  std::optional<Error> produced = Error{};
  const bool sent = handle->sendMessageWithCategory(category, type, payload, &*produced);
  if (produced->domain.empty()) produced.reset();
  handBack(produced, error);
  return sent;
}

bool TelvaneSendMessageWithDictionary(Telvane* handle, const Value& message, std::optional<Error>* error) {
  if (!handle) return false;
  std::optional<Error> produced = Error{};
  const bool sent = handle->sendMessageWithDictionary(message, &*produced);
  if (produced->domain.empty()) produced.reset();
  handBack(produced, error);
  return sent;
}

bool TelvaneFlushMessages(Telvane* handle) {
  if (!handle) return false;
  return handle->flushMessages();
}

void TelvaneFlushMessagesWithCompletion(Telvane* handle, Telvane::FlushCompletion completion) {
  if (!handle) return;
  handle->flushMessagesWithCompletion(std::move(completion));
}

void TelvaneUpdateSharedDataWithDictionary(Telvane* handle, const Value& sharedData) {
  if (!handle) return;
  handle->updateSharedDataWithDictionary(sharedData);
}

void TelvaneUpdateSharedDataForKey(Telvane* handle, const std::string& key, const Value& value) {
  if (!handle) return;
  handle->updateSharedDataForKey(key, value);
}

Value TelvaneNewHierarchyTokenFromParentToken(const Value& parentToken) {
  return Telvane::newHierarchyTokenFromParentToken(parentToken);
}

Value TelvaneCreateHierarchyTokenFromParentToken(const Value& parentToken) {
  return Telvane::newHierarchyTokenFromParentToken(parentToken);
}

void TelvaneSetMessageBlock(Telvane* handle, std::function<void(const std::string& text)> block) {
  if (!handle) return;
  if (!block) {
    handle->setMessageLoggingBlock(nullptr);
    return;
  }
  handle->setMessageLoggingBlock([block = std::move(block)](const std::string& text) { block(text); });
}

void TelvaneFetchStatesWithUserInfo(Telvane* handle, const Value& userInfo, Telvane::StatesCompletion completion) {
  if (!handle) return;
  handle->fetchReportingStatesWithUserInfo(userInfo, std::move(completion));
}

bool TelvaneUploadLogWithArray(Telvane* handle, const Value& logDataArray) {
  if (!handle) return false;
  return handle->uploadDataArray(logDataArray, nullptr);
}

}  // namespace telvane
