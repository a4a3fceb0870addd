// Telvane: creation, the class operations (hierarchy tokens, persistent identifiers)
// and teardown, against a fake daemon.
#include "telvane/Telvane.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <atomic>
#include <cstdlib>
#include <future>
#include <mutex>
#include <thread>

#include "platform/Log.h"
#include "platform/SettingsStore.h"
#include "support/ClientTestHelpers.h"
#include "support/FakeDaemon.h"

namespace telvane {
namespace {

using test::FakeDaemon;
using Op = ipc::Operation;

// 8-4-4-4-12 upper-case hexadecimal digits.
bool isCanonicalUuid(const std::string& text) {
  if (text.size() != 36) return false;
  for (std::size_t i = 0; i < text.size(); ++i) {
    const bool dash = i == 8 || i == 13 || i == 18 || i == 23;
    const char c = text[i];
    if (dash ? c != '-' : !((c >= '0' && c <= '9') || (c >= 'A' && c <= 'F'))) return false;
  }
  return true;
}

TEST(TelvaneCreate, ComponentTypeOutsideFiveToThirtyMakesNoObject) {
  FakeDaemon daemon;
  for (long long type : {4LL, 31LL, 0LL, -7LL}) {
    SCOPED_TRACE(type);
    log::LogCapture capture;
    Error error;
    auto telvane = Telvane::create(test::clientSessionInfo(type), Value(), Value(), nullptr, &error);
    EXPECT_EQ(telvane, nullptr);
    EXPECT_EQ(error.domain, "TelvaneErrorDomain");
    EXPECT_EQ(error.code, 3);
    EXPECT_TRUE(capture.contains("validateSessionInfo: clientType is invalid"));
    EXPECT_FALSE(capture.contains("startLogging: Client starts logging..."));
  }
  EXPECT_EQ(daemon.connectionCount(), 0u);
}

TEST(TelvaneCreate, BoundaryComponentTypesAreAccepted) {
  FakeDaemon daemon;
  EXPECT_NE(Telvane::create(test::clientSessionInfo(5), Value(), Value()), nullptr);
  EXPECT_NE(Telvane::create(test::clientSessionInfo(30), Value(), Value()), nullptr);
}

TEST(TelvaneCreate, MissingSessionInfoGivesCodeTwo) {
  FakeDaemon daemon;
  log::LogCapture capture;
  Error error;
  EXPECT_EQ(Telvane::create(Value(), Value(), Value(), nullptr, &error), nullptr);
  EXPECT_EQ(error.domain, "TelvaneErrorDomain");
  EXPECT_EQ(error.code, 2);
  EXPECT_TRUE(capture.contains("validateSessionInfo: sessionInfo is nil"));
  EXPECT_EQ(daemon.connectionCount(), 0u);
}

TEST(TelvaneCreate, EnableFlagZeroDisablesTheSession) {
  FakeDaemon daemon;
  log::LogCapture capture;
  Value info = test::clientSessionInfo();
  info.asDictionary()->set(kTelvaneSessionInfoEnableFlag, Value(0));
  EXPECT_EQ(Telvane::create(info, Value(), Value()), nullptr);
  EXPECT_TRUE(capture.contains("startLogging: Client starts logging..."));
  EXPECT_TRUE(capture.contains("initWithSessionInfo: the session is disabled"));
  EXPECT_EQ(daemon.connectionCount(), 0u);

  // Any other value keeps it on.
  info.asDictionary()->set(kTelvaneSessionInfoEnableFlag, Value(1));
  EXPECT_NE(Telvane::create(info, Value(), Value()), nullptr);
}

TEST(TelvaneCreate, NoDaemonMakesNoObject) {
  test::TempDir dir;
  const char* previous = std::getenv("TELVANED_SOCKET");
  std::string saved = previous ? previous : "";
  ::setenv("TELVANED_SOCKET", (dir / "nobody-listens.sock").c_str(), 1);
  log::LogCapture capture;
  EXPECT_EQ(Telvane::create(test::clientSessionInfo(), Value(), Value()), nullptr);
  EXPECT_TRUE(capture.contains("initWithSessionInfo: Failed to connect to daemon"));
  if (previous) {
    ::setenv("TELVANED_SOCKET", saved.c_str(), 1);
  } else {
    ::unsetenv("TELVANED_SOCKET");
  }
}

TEST(TelvaneCreate, SocketTheProcessMayNotUseIsRefused) {
  FakeDaemon daemon;
  // The socket file belongs to root; a process of another user may not write to it.
  ASSERT_EQ(::chmod(daemon.socketPath().c_str(), 0600), 0);
  ASSERT_EQ(::chmod(std::filesystem::path(daemon.socketPath()).parent_path().c_str(), 0755), 0);
  if (::geteuid() != 0) {
    log::LogCapture capture;
    EXPECT_EQ(Telvane::create(test::clientSessionInfo(), Value(), Value()), nullptr);
    EXPECT_TRUE(capture.contains("initWithSessionInfo: IPC not entitled, 13"));
    return;
  }
  // As root, refuse in a child that has become an ordinary user.
  pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (::setgid(65534) != 0 || ::setuid(65534) != 0) ::_exit(3);
    log::LogCapture capture;
    auto telvane = Telvane::create(test::clientSessionInfo(), Value(), Value());
    const bool refused = telvane == nullptr && capture.contains("initWithSessionInfo: IPC not entitled, 13");
    ::_exit(refused ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
  EXPECT_EQ(daemon.connectionCount(), 0u);
}

TEST(TelvaneCreate, SetSessionInfoIsTheFirstCallAndCarriesTheAggregationFlag) {
  FakeDaemon daemon;
  Value frameworks(Array{Value("com.example.Framework")});
  {
    auto telvane = Telvane::create(test::clientSessionInfo(7, 99), test::clientUserInfo(), frameworks,
                                   [](const Value&, double, std::uint16_t, std::uint16_t, const Value&) {});
    ASSERT_NE(telvane, nullptr);
    telvane->finishSession();
  }
  ASSERT_TRUE(daemon.waitForCalls(Op::FinishSessionGracefully, 1));
  auto calls = daemon.calls();
  ASSERT_GE(calls.size(), 2u);
  EXPECT_EQ(calls[0].operation, Op::SetSessionInfo);
  EXPECT_FALSE(calls[0].expectsReply);
  ASSERT_EQ(calls[0].arguments.size(), 4u);
  EXPECT_EQ(calls[0].arguments[0], test::clientSessionInfo(7, 99));
  EXPECT_EQ(calls[0].arguments[1], test::clientUserInfo());
  EXPECT_EQ(calls[0].arguments[2], frameworks);
  EXPECT_EQ(calls[0].arguments[3], Value(true));

  auto plain = Telvane::create(test::clientSessionInfo(8), Value(), Value());
  ASSERT_NE(plain, nullptr);
  ASSERT_TRUE(daemon.waitForCalls(Op::SetSessionInfo, 2));
  auto second = daemon.calls(Op::SetSessionInfo)[1];
  EXPECT_EQ(second.arguments[1], Value());
  EXPECT_EQ(second.arguments[3], Value(false));
}

TEST(TelvaneTeardown, CallsQueuedJustBeforeDestructionReachTheDaemon) {
  FakeDaemon daemon;
  log::LogCapture capture;
  {
    auto telvane = Telvane::create(test::clientSessionInfo(), Value(), Value());
    ASSERT_NE(telvane, nullptr);
    for (int i = 1; i <= 20; ++i) telvane->sendMessageWithCategory(static_cast<std::uint16_t>(i), 1, Value());
    telvane->flushMessages();
    telvane->finishSession();
  }
  EXPECT_TRUE(capture.contains("aboutToDealloc: Client stops logging..."));
  ASSERT_TRUE(daemon.waitForDisconnect(0));
  auto calls = daemon.calls();
  ASSERT_EQ(calls.size(), 23u);
  EXPECT_EQ(calls[21].operation, Op::FlushMessages);
  EXPECT_EQ(calls[22].operation, Op::FinishSessionGracefully);
  // The connection ends after them.
  EXPECT_TRUE(capture.contains("initWithSessionInfo: IPC connection invalidated"));
}

TEST(TelvaneTeardown, CompletionsOfAnsweredCallsRunBeforeTheDestructorReturns) {
  FakeDaemon daemon;
  daemon.setReply(Op::FlushMessages, Array{Value("flushed"), Value()});
  std::atomic<int> completions{0};
  {
    auto telvane = Telvane::create(test::clientSessionInfo(), Value(), Value());
    ASSERT_NE(telvane, nullptr);
    telvane->flushMessagesWithCompletion([&](const std::optional<Error>& error) {
      if (!error) ++completions;
    });
  }
  EXPECT_EQ(completions.load(), 1);
}

TEST(TelvaneTeardown, UnansweredCallDoesNotHoldTheDestructor) {
  FakeDaemon daemon;
  daemon.setResponder(Op::FlushMessages, [](const FakeDaemon::Call&) { return std::optional<Array>(); });
  std::atomic<int> completions{0};
  {
    auto telvane = Telvane::create(test::clientSessionInfo(), Value(), Value());
    ASSERT_NE(telvane, nullptr);
    telvane->flushMessagesWithCompletion([&](const std::optional<Error>&) { ++completions; });
    telvane->finishSession();
  }
  ASSERT_TRUE(daemon.waitForDisconnect(0));
  EXPECT_EQ(daemon.calls(Op::FinishSessionGracefully).size(), 1u);
  // The reply never came: the completion is never called.
  EXPECT_EQ(completions.load(), 0);
}

TEST(TelvaneHierarchyToken, RootTokenIsARandomUuidAtLevelZero) {
  Value first = Telvane::newHierarchyTokenFromParentToken(Value());
  Value second = Telvane::newHierarchyTokenFromParentToken(Value());
  ASSERT_TRUE(first.isDictionary());
  const std::string token = first[kTelvaneHierarchyTokenTokenID].stringOrEmpty();
  EXPECT_TRUE(isCanonicalUuid(token)) << token;
  EXPECT_EQ(first[kTelvaneHierarchyTokenLevel], Value(0));
  EXPECT_NE(first[kTelvaneHierarchyTokenTokenID], second[kTelvaneHierarchyTokenTokenID]);
}

TEST(TelvaneHierarchyToken, ChildKeepsTheTokenOneLevelDown) {
  Value parent(Dictionary{{"token", Value("ABC")}, {"level", Value(2)}});
  Value child = Telvane::newHierarchyTokenFromParentToken(parent);
  EXPECT_EQ(child, Value(Dictionary{{"token", Value("ABC")}, {"level", Value(3)}}));
  EXPECT_FALSE(child.sharesContainerWith(parent));
  EXPECT_TRUE(Telvane::newHierarchyTokenFromParentToken(Value("not a map")).isNull());
  EXPECT_TRUE(Telvane::newHierarchyTokenFromParentToken(Value(Array{})).isNull());
}

TEST(TelvanePersistentIdentifiers, WithoutADaemonTheAnswerIsEmptyAndLogged) {
  test::TempDir dir;
  ::setenv("TELVANED_SOCKET", (dir / "no-daemon.sock").c_str(), 1);
  log::LogCapture capture;
  EXPECT_EQ(Telvane::getPersistentIdentifierForDNU(true), "");
  EXPECT_EQ(Telvane::regeneratePersistentIdentifierForDNU(false), "");
  EXPECT_TRUE(capture.containsPrefix("getPersistentIdentifierForDNU: Failed to connect to daemon: "));
  EXPECT_TRUE(capture.containsPrefix("regeneratePersistentIdentifierForDNU: Failed to connect to daemon: "));
  ::unsetenv("TELVANED_SOCKET");
}

}  // namespace
}  // namespace telvane
