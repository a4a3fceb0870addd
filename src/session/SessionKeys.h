// The map keys that the daemon reads from what clients send (session info, user
// info, messages, hierarchy tokens, log data) and writes into event blobs and the
// session's own messages, plus the way log lines print an object.
//
// Pure data; thread-safe.
#pragma once

#include <string>

#include "telvane/Value.h"

namespace telvane::keys {

// Session info.
inline constexpr const char* kSessionInfoComponentType = "ComponentType";
inline constexpr const char* kSessionInfoClientVersion = "ClientVersion";
inline constexpr const char* kSessionInfoSessionID = "SessionID";
inline constexpr const char* kSessionInfoBatchEvents = "BatchEvents";
inline constexpr const char* kSessionInfoRequireUserDict = "RequireUserDict";
inline constexpr const char* kSessionInfoHierarchyToken = "HierarchyToken";
inline constexpr const char* kSessionInfoEnableFlag = "EnableFlag";

// User info.
inline constexpr const char* kUserInfoClientName = "_clientName";
inline constexpr const char* kUserInfoServiceName = "_serviceName";

// Hierarchy token.
inline constexpr const char* kHierarchyTokenToken = "token";
inline constexpr const char* kHierarchyTokenLevel = "level";

// Message.
inline constexpr const char* kMessageParametersCategory = "ParametersCategory";
inline constexpr const char* kMessageParametersType = "ParametersType";
inline constexpr const char* kMessageParametersPayload = "ParametersPayload";
inline constexpr const char* kMessageParametersFlag = "ParametersFlag";

// Event blob handed to backends.
inline constexpr const char* kMessageBlobSharedData = "SharedData";
inline constexpr const char* kMessageBlobClientData = "ClientData";

// Storebag section.
inline constexpr const char* kStorebagReleaseTimeout = "release_timeout";

}  // namespace telvane::keys

namespace telvane {

// How a log line prints an object: text as it is, nothing as "(null)", anything else
// in its one-line description.
inline std::string objectDescription(const Value& value) {
  if (const std::string* text = value.asString()) return *text;
  if (value.isNull()) return "(null)";
  return value.description();
}

}  // namespace telvane
