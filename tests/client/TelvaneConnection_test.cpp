// TelvaneConnection: the sandbox look-up check, the first setSessionInfo, restoring a
// session on a new connection, and closing.
#include "client/TelvaneConnection.h"

#include <gtest/gtest.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/Log.h"
#include "support/ClientTestHelpers.h"
#include "support/FakeDaemon.h"
#include "support/WaitUntil.h"

namespace telvane {
namespace {

using test::Awaited;
using test::FakeDaemon;
using test::waitUntil;
using Op = ipc::Operation;

TEST(TelvaneConnectionSandbox, MissingOrWritableSocketIsAllowed) {
  test::TempDir dir;
  EXPECT_EQ(TelvaneConnection::sandboxLookupCheck((dir / "absent.sock").string()), 0);
  test::writeFile(dir / "present", "");
  EXPECT_EQ(TelvaneConnection::sandboxLookupCheck((dir / "present").string()), 0);
}

TEST(TelvaneConnectionSandbox, SocketOfAnotherUserIsRefusedWithTheErrno) {
  test::TempDir dir;
  const auto socket = dir / "private.sock";
  test::writeFile(socket, "");
  ASSERT_EQ(::chmod(socket.c_str(), 0600), 0);
  ASSERT_EQ(::chmod(dir.path().c_str(), 0755), 0);
  if (::geteuid() != 0) {
    // Not our file only when the test runs as root; a plain user checks its own mode.
    ASSERT_EQ(::chmod(socket.c_str(), 0400), 0);
    EXPECT_EQ(TelvaneConnection::sandboxLookupCheck(socket.string()), EACCES);
    return;
  }
  pid_t child = ::fork();
  ASSERT_GE(child, 0);
  if (child == 0) {
    if (::setgid(65534) != 0 || ::setuid(65534) != 0) ::_exit(3);
    ::_exit(TelvaneConnection::sandboxLookupCheck(socket.string()) == EACCES ? 0 : 1);
  }
  int status = 0;
  ASSERT_EQ(::waitpid(child, &status, 0), child);
  ASSERT_TRUE(WIFEXITED(status));
  EXPECT_EQ(WEXITSTATUS(status), 0);
}

class TelvaneConnectionTest : public ::testing::Test {
 protected:
  void SetUp() override {
    TelvaneConnection::SessionSetup setup;
    setup.sessionInfo = test::clientSessionInfo(11, 5);
    setup.userInfo = test::clientUserInfo();
    setup.frameworksToCheck = Value();
    connection_ = TelvaneConnection::create(setup, queue_, std::make_shared<TelvaneAggregationObject>(nullptr));
    connection_->setRestoredStatesHandler([this](Array reply) { restored_.setter()(std::move(reply)); });
    ASSERT_TRUE(connection_->open());
    ASSERT_TRUE(daemon_.waitForCalls(Op::SetSessionInfo, 1));
  }
  void TearDown() override {
    queue_->sync([this] { connection_->close(); });
    connection_->connectionQueue()->sync([] {});
  }
  std::vector<Op> operationsOn(std::size_t connection) {
    std::vector<Op> operations;
    for (const auto& call : daemon_.calls()) {
      if (call.connection == connection) operations.push_back(call.operation);
    }
    return operations;
  }
  // Makes the client notice that the daemon went away: a call left unanswered is lost.
  void dropAndWaitForTheClient() {
    daemon_.setResponder(Op::FlushMessages, [](const FakeDaemon::Call&) { return std::optional<Array>(); });
    Awaited<bool> lost;
    queue_->sync([&] {
      auto remote = connection_->remote();
      ASSERT_TRUE(remote);
      connection_->call(remote.value(), Op::FlushMessages, Array{}, nullptr, [setter = lost.setter()]() mutable {
        setter(true);
      });
    });
    ASSERT_TRUE(daemon_.waitForCalls(Op::FlushMessages, 1));
    daemon_.dropConnections();
    ASSERT_EQ(lost.wait(), std::optional<bool>(true));
  }

  FakeDaemon daemon_;
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("test.reporting");
  std::shared_ptr<TelvaneConnection> connection_;
  Awaited<Array> restored_;
};

TEST_F(TelvaneConnectionTest, NewConnectionRestoresTheSessionBeforeTheCall) {
  daemon_.setReply(Op::StartConfig, Array{Value(Array{Value("brindle")}), Value(), Value()});
  queue_->sync([&] {
    connection_->noteDigestKey(Bytes{1, 2}, 3);
    connection_->noteStarted();
    connection_->noteFetchedUserInfo(test::clientUserInfo("new", "svc"));
  });
  dropAndWaitForTheClient();
  log::LogCapture capture;
  queue_->sync([&] {
    auto remote = connection_->remote();
    ASSERT_TRUE(remote);
    connection_->send(remote.value(), Op::FinishSessionGracefully, Array{});
  });
  ASSERT_TRUE(daemon_.waitForCalls(Op::FinishSessionGracefully, 1));
  EXPECT_TRUE(capture.contains("remote: Reconnected to the daemon, restoring the session"));
  EXPECT_EQ(operationsOn(1), (std::vector<Op>{Op::SetSessionInfo, Op::SetDigestKey, Op::StartConfig, Op::FetchStates,
                                             Op::FinishSessionGracefully}));
  auto sessionInfos = daemon_.calls(Op::SetSessionInfo);
  ASSERT_EQ(sessionInfos.size(), 2u);
  EXPECT_EQ(sessionInfos[1].arguments, sessionInfos[0].arguments);
  EXPECT_EQ(daemon_.calls(Op::FetchStates)[0].arguments, Array{test::clientUserInfo("new", "svc")});
  // The restoring start's reply went to the restored-states handler.
  auto reply = restored_.wait();
  ASSERT_TRUE(reply.has_value());
  EXPECT_EQ((*reply)[0], Value(Array{Value("brindle")}));
}

TEST_F(TelvaneConnectionTest, TheTriggeringStartIsNotRestoredTwice) {
  queue_->sync([&] { connection_->noteStarted(); });
  dropAndWaitForTheClient();
  queue_->sync([&] {
    auto remote = connection_->remote(TelvaneConnection::Restore::ExceptStart);
    ASSERT_TRUE(remote);
    connection_->call(remote.value(), Op::StartConfig, Array{}, nullptr, nullptr);
  });
  ASSERT_TRUE(daemon_.waitForCalls(Op::StartConfig, 1));
  EXPECT_EQ(operationsOn(1), (std::vector<Op>{Op::SetSessionInfo, Op::StartConfig}));
}

TEST_F(TelvaneConnectionTest, NoReconnectionAfterClose) {
  queue_->sync([&] { connection_->close(); });
  connection_->connectionQueue()->sync([] {});
  queue_->sync([&] {
    auto remote = connection_->remote();
    EXPECT_FALSE(remote);
    EXPECT_EQ(remote.error(), "the connection has been closed");
  });
  EXPECT_EQ(daemon_.connectionCount(), 1u);
}

// A daemon that refuses the session: the reason is kept, the calls still waiting are
// lost at once, and no new connection is made.
class TelvaneConnectionRefusalTest : public ::testing::Test {
 protected:
  std::shared_ptr<TelvaneConnection> openConnection() {
    TelvaneConnection::SessionSetup setup;
    setup.sessionInfo = test::clientSessionInfo(7, 6);
    setup.frameworksToCheck = Value();
    auto connection = TelvaneConnection::create(setup, queue_, std::make_shared<TelvaneAggregationObject>(nullptr));
    EXPECT_TRUE(connection->open());
    connections_.push_back(connection);
    return connection;
  }
  // Calls startConfig and waits until it is lost (true: also when no connection is
  // given for it) or answered (false).
  std::optional<bool> startIsLost(TelvaneConnection& connection) {
    Awaited<bool> outcome;
    queue_->sync([&] {
      auto remote = connection.remote();
      if (!remote) {
        outcome.setter()(true);
        return;
      }
      connection.call(
          remote.value(), Op::StartConfig, Array{}, [setter = outcome.setter()](Array) mutable { setter(false); },
          [setter = outcome.setter()]() mutable { setter(true); });
    });
    return outcome.wait();
  }
  void TearDown() override {
    for (auto& connection : connections_) {
      queue_->sync([&] { connection->close(); });
      connection->connectionQueue()->sync([] {});
    }
  }

  FakeDaemon daemon_;
  std::shared_ptr<SerialQueue> queue_ = SerialQueue::create("test.reporting");
  std::vector<std::shared_ptr<TelvaneConnection>> connections_;
};

TEST_F(TelvaneConnectionRefusalTest, RefusalAtAcceptIsKeptAndEndsTheSession) {
  daemon_.refuseNewConnections(std::string("missing the entitlement com.zembra.private.telvaned"));
  log::LogCapture capture;
  auto connection = openConnection();
  // Whether the start goes out before the refusal arrives or not at all, it is lost, and
  // the reason is known by then.
  ASSERT_EQ(startIsLost(*connection), std::optional<bool>(true));
  EXPECT_EQ(connection->connectionError(),
            (Error{"TelvaneErrorDomain", Error::kCodeRefusedByDaemon,
                   "missing the entitlement com.zembra.private.telvaned", Value()}));
  EXPECT_TRUE(capture.contains(
      "initWithSessionInfo: The daemon refused the session: missing the entitlement com.zembra.private.telvaned"));
  queue_->sync([&] {
    auto remote = connection->remote();
    ASSERT_FALSE(remote);
    EXPECT_EQ(remote.error(),
              "the daemon refused the session: missing the entitlement com.zembra.private.telvaned");
  });
  EXPECT_EQ(daemon_.connectionCount(), 1u) << "a refused session makes no new connection";
  EXPECT_TRUE(daemon_.calls().empty());
}

TEST_F(TelvaneConnectionRefusalTest, RefusalOfTheSessionAfterItsHelloIsKept) {
  daemon_.refuseOnCall(Op::SetSessionInfo, "too many active sessions for client type 7 (at most 5)");
  auto connection = openConnection();
  ASSERT_TRUE(daemon_.waitForCalls(Op::SetSessionInfo, 1));
  // The start is lost: the refusing daemon handles nothing after the refused call, or
  // the refusal has arrived before the start was to be sent.
  EXPECT_EQ(startIsLost(*connection), std::optional<bool>(true));
  EXPECT_EQ(connection->connectionError(),
            (Error{"TelvaneErrorDomain", Error::kCodeRefusedByDaemon,
                   "too many active sessions for client type 7 (at most 5)", Value()}));
  EXPECT_TRUE(daemon_.calls(Op::StartConfig).empty());
  queue_->sync([&] { EXPECT_FALSE(connection->remote()); });
  EXPECT_EQ(daemon_.connectionCount(), 1u);
}

TEST_F(TelvaneConnectionRefusalTest, CloseBeforeHelloIsARefusalUntilTheNextConnection) {
  daemon_.refuseNewConnections(std::nullopt);
  auto connection = openConnection();
  ASSERT_TRUE(waitUntil([&] { return connection->connectionError().has_value(); }));
  EXPECT_EQ(connection->connectionError(),
            (Error{"TelvaneErrorDomain", Error::kCodeRefusedByDaemon, "the daemon closed the connection", Value()}));

  // Without a reason the next call tries again, and an accepted connection clears it.
  daemon_.acceptNewConnections();
  EXPECT_EQ(startIsLost(*connection), std::optional<bool>(false));
  EXPECT_EQ(connection->connectionError(), std::nullopt);
  EXPECT_EQ(daemon_.connectionCount(), 2u);
}

TEST_F(TelvaneConnectionRefusalTest, AcceptedSessionThatLosesItsDaemonIsNotRefused) {
  auto connection = openConnection();
  ASSERT_TRUE(daemon_.waitForCalls(Op::SetSessionInfo, 1));
  daemon_.setResponder(Op::FlushMessages, [](const FakeDaemon::Call&) { return std::optional<Array>(); });
  Awaited<bool> lost;
  queue_->sync([&] {
    auto remote = connection->remote();
    ASSERT_TRUE(remote);
    connection->call(remote.value(), Op::FlushMessages, Array{}, nullptr, [setter = lost.setter()]() mutable {
      setter(true);
    });
  });
  ASSERT_TRUE(daemon_.waitForCalls(Op::FlushMessages, 1));
  daemon_.dropConnections();
  ASSERT_EQ(lost.wait(), std::optional<bool>(true));
  EXPECT_EQ(connection->connectionError(), std::nullopt);
}

}  // namespace
}  // namespace telvane
