// The key names of the maps a reporting client builds: session information, user
// information, event messages, hierarchy tokens and log-data entries. Plain constants;
// safe from any thread.
#pragma once

namespace telvane {

// Session information, given when a Telvane object is created.
inline constexpr const char* kTelvaneSessionInfoClientType = "ComponentType";
inline constexpr const char* kTelvaneSessionInfoClientVersion = "ClientVersion";
inline constexpr const char* kTelvaneSessionInfoSessionID = "SessionID";
inline constexpr const char* kTelvaneSessionInfoBatchEvent = "BatchEvents";
inline constexpr const char* kTelvaneSessionInfoRequireUserInfo = "RequireUserDict";
inline constexpr const char* kTelvaneSessionInfoHierarchyToken = "HierarchyToken";
inline constexpr const char* kTelvaneSessionInfoEnableFlag = "EnableFlag";

// User information: valid when either name is present.
inline constexpr const char* kTelvaneUserInfoClientName = "_clientName";
inline constexpr const char* kTelvaneUserInfoServiceName = "_serviceName";

// An event message.
inline constexpr const char* kTelvaneMessageParametersCategory = "ParametersCategory";
inline constexpr const char* kTelvaneMessageParametersType = "ParametersType";
inline constexpr const char* kTelvaneMessageParametersPayload = "ParametersPayload";
inline constexpr const char* kTelvaneMessageParametersFlag = "ParametersFlag";

// The event blob the daemon hands to its backends.
inline constexpr const char* kTelvaneMessageBlobSharedData = "SharedData";
inline constexpr const char* kTelvaneMessageBlobClientData = "ClientData";

// A hierarchy token.
inline constexpr const char* kTelvaneHierarchyTokenTokenID = "token";
inline constexpr const char* kTelvaneHierarchyTokenLevel = "level";

// One entry of a log-data upload.
inline constexpr const char* kTelvaneLogDataData = "LogData";
inline constexpr const char* kTelvaneLogDataStartTime = "StartTime";
inline constexpr const char* kTelvaneLogDataEndTime = "EndTime";

}  // namespace telvane
