// The one-shot send against a fake daemon.
#include "client/OneShotSender.h"

#include <gtest/gtest.h>

#include <cstdlib>

#include "platform/Log.h"
#include "support/ClientTestHelpers.h"
#include "support/FakeDaemon.h"

namespace telvane {
namespace {

using test::Awaited;
using test::FakeDaemon;
using Op = ipc::Operation;

TEST(OneShotSender, SendsOneEventOverAFreshConnection) {
  FakeDaemon daemon;
  Value info = test::clientSessionInfo(9, 77);
  info.asDictionary()->set(kTelvaneSessionInfoBatchEvent, Value(true));
  Value payload(Dictionary{{"count", Value(3)}});
  log::LogCapture capture;
  Awaited<std::optional<std::string>> replied;
  EXPECT_TRUE(Telvane::sendOneMessageWithSessionInfo(info, test::clientUserInfo(), 12, 34, payload, nullptr,
                                                     replied.setter()));
  EXPECT_EQ(replied.wait(), std::optional<std::optional<std::string>>(std::string("finished")));
  EXPECT_TRUE(capture.contains("startLogging: Client starts logging..."));

  auto sends = daemon.calls(Op::SendMessageWithSessionInfo);
  ASSERT_EQ(sends.size(), 1u);
  Value expectedInfo = info.deepCopy();
  // A single event is never batched.
  expectedInfo.asDictionary()->set(kTelvaneSessionInfoBatchEvent, Value(false));
  EXPECT_EQ(sends[0].arguments,
            (Array{expectedInfo, test::clientUserInfo(), Value(12), Value(34), payload}));
  EXPECT_TRUE(sends[0].expectsReply);
  // The caller's map is left alone.
  EXPECT_EQ(info[kTelvaneSessionInfoBatchEvent], Value(true));

  // A second send makes its own connection; nothing else is said on them.
  Awaited<std::optional<std::string>> second;
  EXPECT_TRUE(Telvane::sendOneMessageWithSessionInfo(info, Value(), 1, 2, Value(), nullptr, second.setter()));
  EXPECT_TRUE(second.wait().has_value());
  EXPECT_EQ(daemon.connectionCount(), 2u);
  auto calls = daemon.calls();
  ASSERT_EQ(calls.size(), 2u);
  EXPECT_EQ(calls[1].connection, 1u);
  EXPECT_EQ(calls[1].arguments[1], Value());
  EXPECT_EQ(calls[1].arguments[4], Value());
}

TEST(OneShotSender, RefusedSessionInfoAndCategoryZero) {
  FakeDaemon daemon;
  Error error;
  EXPECT_FALSE(Telvane::sendOneMessageWithSessionInfo(test::clientSessionInfo(31), Value(), 1, 1, Value(), &error));
  EXPECT_EQ(error.code, 3);
  EXPECT_FALSE(Telvane::sendOneMessageWithSessionInfo(Value(), Value(), 1, 1, Value(), &error));
  EXPECT_EQ(error.code, 2);
  error = Error{};
  EXPECT_FALSE(Telvane::sendOneMessageWithSessionInfo(test::clientSessionInfo(), Value(), 0, 1, Value(), &error));
  EXPECT_EQ(error.domain, "TelvaneErrorDomain");
  EXPECT_EQ(error.code, 4);
  EXPECT_EQ(daemon.connectionCount(), 0u);
}

TEST(OneShotSender, NoDaemonIsLoggedAndAnsweredWithNoReply) {
  test::TempDir dir;
  const char* previous = std::getenv("TELVANED_SOCKET");
  std::string saved = previous ? previous : "";
  ::setenv("TELVANED_SOCKET", (dir / "absent.sock").c_str(), 1);
  log::LogCapture capture;
  Awaited<std::optional<std::string>> replied;
  EXPECT_TRUE(Telvane::sendOneMessageWithSessionInfo(test::clientSessionInfo(), Value(), 5, 6, Value(), nullptr,
                                                     replied.setter()));
  auto reply = replied.wait();
  ASSERT_TRUE(reply.has_value());
  EXPECT_FALSE(reply->has_value());
  EXPECT_TRUE(capture.contains("sendOneMessageWithSessionInfo: Failed to connect to daemon"));
  if (previous) {
    ::setenv("TELVANED_SOCKET", saved.c_str(), 1);
  } else {
    ::unsetenv("TELVANED_SOCKET");
  }
}

TEST(OneShotSender, DaemonThatGoesAwayWithoutReplyingEndsTheSend) {
  FakeDaemon daemon;
  daemon.setResponder(Op::SendMessageWithSessionInfo, [](const FakeDaemon::Call&) { return std::optional<Array>(); });
  log::LogCapture capture;
  Awaited<std::optional<std::string>> replied;
  EXPECT_TRUE(Telvane::sendOneMessageWithSessionInfo(test::clientSessionInfo(), Value(), 5, 6, Value(), nullptr,
                                                     replied.setter()));
  ASSERT_TRUE(daemon.waitForCalls(Op::SendMessageWithSessionInfo, 1));
  daemon.dropConnections();
  auto reply = replied.wait();
  ASSERT_TRUE(reply.has_value());
  EXPECT_FALSE(reply->has_value());
  EXPECT_TRUE(capture.contains("sendOneMessageWithSessionInfo: IPC connection interrupted"));
}

}  // namespace
}  // namespace telvane
