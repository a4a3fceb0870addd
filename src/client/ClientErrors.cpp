#include "client/ClientErrors.h"

#include "platform/Log.h"
#include "telvane/TelvaneKeys.h"

namespace telvane::client {

Error makeError(long code, std::string description) {
  return Error{Error::kDomain, code, std::move(description), Value()};
}

Error missingParameterError(const std::string& text) {
  return Error{text, Error::kCodeMissingParameter, text, Value()};
}

std::optional<Error> errorFromReplyValue(const Value& value) {
  if (!value.isDictionary()) return std::nullopt;
  Error error;
  error.domain = value["domain"].isString() ? value["domain"].stringOrEmpty() : std::string(Error::kDomain);
  error.code = static_cast<long>(value["code"].integerValue());
  error.description = value["description"].stringOrEmpty();
  if (value["userInfo"].isDictionary()) error.userInfo = value["userInfo"].copy();
  return error;
}

std::optional<Error> validateSessionInfo(const Value& sessionInfo) {
  if (!sessionInfo.isDictionary()) {
    log::info("validateSessionInfo: sessionInfo is nil");
    return makeError(Error::kCodeSessionInfoMissing, "sessionInfo is nil");
  }
  const std::int64_t clientType = sessionInfo[kTelvaneSessionInfoClientType].integerValue();
  if (clientType < kMinComponentType || clientType > kMaxComponentType) {
    log::info("validateSessionInfo: clientType is invalid");
    return makeError(Error::kCodeComponentTypeInvalid, "clientType is invalid");
  }
  return std::nullopt;
}

}  // namespace telvane::client
