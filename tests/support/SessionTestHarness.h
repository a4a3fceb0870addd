// Test environments for reporting sessions and the agent.
//
// TestEnvironment gathers the fakes a session touches (settings in memory, a fixed
// device, a manual clock, scripted randomness, recorded message-log lines, a fake
// backend factory) and yields the SessionEnvironment built from them.
//
// SessionTestHarness runs one real TelvanedSession over a real connection pair with a
// FakeSessionDelegate: the client end is an IpcTestClient, the session is exported
// through ClientSessionInterface, and the connection's invalidation tears the session
// down as the agent would. `run` executes code on the session's queue.
#pragma once

#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <vector>

#include <gtest/gtest.h>

#include "platform/DeviceFacts.h"
#include "platform/Log.h"
#include "platform/SettingsStore.h"
#include "session/ClientSessionInterface.h"
#include "session/SessionEnvironment.h"
#include "session/TelvanedSession.h"
#include "support/FakeBackend.h"
#include "support/FakeSessionDelegate.h"
#include "support/IpcTestClient.h"
#include "support/ManualClock.h"
#include "support/ScriptedRandom.h"
#include "support/WaitUntil.h"

namespace telvane::test {

inline constexpr const char* kTestDeviceID = "0123456789abcdef0123456789abcdef01234567";

class LineRecorder {
 public:
  void add(const std::string& line) {
    std::lock_guard<std::mutex> lock(mutex_);
    lines_.push_back(line);
  }
  std::vector<std::string> lines() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return lines_;
  }
  bool contains(const std::string& line) const {
    std::lock_guard<std::mutex> lock(mutex_);
    for (const auto& l : lines_) {
      if (l == line) return true;
    }
    return false;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::string> lines_;
};

struct TestEnvironment {
  std::shared_ptr<SettingsStore> settings = makeMemorySettingsStore();
  std::shared_ptr<ManualClock> clock = std::make_shared<ManualClock>();
  std::shared_ptr<ScriptedRandom> random = std::make_shared<ScriptedRandom>();
  std::shared_ptr<LineRecorder> messageLog = std::make_shared<LineRecorder>();
  std::shared_ptr<FakeBackendFactory> backends = std::make_shared<FakeBackendFactory>();
  std::map<std::string, std::string> deviceFacts = {
      {"UniqueDeviceID", kTestDeviceID}, {"SerialNumber", "SN-42"}, {"ProductVersion", "12.1"},
      {"BuildVersion", "B100"},          {"HWModelStr", "HW-7"},    {"DeviceName", "Workstation"}};
  bool internalBuild = false;
  std::optional<std::string> bundleVersion = std::string("1.2.3");
  std::optional<std::string> locale = std::string("DE");
  std::uint64_t taskMemory = 123456;

  SessionEnvironment environment() const {
    SessionEnvironment env;
    env.settings = settings;
    env.deviceInfo = std::make_shared<const DeviceInfo>(makeFixedDeviceFacts(deviceFacts));
    env.random = random;
    env.clock = clock;
    env.internalBuild = internalBuild;
    env.frameworkBundleVersion = [v = bundleVersion] { return v; };
    env.localeCountryCode = [v = locale] { return v; };
    env.taskMemoryBytes = [v = taskMemory] { return v; };
    env.messageLog = [recorder = messageLog](const std::string& line) { recorder->add(line); };
    env.backendFactory = FakeBackendFactory::make(backends);
    return env;
  }
};

class SessionTestHarness {
 public:
  explicit SessionTestHarness(const TestEnvironment& environment,
                              std::shared_ptr<FakeSessionDelegate> delegate = std::make_shared<FakeSessionDelegate>())
      : delegate_(std::move(delegate)) {
    auto pair = makeConnectionPair();
    daemonConnection_ = pair.daemon;
    session_ = TelvanedSession::create(delegate_, pair.daemon, environment.environment());
    ClientSessionInterface::exportSession(pair.daemon, session_);
    pair.daemon->setInvalidationHandler(
        [delegate = delegate_, session = session_] { delegate->connectionInvalidated(session); });
    pair.daemon->resume();
    client_ = std::make_unique<IpcTestClient>(pair.client);
  }

  ~SessionTestHarness() {
    daemonConnection_->invalidate();
    waitUntil([&] { return session_->isTornDown(); });
    client_.reset();
  }

  // Runs the code on the session's queue and waits for it.
  void run(const std::function<void()>& work) { session_->queue()->sync(work); }

  // Closes the client's end and waits until the session has been torn down.
  bool closeAndWaitForTeardown() {
    client_->close();
    return waitUntil([&] { return session_->isTornDown(); });
  }

  const std::shared_ptr<TelvanedSession>& session() const { return session_; }
  const std::shared_ptr<FakeSessionDelegate>& delegate() const { return delegate_; }
  IpcTestClient& client() { return *client_; }

 private:
  std::shared_ptr<FakeSessionDelegate> delegate_;
  std::shared_ptr<IpcConnection> daemonConnection_;
  std::shared_ptr<TelvanedSession> session_;
  std::unique_ptr<IpcTestClient> client_;
};

// A session-info map.
inline Value sessionInfoMap(long componentType, unsigned sessionID, Dictionary extra = {}) {
  Dictionary info = std::move(extra);
  info.set("ComponentType", Value(componentType));
  info.set("SessionID", Value(sessionID));
  return Value(std::move(info));
}

inline Value hierarchyToken(const std::string& token, long level) {
  return Value(Dictionary{{"token", Value(token)}, {"level", Value(level)}});
}

// The common fixture of the session tests: a log capture, a test environment, and
// backends added to what the environment's factory yields.
class SessionTest : public ::testing::Test {
 protected:
  std::shared_ptr<FakeBackend> addBackend(const std::string& name = "a-splunk",
                                          BackendKind kind = BackendKind::HTTPSPost) {
    auto backend = std::make_shared<FakeBackend>(name, kind);
    env.backends->add(backend);
    return backend;
  }

  log::LogCapture capture;
  TestEnvironment env;
};

}  // namespace telvane::test
