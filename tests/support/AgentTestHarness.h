// AgentTestHarness: a real TelvanedAgent accepting real connections from in-process
// clients (IpcTestClient over socket pairs), with a recording keep-alive, a settable
// entitlement answer and the fakes of TestEnvironment. Each session it opens gets
// fresh fake backends when the test builds them (`buildBackends`).
//
// The destructor closes every client and waits until the agent's registry is empty
// and every session has been torn down.
#pragma once

#include <algorithm>
#include <atomic>
#include <memory>
#include <mutex>
#include <optional>
#include <vector>

#include "daemon/TelvanedAgent.h"
#include "support/FakeBackend.h"
#include "support/IpcTestClient.h"
#include "support/RecordingKeepAlive.h"
#include "support/SessionTestHarness.h"
#include "support/WaitUntil.h"

namespace telvane::test {

class AgentTestHarness {
 public:
  struct Opened {
    std::shared_ptr<TelvanedSession> session;
    IpcTestClient* client = nullptr;
  };

  // The names of the backends every session gets from buildBackends().
  explicit AgentTestHarness(std::vector<std::string> backendNames = {"a"}) : backendNames_(std::move(backendNames)) {
    TelvanedAgent::Options options;
    options.keepAlive = keepAlive;
    options.entitlementLookup = [this](const IpcConnection&, const std::string& entitlement) -> std::optional<bool> {
      std::lock_guard<std::mutex> lock(mutex_);
      lookedUp_.push_back(entitlement);
      return entitlement_;
    };
    SessionEnvironment environment = testEnvironment.environment();
    auto names = backendNames_;
    environment.backendFactory = [names](const Value&, const Value&, const Value&, const std::string&) {
      BackendMap map;
      for (const auto& name : names) map[name] = std::make_shared<FakeBackend>(name);
      return map;
    };
    options.environment = environment;
    agent = TelvanedAgent::create(std::move(options));
  }

  ~AgentTestHarness() {
    std::vector<std::unique_ptr<IpcTestClient>> clients;
    std::vector<std::shared_ptr<TelvanedSession>> sessions;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      clients.swap(clients_);
      sessions.swap(sessions_);
    }
    for (auto& client : clients) client->close();
    waitUntil([&] { return agent->sessionCount() == 0; });
    for (auto& session : sessions) waitUntil([&] { return session->isTornDown(); });
    clients.clear();
  }

  void setEntitlement(std::optional<bool> value) {
    std::lock_guard<std::mutex> lock(mutex_);
    entitlement_ = value;
  }
  std::vector<std::string> lookedUpEntitlements() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return lookedUp_;
  }

  // Accepts a new connection; the session is null when the agent refused it.
  Opened open() {
    auto [daemonEnd, clientEnd] = makeSocketPair();
    auto client = IpcTestClient::adopt(std::move(clientEnd));
    Opened opened;
    opened.client = client.get();
    opened.session = agent->acceptConnection(std::move(daemonEnd));
    std::lock_guard<std::mutex> lock(mutex_);
    if (opened.session) sessions_.push_back(opened.session);
    clients_.push_back(std::move(client));
    return opened;
  }

  // Opens a session and sets its session info; waits until the session has handled it.
  Opened openWithInfo(const Value& sessionInfo, bool aggregator = false, const Value& userInfo = Value()) {
    Opened opened = open();
    opened.client->send(ipc::Operation::SetSessionInfo,
                        Array{sessionInfo, userInfo, Value::array(), Value(aggregator)});
    opened.client->call(ipc::Operation::FetchDisplayURL, {});
    return opened;
  }

  // Builds the session's backends (fresh fakes) on its queue.
  static void buildBackends(const std::shared_ptr<TelvanedSession>& session) {
    session->queue()->sync([&] {
      session->createBackendsWithStorebag(Value::dictionary());
      session->updateReportingStates();
    });
  }

  static std::shared_ptr<FakeBackend> backend(const std::shared_ptr<TelvanedSession>& session,
                                              const std::string& name) {
    return std::dynamic_pointer_cast<FakeBackend>(session->backendNamed(name));
  }

  // Closes the client and waits until the agent has removed the session.
  static bool close(const Opened& opened, TelvanedAgent& agent) {
    opened.client->close();
    return waitUntil([&] {
      auto sessions = agent.copyReportingAgentState().sessionList;
      return std::find(sessions.begin(), sessions.end(), opened.session) == sessions.end() &&
             opened.session->isTornDown();
    });
  }
  bool close(const Opened& opened) { return close(opened, *agent); }

  TestEnvironment testEnvironment;
  std::shared_ptr<RecordingKeepAlive> keepAlive = std::make_shared<RecordingKeepAlive>();
  std::shared_ptr<TelvanedAgent> agent;

 private:
  const std::vector<std::string> backendNames_;
  mutable std::mutex mutex_;
  std::optional<bool> entitlement_ = true;
  std::vector<std::string> lookedUp_;
  std::vector<std::unique_ptr<IpcTestClient>> clients_;
  std::vector<std::shared_ptr<TelvanedSession>> sessions_;
};

}  // namespace telvane::test
