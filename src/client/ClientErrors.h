// Error values of the client library and the session-information check shared by the
// session object and the one-shot send. Free functions without shared state; safe
// from any thread.
#pragma once

#include <optional>
#include <string>

#include "telvane/Error.h"
#include "telvane/Value.h"

namespace telvane::client {

// An error in "TelvaneErrorDomain" with the code and text.
Error makeError(long code, std::string description);
// Code 7 for an event map without its category or type: the text is the domain too.
Error missingParameterError(const std::string& text);
// The error of a daemon reply: a map {"domain", "code", "description"} (an optional
// "userInfo" dictionary is kept); none for null or anything else.
std::optional<Error> errorFromReplyValue(const Value& value);

// The component types that may report.
inline constexpr long kMinComponentType = 5;
inline constexpr long kMaxComponentType = 30;

// Checks the session information: none (code 2, logged) or a component type outside
// kMinComponentType...kMaxComponentType (code 3, logged). A value that is not a
// dictionary counts as none.
std::optional<Error> validateSessionInfo(const Value& sessionInfo);

}  // namespace telvane::client
