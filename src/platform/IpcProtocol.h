// The IPC protocol between the client library and telvaned: one table of operations
// shared by both sides, the message kinds and the framing constants.
//
// A message on the wire is a 4-byte big-endian length followed by a MessagePack
// array [kind, id, operation, arguments, descriptor count]. The first message each
// side sends is a hello whose arguments hold the protocol version. A side that refuses
// the connection says why in a hello of its own, [version, reason text], right before
// it closes: as its first message (the daemon refusing a caller at accept) or after
// its first hello (a session refused later); the peer keeps the reason and reads on
// until the end, so that replies sent before the close still arrive. A call expecting a
// reply carries a fresh id; the reply carries the same id and the operation code of
// the call, with the reply block's arguments. File descriptors travel with the message
// that names their count (SCM_RIGHTS on the message's first bytes).
//
// Argument lists are checked against the table on arrival; a mismatch ends the
// connection. Pure data, thread-safe.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

#include "telvane/Value.h"

namespace telvane::ipc {

inline constexpr std::uint32_t kProtocolVersion = 1;
// Largest message body either side accepts. Larger frames end the connection.
inline constexpr std::size_t kMaxMessageBytes = 4 * 1024 * 1024;
// Most descriptors one message may carry.
inline constexpr std::size_t kMaxDescriptorsPerMessage = 4;
// A peer that has not said hello within this time is disconnected.
inline constexpr int kHelloTimeoutSeconds = 10;

enum class MessageKind : std::uint8_t {
  Hello = 0,
  Call = 1,         // expects a reply
  CallNoReply = 2,  // the caller gave no reply block
  Reply = 3,
};

enum class Operation : std::uint16_t {
  None = 0,
  // ClientSessionInterface (client → daemon)
  SetSessionInfo = 1,
  StartConfig = 2,
  FetchStates = 3,
  FetchDisplayURL = 4,
  SendMessageWithDictionary = 5,
  FlushMessages = 6,
  FinishSessionGracefully = 7,
  UploadFileAtPath = 8,
  UploadLogData = 9,
  SendMessageWithSessionInfo = 10,
  UpdateSharedDataWithDictionary = 11,
  UpdateSharedDataForKey = 12,
  SetDigestKey = 13,
  GetPersistentIdentifierForDNU = 14,
  RegeneratePersistentIdentifierForDNU = 15,
  // ClientSessionReplyInterface (daemon → client)
  SendMessageToClient = 64,
};

// What an argument may be.
enum class ArgType : std::uint8_t {
  Any,
  Map,
  MapOrNil,
  List,
  ListOrNil,
  String,
  StringOrNil,
  Bool,
  Integer,   // any integer (a boolean counts, as a number)
  Number,    // integer, double or boolean
  Bytes,
  BytesOrNil,
};

struct OperationInfo {
  Operation operation;
  const char* name;  // the operation's name in logs
  // Which side may call it: true for the client's calls to the daemon.
  bool toDaemon;
  bool hasReply;
  std::vector<ArgType> arguments;
  std::vector<ArgType> replyArguments;
  // How many descriptors a call must carry (at most).
  std::size_t maxDescriptors = 0;
};

// The entry for the code, or nullptr for an unknown code.
const OperationInfo* operationInfo(std::uint16_t code);
inline const OperationInfo* operationInfo(Operation op) { return operationInfo(static_cast<std::uint16_t>(op)); }

// Checks arguments against a list of types; on mismatch returns false and says why.
bool checkArguments(const std::vector<ArgType>& types, const Array& arguments, std::string& why);

const char* messageKindName(MessageKind kind);

}  // namespace telvane::ipc
