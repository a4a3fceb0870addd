#include "TelvaneToolOptions.h"

#include <charconv>
#include <cmath>
#include <cstdlib>

#include "platform/Json.h"
#include "telvane/TelvaneKeys.h"

namespace telvane::tool {

const char* const kToolUsage =
    "usage: telvane send    --component-type N [session options] --category C --type T\n"
    "                       [--payload JSON] [--flag F] [--count K]\n"
    "       telvane oneshot --component-type N [session options] --category C --type T\n"
    "                       [--payload JSON] [--count K]\n"
    "       telvane states  --component-type N [session options]\n"
    "       telvane upload  --component-type N [session options] FILE\n"
    "       telvane --help\n"
    "\n"
    "session options:\n"
    "  --client NAME               client name of the user information\n"
    "  --service NAME              service name of the user information\n"
    "  --client-version V          client version (default: the tool's version)\n"
    "  --session-id N              session ID (default: the process ID)\n"
    "  --hierarchy-token TOKEN --hierarchy-level L\n"
    "                              place the session in a hierarchy\n"
    "  --require-user-info         the session requires user information\n"
    "  --batch                     ask the backends to batch events\n"
    "other options:\n"
    "  --timeout SECONDS           how long to wait for the daemon (default 10)\n"
    "  --verbose                   show the library's log lines on standard error\n"
    "\n"
    "send, states and upload start a session and print what the daemon said, one fact\n"
    "per line. An event is sent when the daemon answered it in a configured session;\n"
    "events the session's lists refuse are filtered before they leave; the others are\n"
    "not accepted (the session is not configured, or the daemon did not answer).\n"
    "A session the daemon refuses is reported on standard error as\n"
    "  telvane: the daemon refused the session: REASON\n"
    "\n"
    "exit status: 0 success; 1 the daemon refused the session, did not answer in time\n"
    "or did not accept every event; 2 a malformed command line.\n"
    "\n"
    "The daemon's socket is $TELVANED_SOCKET, else /run/telvaned/com.zembra.telvaned.\n";

namespace {

std::optional<long long> parseInteger(const std::string& text, long long min, long long max) {
  std::string_view digits(text);
  if (!digits.empty() && digits.front() == '+') digits.remove_prefix(1);
  long long n = 0;
  auto [end, ec] = std::from_chars(digits.data(), digits.data() + digits.size(), n);
  if (digits.empty() || ec != std::errc() || end != digits.data() + digits.size() || n < min || n > max) {
    return std::nullopt;
  }
  return n;
}

Result<ToolOptions> failure(std::string why) { return Result<ToolOptions>::failure(std::move(why)); }

}  // namespace

Result<ToolOptions> parseToolOptions(const std::vector<std::string>& arguments) {
  ToolOptions options;
  if (arguments.empty()) return failure("no command given");
  const std::string& command = arguments[0];
  if (command == "--help" || command == "-h" || command == "help") return Result<ToolOptions>::success(options);
  if (command == "send") {
    options.command = Command::Send;
  } else if (command == "oneshot") {
    options.command = Command::OneShot;
  } else if (command == "states") {
    options.command = Command::States;
  } else if (command == "upload") {
    options.command = Command::Upload;
  } else {
    return failure("unknown command '" + command + "'");
  }

  std::optional<long long> componentType, category, type;
  std::optional<std::string> payloadText;
  bool flagGiven = false;
  std::vector<std::string> positional;
  for (std::size_t i = 1; i < arguments.size(); ++i) {
    const std::string& option = arguments[i];
    // The value of an option that takes one.
    auto value = [&]() -> std::optional<std::string> {
      if (i + 1 >= arguments.size()) return std::nullopt;
      return arguments[++i];
    };
    auto number = [&](long long min, long long max) -> Result<long long> {
      auto text = value();
      if (!text) return Result<long long>::failure(option + " needs a value");
      auto n = parseInteger(*text, min, max);
      if (!n) {
        return Result<long long>::failure(option + " takes a whole number from " + std::to_string(min) + " to " +
                                          std::to_string(max) + ", not '" + *text + "'");
      }
      return Result<long long>::success(*n);
    };
    auto text = [&](std::optional<std::string>& into) -> std::optional<std::string> {
      into = value();
      if (!into) return option + " needs a value";
      return std::nullopt;
    };
    std::optional<std::string> problem;
    if (option == "--component-type") {
      auto n = number(0, 0xFFFFFFFFLL);
      if (!n) return failure(n.error());
      componentType = *n;
    } else if (option == "--client") {
      problem = text(options.clientName);
    } else if (option == "--service") {
      problem = text(options.serviceName);
    } else if (option == "--client-version") {
      problem = text(options.clientVersion);
    } else if (option == "--session-id") {
      auto n = number(0, 0xFFFFFFFFLL);
      if (!n) return failure(n.error());
      options.sessionID = *n;
    } else if (option == "--hierarchy-token") {
      problem = text(options.hierarchyToken);
    } else if (option == "--hierarchy-level") {
      auto n = number(0, 0x7FFFFFFFLL);
      if (!n) return failure(n.error());
      options.hierarchyLevel = *n;
    } else if (option == "--require-user-info") {
      options.requireUserInfo = true;
    } else if (option == "--batch") {
      options.batch = true;
    } else if (option == "--category") {
      auto n = number(0, 0xFFFF);
      if (!n) return failure(n.error());
      category = *n;
    } else if (option == "--type") {
      auto n = number(0, 0xFFFF);
      if (!n) return failure(n.error());
      type = *n;
    } else if (option == "--payload") {
      problem = text(payloadText);
    } else if (option == "--flag") {
      auto n = number(0, 0xFFFFFFFFLL);
      if (!n) return failure(n.error());
      options.flag = *n;
      flagGiven = true;
    } else if (option == "--count") {
      auto n = number(1, 1000000);
      if (!n) return failure(n.error());
      options.count = *n;
    } else if (option == "--timeout") {
      auto seconds = value();
      char* end = nullptr;
      double parsed = seconds ? std::strtod(seconds->c_str(), &end) : 0;
      if (!seconds || seconds->empty() || *end != '\0' || !std::isfinite(parsed) || parsed <= 0) {
        return failure("--timeout takes a positive number of seconds");
      }
      options.timeoutSeconds = parsed;
    } else if (option == "--verbose" || option == "-v") {
      options.verbose = true;
    } else if (option == "--help" || option == "-h") {
      options.command = Command::Help;
      return Result<ToolOptions>::success(options);
    } else if (!option.empty() && option[0] == '-' && option != "-") {
      return failure("unknown option '" + option + "'");
    } else {
      positional.push_back(option);
    }
    if (problem) return failure(*problem);
  }

  if (!componentType) return failure("--component-type is required");
  options.componentType = *componentType;
  if (options.hierarchyToken.has_value() != options.hierarchyLevel.has_value()) {
    return failure("--hierarchy-token and --hierarchy-level go together");
  }
  const bool sends = options.command == Command::Send || options.command == Command::OneShot;
  if (sends) {
    if (!category) return failure("--category is required");
    if (!type) return failure("--type is required");
    options.category = *category;
    options.type = *type;
    if (payloadText) {
      auto payload = json::parse(*payloadText);
      if (!payload) return failure("--payload is not valid JSON: " + payload.error());
      if (!payload->isDictionary()) return failure("--payload must be a JSON object");
      options.payload = *payload;
    }
    if (flagGiven && options.command == Command::OneShot) return failure("--flag is not available for oneshot");
  } else if (category || type || payloadText || flagGiven || options.count != 1) {
    return failure("event options are only for send and oneshot");
  }
  if (options.command == Command::Upload) {
    if (positional.size() != 1) return failure("upload takes one FILE");
    options.file = positional[0];
  } else if (!positional.empty()) {
    return failure("unexpected argument '" + positional[0] + "'");
  }
  return Result<ToolOptions>::success(options);
}

Value sessionInfoFor(const ToolOptions& options, long long defaultSessionID) {
  Dictionary info;
  info.set(kTelvaneSessionInfoClientType, Value(options.componentType));
  info.set(kTelvaneSessionInfoClientVersion, Value(options.clientVersion.value_or(TELVANE_VERSION)));
  info.set(kTelvaneSessionInfoSessionID, Value(options.sessionID.value_or(defaultSessionID)));
  info.set(kTelvaneSessionInfoBatchEvent, Value(options.batch));
  const bool hasUserInfo = options.clientName || options.serviceName;
  info.set(kTelvaneSessionInfoRequireUserInfo, Value(hasUserInfo || options.requireUserInfo));
  if (options.hierarchyToken) {
    info.set(kTelvaneSessionInfoHierarchyToken,
             Value(Dictionary{{kTelvaneHierarchyTokenTokenID, Value(*options.hierarchyToken)},
                              {kTelvaneHierarchyTokenLevel, Value(*options.hierarchyLevel)}}));
  }
  return Value(std::move(info));
}

Value userInfoFor(const ToolOptions& options) {
  if (!options.clientName && !options.serviceName) return Value();
  Dictionary user;
  if (options.clientName) user.set(kTelvaneUserInfoClientName, Value(*options.clientName));
  if (options.serviceName) user.set(kTelvaneUserInfoServiceName, Value(*options.serviceName));
  return Value(std::move(user));
}

}  // namespace telvane::tool
