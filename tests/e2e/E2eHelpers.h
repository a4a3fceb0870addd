// Helpers shared by the end-to-end tests: raw protocol sessions (for component types
// the client library refuses), waiting for replies, and pointing the client library
// at a test daemon.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <chrono>
#include <cstdlib>
#include <future>
#include <memory>
#include <string>

#include "platform/IpcConnection.h"
#include "platform/SerialQueue.h"
#include "support/DaemonProcess.h"
#include "support/SignedEnvelope.h"
#include "support/StorebagBuilder.h"
#include "support/TlsTestServer.h"
#include "telvane/Telvane.h"
#include "telvane/Value.h"

namespace telvane::test {

// Makes this process's client library use the daemon's socket.
inline void useDaemon(const DaemonProcess& daemon) { ::setenv("TELVANED_SOCKET", daemon.socketPath().c_str(), 1); }

// A session opened with the wire protocol itself.
struct RawSession {
  std::shared_ptr<IpcConnection> connection;
  std::shared_ptr<std::promise<void>> ended = std::make_shared<std::promise<void>>();
  std::shared_future<void> endedFuture = ended->get_future().share();

  bool waitEnded(std::chrono::milliseconds timeout = std::chrono::seconds(20)) const {
    return endedFuture.wait_for(timeout) == std::future_status::ready;
  }
};

inline RawSession openRawSession(const std::string& socketPath, const Value& sessionInfo,
                                 const Value& userInfo = Value()) {
  RawSession session;
  auto connected = IpcConnection::connect(socketPath, SerialQueue::create("e2e.raw"));
  EXPECT_TRUE(connected.ok()) << connected.error();
  if (!connected.ok()) return session;
  session.connection = connected.value();
  auto ended = session.ended;
  auto once = std::make_shared<std::once_flag>();
  auto end = [ended, once] { std::call_once(*once, [&] { ended->set_value(); }); };
  session.connection->setInterruptionHandler(end);
  session.connection->setInvalidationHandler(end);
  session.connection->resume();
  session.connection->call(ipc::Operation::SetSessionInfo,
                           Array{sessionInfo, userInfo, Value(Array{}), Value(false)});
  return session;
}

// Calls an operation and waits for its reply (nullopt when none came in time).
inline std::optional<Array> callAndWait(IpcConnection& connection, ipc::Operation operation, Array arguments,
                                        std::chrono::milliseconds timeout = std::chrono::seconds(20)) {
  auto promise = std::make_shared<std::promise<Array>>();
  auto future = promise->get_future();
  connection.call(operation, std::move(arguments), [promise](Array reply) { promise->set_value(std::move(reply)); });
  if (future.wait_for(timeout) != std::future_status::ready) return std::nullopt;
  return future.get();
}

// Serves the document, signed with the test key, as the storebag of client types 7,
// 11, 13 and 20 ("<server>/bags/confera"), fresh for an hour.
inline void serveConferaStorebag(TlsTestServer& server, const StorebagBuilder& document) {
  Bytes envelope = SignedEnvelopeBuilder().sign(document.build());
  ScriptedAnswer answer;
  answer.headers = {{"Cache-Control", "max-age=3600"}};
  answer.body.assign(envelope.begin(), envelope.end());
  server.setAnswer("/bags/confera", answer);
}

// A client session of the client library, started: waits for the daemon's start reply.
inline std::unique_ptr<Telvane> startedSession(const Value& sessionInfo, const Value& userInfo) {
  auto session = Telvane::create(sessionInfo, userInfo, Value());
  EXPECT_TRUE(session);
  if (!session) return session;
  auto started = std::make_shared<std::promise<bool>>();
  session->startConfigurationWithCompletionHandler([started](bool received) { started->set_value(received); });
  EXPECT_EQ(started->get_future().wait_for(std::chrono::seconds(20)), std::future_status::ready);
  return session;
}

inline Value sessionInfoFor(long componentType, unsigned sessionID) {
  return Value(Dictionary{{"ComponentType", Value(componentType)}, {"SessionID", Value(sessionID)}});
}

}  // namespace telvane::test
