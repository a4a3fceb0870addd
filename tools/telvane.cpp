// telvane: the command-line client of telvaned, for scripts and for people trying the
// system.
//
//   telvane send    --component-type N [session options] --category C --type T [--payload JSON] [--flag F] [--count K]
//   telvane oneshot --component-type N [session options] --category C --type T [--payload JSON] [--count K]
//   telvane states  --component-type N [session options]
//   telvane upload  --component-type N [session options] FILE
//
// `send`, `states` and `upload` open one reporting session, start it, do their work,
// finish the session and print what the daemon said, one fact per line:
//   start: configured | start: not configured
//   enabled backends: a, b | none
//   whitelist: 1, 2 | none
//   blacklist: none
//   events: 3 sent, 0 filtered[, 1 not accepted]       (send)
//   flush: ok | flush: failed: TEXT (DOMAIN, code N)   (send)
//   file upload supported: yes | no         (upload)
//   upload: succeeded | upload: failed      (upload)
//   reply: TEXT                             (every reply text of the daemon, in order)
//   session: finished
// `oneshot` prints `reply: TEXT` per event; a refused event (the session limit of the
// client type, or a caller without the entitlement) ends it with exit status 1.
//
// "start: not configured" means that the daemon has no configuration (storebag) for
// the client type. An event counts as sent when the daemon answered it in a configured
// session; events the session's lists refuse never leave the process and count as
// filtered; the others are not accepted: the session is not configured (the daemon
// has nothing to deliver them with) or the daemon did not answer them.
//
// A daemon that refuses the session (a caller without the entitlement, a session over
// the limit of its client type) is reported on standard error as "telvane: the daemon
// refused the session: REASON", with nothing on standard output.
//
// Errors go to standard error as "telvane: ..."; exit status 0 on success, 1 when the
// daemon refused the session, did not answer in time or did not accept every event, 2
// for a malformed command line. The library's own log lines appear on standard error
// only with --verbose.
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <condition_variable>
#include <cstdio>
#include <future>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "TelvaneToolOptions.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "telvane/Telvane.h"
#include "telvane/TelvaneKeys.h"

namespace {

using telvane::Error;
using telvane::Telvane;
using telvane::Value;
using telvane::tool::Command;
using telvane::tool::ToolOptions;

constexpr int kExitOk = 0;
constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;
// Between two attempts to reach a daemon that is not there yet.
constexpr std::chrono::milliseconds kConnectRetryMs{100};

int fail(const std::string& message) {
  std::fprintf(stderr, "telvane: %s\n", message.c_str());
  return kExitFailure;
}

std::string errorText(const Error& error) {
  return error.description + " (" + error.domain + ", code " + std::to_string(error.code) + ")";
}

template <typename T>
std::string joined(const std::vector<T>& items) {
  if (items.empty()) return "none";
  std::string out;
  for (const auto& item : items) {
    if (!out.empty()) out += ", ";
    if constexpr (std::is_same_v<T, std::string>) {
      out += item;
    } else {
      out += std::to_string(item);
    }
  }
  return out;
}

// A value handed over once from the library's threads, awaited with a deadline.
template <typename T>
class Pending {
 public:
  auto setter() {
    return [state = state_](T value) {
      std::lock_guard<std::mutex> lock(state->mutex);
      if (state->set) return;
      state->set = true;
      state->promise.set_value(std::move(value));
    };
  }
  std::optional<T> wait(double seconds) {
    auto deadline = std::chrono::duration<double>(seconds);
    if (future_.wait_for(deadline) != std::future_status::ready) return std::nullopt;
    return future_.get();
  }

 private:
  struct State {
    std::mutex mutex;
    bool set = false;
    std::promise<T> promise;
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
  std::future<T> future_ = state_->promise.get_future();
};

// Counts the daemon's answers to the events handed to it.
class SendAnswers {
 public:
  Telvane::SendReply reply() {
    return [state = state_](bool answered, const std::optional<std::string>&) {
      {
        std::lock_guard<std::mutex> lock(state->mutex);
        ++(answered ? state->answered : state->unanswered);
      }
      state->changed.notify_all();
    };
  }
  // Waits until every one of `count` events has had its answer or lost it, at most for
  // the timeout; the number answered.
  long long waitAnswered(long long count, double seconds) {
    std::unique_lock<std::mutex> lock(state_->mutex);
    state_->changed.wait_for(lock, std::chrono::duration<double>(seconds),
                             [&] { return state_->answered + state_->unanswered >= count; });
    return state_->answered;
  }

 private:
  struct State {
    std::mutex mutex;
    std::condition_variable changed;
    long long answered = 0;    // guarded by mutex
    long long unanswered = 0;  // guarded by mutex
  };
  std::shared_ptr<State> state_ = std::make_shared<State>();
};

int refusedSession(const Error& refusal) { return fail("the daemon refused the session: " + refusal.description); }

// The reply texts of the daemon, printed after the session's own lines.
class ReplyLog {
 public:
  Telvane::LoggingBlock block() {
    return [this](const std::string& text) {
      std::lock_guard<std::mutex> lock(mutex_);
      texts_.push_back(text);
    };
  }
  void print() {
    std::lock_guard<std::mutex> lock(mutex_);
    for (const auto& text : texts_) std::printf("reply: %s\n", text.c_str());
  }

 private:
  std::mutex mutex_;
  std::vector<std::string> texts_;
};

// Makes the session object, waiting up to the timeout for a daemon to listen.
std::unique_ptr<Telvane> openSession(const ToolOptions& options, int& exitCode) {
  const Value sessionInfo = telvane::tool::sessionInfoFor(options, static_cast<long long>(::getpid()));
  const Value userInfo = telvane::tool::userInfoFor(options);
  const std::string socketPath = telvane::ipcSocketPath();
  if (::access(socketPath.c_str(), W_OK) != 0 && errno != ENOENT) {
    exitCode = fail("not permitted to use the daemon's socket " + socketPath);
    return nullptr;
  }
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::duration<double>(options.timeoutSeconds);
  for (;;) {
    Error error;
    error.code = 0;
    auto session = Telvane::create(sessionInfo, userInfo, Value(), nullptr, &error);
    if (session) return session;
    if (error.code != 0) {
      exitCode = fail("client creation refused: " + errorText(error));
      return nullptr;
    }
    if (std::chrono::steady_clock::now() >= deadline) {
      exitCode = fail("the daemon is not reachable at " + socketPath);
      return nullptr;
    }
    std::this_thread::sleep_for(kConnectRetryMs);
  }
}

// Starts the session and prints its states; false (with exitCode set) on a timeout or
// when the daemon refused the session.
bool startSession(Telvane& session, const ToolOptions& options, bool& configured, int& exitCode) {
  Pending<bool> started;
  session.startConfigurationWithCompletionHandler(started.setter());
  auto received = started.wait(options.timeoutSeconds);
  if (!received) {
    exitCode = fail("no start reply from the daemon within " + std::to_string(options.timeoutSeconds) + " s");
    return false;
  }
  // Without a reply the library knows why by the time it says so.
  if (auto refusal = session.connectionError(); !*received && refusal) {
    exitCode = refusedSession(*refusal);
    return false;
  }
  configured = *received;
  std::printf("start: %s\n", configured ? "configured" : "not configured");
  std::printf("enabled backends: %s\n", joined(session.enabledBackendNames()).c_str());
  std::printf("whitelist: %s\n", joined(session.whitelistedEvents()).c_str());
  std::printf("blacklist: %s\n", joined(session.blacklistedEvents()).c_str());
  return true;
}

int sendEvents(Telvane& session, const ToolOptions& options, bool configured) {
  long long handedOver = 0, filtered = 0;
  SendAnswers answers;
  for (long long i = 0; i < options.count; ++i) {
    telvane::Dictionary message{
        {telvane::kTelvaneMessageParametersCategory, Value(options.category)},
        {telvane::kTelvaneMessageParametersType, Value(options.type)},
        {telvane::kTelvaneMessageParametersFlag, Value(options.flag)}};
    if (!options.payload.isNull()) message.set(telvane::kTelvaneMessageParametersPayload, options.payload);
    Error error;
    if (session.sendMessageWithDictionary(Value(std::move(message)), &error, answers.reply())) {
      ++handedOver;
    } else if (!error.domain.empty()) {
      return fail("event refused: " + errorText(error));
    } else {
      ++filtered;
    }
  }
  const long long answered = answers.waitAnswered(handedOver, options.timeoutSeconds);
  // A session without configuration has no backends: the daemon answers and drops.
  const long long sent = configured ? answered : 0;
  const long long notAccepted = handedOver - sent;
  std::printf("events: %lld sent, %lld filtered", sent, filtered);
  if (notAccepted > 0) std::printf(", %lld not accepted", notAccepted);
  std::printf("\n");
  if (auto refusal = session.connectionError()) return refusedSession(*refusal);

  Pending<std::optional<Error>> flushed;
  session.flushMessagesWithCompletion(flushed.setter());
  auto outcome = flushed.wait(options.timeoutSeconds);
  if (!outcome) return fail("no flush reply from the daemon within " + std::to_string(options.timeoutSeconds) + " s");
  int exitCode = kExitOk;
  if (*outcome) {
    std::printf("flush: failed: %s\n", errorText(**outcome).c_str());
    exitCode = kExitFailure;
  } else {
    std::printf("flush: ok\n");
  }
  if (notAccepted > 0) {
    exitCode = fail(std::to_string(notAccepted) + " of " + std::to_string(handedOver) + " events not accepted: " +
                    (configured ? "no answer from the daemon" : "the session is not configured"));
  }
  return exitCode;
}

// After a refused upload, names what the daemon refuses that can be seen from here:
// anything but a regular file (a link is never followed), or an empty one.
void explainRefusedUpload(const std::string& path) {
  struct stat attributes {};
  if (::lstat(path.c_str(), &attributes) != 0) return;
  if (!S_ISREG(attributes.st_mode)) {
    std::fprintf(stderr, "telvane: %s: Only upload a regular file.\n", path.c_str());
  } else if (attributes.st_size == 0) {
    std::fprintf(stderr, "telvane: %s: Input file is empty\n", path.c_str());
  }
}

int uploadFile(Telvane& session, const ToolOptions& options) {
  std::printf("file upload supported: %s\n", session.serverSupportsFileUpload() ? "yes" : "no");
  Pending<bool> uploaded;
  if (!session.uploadFileWithURL(options.file, uploaded.setter())) {
    return fail("cannot open " + options.file + " for reading");
  }
  auto outcome = uploaded.wait(options.timeoutSeconds);
  if (!outcome) return fail("no upload reply from the daemon within " + std::to_string(options.timeoutSeconds) + " s");
  std::printf("upload: %s\n", *outcome ? "succeeded" : "failed");
  if (!*outcome) explainRefusedUpload(options.file);
  return *outcome ? kExitOk : kExitFailure;
}

int runSession(const ToolOptions& options) {
  int exitCode = kExitOk;
  ReplyLog replies;
  {
    std::unique_ptr<Telvane> session = openSession(options, exitCode);
    if (!session) return exitCode;
    session->setMessageLoggingBlock(replies.block());
    bool configured = false;
    if (!startSession(*session, options, configured, exitCode)) return exitCode;
    if (options.command == Command::Send) exitCode = sendEvents(*session, options, configured);
    if (options.command == Command::Upload) exitCode = uploadFile(*session, options);
    session->finishSession();
    // Going away hands the finish to the daemon and closes the connection.
  }
  std::fflush(stdout);
  replies.print();
  std::printf("session: finished\n");
  return exitCode;
}

// How the daemon answers a one-shot event over the session limit of its client type.
constexpr const char* kSessionLimitReply = "Exceeded maximum active reporting session limit";

int runOneShot(const ToolOptions& options) {
  const Value sessionInfo = telvane::tool::sessionInfoFor(options, static_cast<long long>(::getpid()));
  const Value userInfo = telvane::tool::userInfoFor(options);
  for (long long i = 0; i < options.count; ++i) {
    Error error;
    Pending<std::optional<std::string>> replied;
    if (!Telvane::sendOneMessageWithSessionInfo(sessionInfo, userInfo, static_cast<std::uint16_t>(options.category),
                                                static_cast<std::uint16_t>(options.type), options.payload, &error,
                                                replied.setter())) {
      return fail("event refused: " + errorText(error));
    }
    auto reply = replied.wait(options.timeoutSeconds);
    if (!reply) return fail("no reply from the daemon within " + std::to_string(options.timeoutSeconds) + " s");
    if (!*reply) {
      // A refusal's reason was logged just before (error level, so it shows).
      return fail("no reply from the daemon at " + telvane::ipcSocketPath() +
                  " (it is not running or it refused the connection)");
    }
    if ((*reply)->rfind(kSessionLimitReply, 0) == 0) {
      return fail("the daemon refused the session: " + **reply);
    }
    std::printf("reply: %s\n", (*reply)->c_str());
  }
  return kExitOk;
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<std::string> arguments(argv + 1, argv + argc);
  auto parsed = telvane::tool::parseToolOptions(arguments);
  if (!parsed) {
    std::fprintf(stderr, "telvane: %s\n%s", parsed.error().c_str(), telvane::tool::kToolUsage);
    return kExitUsage;
  }
  const ToolOptions& options = parsed.value();
  if (options.command == Command::Help) {
    std::fputs(telvane::tool::kToolUsage, stdout);
    return kExitOk;
  }
  telvane::log::useStandardError();
  telvane::log::setLevel(options.verbose ? telvane::log::Level::Info : telvane::log::Level::Error);
  const int exitCode = options.command == Command::OneShot ? runOneShot(options) : runSession(options);
  std::fflush(stdout);
  return exitCode;
}
