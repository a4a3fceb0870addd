// The command line of the `telvane` tool: its commands and options, parsed and
// checked, and the session-information and user-information maps they describe.
// Plain functions; safe from any thread.
#pragma once

#include <optional>
#include <string>
#include <vector>

#include "platform/Result.h"
#include "telvane/Value.h"

namespace telvane::tool {

enum class Command { Help, Send, OneShot, States, Upload };

struct ToolOptions {
  Command command = Command::Help;
  long long componentType = 0;
  std::optional<std::string> clientName;
  std::optional<std::string> serviceName;
  std::optional<std::string> clientVersion;
  std::optional<long long> sessionID;
  std::optional<std::string> hierarchyToken;
  std::optional<long long> hierarchyLevel;
  bool requireUserInfo = false;
  bool batch = false;
  long long category = 0;
  long long type = 0;
  Value payload;  // a dictionary, or null without --payload
  long long flag = 0;
  long long count = 1;
  std::string file;  // upload
  bool verbose = false;
  double timeoutSeconds = 10;
};

// Parses the arguments after the program name; the error text says what is wrong.
Result<ToolOptions> parseToolOptions(const std::vector<std::string>& arguments);

// The session information of the options ("SessionID" defaults to `defaultSessionID`).
Value sessionInfoFor(const ToolOptions& options, long long defaultSessionID);
// The user information of the options, or null when neither name is given.
Value userInfoFor(const ToolOptions& options);

extern const char* const kToolUsage;

}  // namespace telvane::tool
