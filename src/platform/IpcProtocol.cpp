#include "platform/IpcProtocol.h"


namespace telvane::ipc {

namespace {

using A = ArgType;

// The reply of the three state queries: enabled backends, whitelist, blacklist.
const std::vector<ArgType> kStatesReply = {A::ListOrNil, A::ListOrNil, A::ListOrNil};
// An error travels as a map {"domain", "code", "description"} or nil.
const std::vector<ArgType> kTextAndErrorReply = {A::StringOrNil, A::MapOrNil};

const std::vector<OperationInfo>& table() {
  static const std::vector<OperationInfo> kTable = {
      {Operation::SetSessionInfo, "setSessionInfo", true, false, {A::Map, A::MapOrNil, A::Any, A::Bool}, {}},
      {Operation::StartConfig, "startConfigWithCompletionHandler", true, true, {}, kStatesReply},
      {Operation::FetchStates, "fetchStatesWithUserInfo", true, true, {A::MapOrNil}, kStatesReply},
      {Operation::FetchDisplayURL, "fetchDisplayURL", true, true, {}, {A::StringOrNil}},
      {Operation::SendMessageWithDictionary, "sendMessageWithDictionary", true, true, {A::Map}, {A::StringOrNil}},
      {Operation::FlushMessages, "flushMessagesWithCompletion", true, true, {}, kTextAndErrorReply},
      {Operation::FinishSessionGracefully, "finishSessionGracefully", true, false, {}, {}},
      // The reply: whether the upload succeeded, and whether the client should remove the
      // file (the server asked for it and the daemon could not).
      {Operation::UploadFileAtPath, "uploadFileAtPath", true, true, {A::String, A::BytesOrNil}, {A::Bool, A::Bool}, 1},
      {Operation::UploadLogData, "uploadLogData", true, true, {A::ListOrNil}, {A::Bool, A::MapOrNil}},
      {Operation::SendMessageWithSessionInfo,
       "sendMessageWithSessionInfo",
       true,
       true,
       {A::MapOrNil, A::MapOrNil, A::Integer, A::Integer, A::MapOrNil},
       {A::StringOrNil}},
      {Operation::UpdateSharedDataWithDictionary, "updateSharedDataWithDictionary", true, false, {A::MapOrNil}, {}},
      {Operation::UpdateSharedDataForKey, "updateSharedDataForKey", true, false, {A::String, A::Any}, {}},
      {Operation::SetDigestKey, "setDigestKey", true, false, {A::BytesOrNil, A::Integer}, {}},
      // The device's persistent identifiers: respect flag in, the identifier out.
      {Operation::GetPersistentIdentifierForDNU, "getPersistentIdentifierForDNU", true, true, {A::Bool}, {A::String}},
      {Operation::RegeneratePersistentIdentifierForDNU,
       "regeneratePersistentIdentifierForDNU",
       true,
       true,
       {A::Bool},
       {A::String}},
      {Operation::SendMessageToClient,
       "sendMessageToClient",
       false,
       false,
       {A::MapOrNil, A::Number, A::Integer, A::Integer, A::MapOrNil},
       {}},
  };
  return kTable;
}

const char* typeName(ArgType t) {
  switch (t) {
    case A::Any: return "any";
    case A::Map: return "map";
    case A::MapOrNil: return "map or nil";
    case A::List: return "list";
    case A::ListOrNil: return "list or nil";
    case A::String: return "string";
    case A::StringOrNil: return "string or nil";
    case A::Bool: return "boolean";
    case A::Integer: return "integer";
    case A::Number: return "number";
    case A::Bytes: return "bytes";
    case A::BytesOrNil: return "bytes or nil";
  }
  return "?";
}

bool matches(ArgType t, const Value& v) {
  switch (t) {
    case A::Any: return true;
    case A::Map: return v.isDictionary();
    case A::MapOrNil: return v.isDictionary() || v.isNull();
    case A::List: return v.isArray();
    case A::ListOrNil: return v.isArray() || v.isNull();
    case A::String: return v.isString();
    case A::StringOrNil: return v.isString() || v.isNull();
    case A::Bool: return v.isBoolean() || v.isInteger();
    case A::Integer: return v.isInteger() || v.isBoolean();
    case A::Number: return v.isNumber();
    case A::Bytes: return v.isBytes();
    case A::BytesOrNil: return v.isBytes() || v.isNull();
  }
  return false;
}

}  // namespace

const OperationInfo* operationInfo(std::uint16_t code) {
  for (const auto& info : table()) {
    if (static_cast<std::uint16_t>(info.operation) == code) return &info;
  }
  return nullptr;
}

bool checkArguments(const std::vector<ArgType>& types, const Array& arguments, std::string& why) {
  if (arguments.size() != types.size()) {
    why = "expected " + std::to_string(types.size()) + " arguments, got " + std::to_string(arguments.size());
    return false;
  }
  for (std::size_t i = 0; i < types.size(); ++i) {
    if (!matches(types[i], arguments[i])) {
      why = "argument " + std::to_string(i + 1) + " must be a " + typeName(types[i]);
      return false;
    }
  }
  return true;
}

const char* messageKindName(MessageKind kind) {
  switch (kind) {
    case MessageKind::Hello: return "hello";
    case MessageKind::Call: return "call";
    case MessageKind::CallNoReply: return "call without reply";
    case MessageKind::Reply: return "reply";
  }
  return "unknown";
}

}  // namespace telvane::ipc
