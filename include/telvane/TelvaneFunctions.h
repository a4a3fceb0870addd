// Plain-function entry points over Telvane, for callers that keep an opaque handle.
//
// Each function forwards to the Telvane operation of the same meaning. A null handle
// makes a function do nothing and return false, nothing or a null value. Errors are
// handed back as new values in the domain "TelvaneErrorDomain" with the code and
// user information of the error the operation produced (so an event without its
// category comes back in that domain, code 7).
//
// Threading: as Telvane; callable from any thread.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "telvane/Error.h"
#include "telvane/Export.h"
#include "telvane/Telvane.h"
#include "telvane/Value.h"

namespace telvane {

TELVANE_EXPORT bool TelvaneSendMessageWithError(Telvane* handle, std::uint16_t category, std::uint16_t type, const Value& payload,
                                 std::optional<Error>* error);
TELVANE_EXPORT bool TelvaneSendMessageWithDictionary(Telvane* handle, const Value& message, std::optional<Error>* error);
TELVANE_EXPORT bool TelvaneFlushMessages(Telvane* handle);
TELVANE_EXPORT void TelvaneFlushMessagesWithCompletion(Telvane* handle, Telvane::FlushCompletion completion);
TELVANE_EXPORT void TelvaneUpdateSharedDataWithDictionary(Telvane* handle, const Value& sharedData);
TELVANE_EXPORT void TelvaneUpdateSharedDataForKey(Telvane* handle, const std::string& key, const Value& value);
TELVANE_EXPORT Value TelvaneNewHierarchyTokenFromParentToken(const Value& parentToken);
TELVANE_EXPORT Value TelvaneCreateHierarchyTokenFromParentToken(const Value& parentToken);
TELVANE_EXPORT void TelvaneSetMessageBlock(Telvane* handle, std::function<void(const std::string& text)> block);
TELVANE_EXPORT void TelvaneFetchStatesWithUserInfo(Telvane* handle, const Value& userInfo, Telvane::StatesCompletion completion);
TELVANE_EXPORT bool TelvaneUploadLogWithArray(Telvane* handle, const Value& logDataArray);

}  // namespace telvane
