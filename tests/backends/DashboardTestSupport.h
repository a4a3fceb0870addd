// Shared set-up of the dashboard backend tests: backends aimed at a loopback collector,
// with the session identity a session would give them.
#pragma once

#include <string>

#include "backends/BackendTestSupport.h"
#include "backends/dashboard/DashboardBackend.h"
#include "support/DashboardDatagramReader.h"
#include "support/UdpTestCollector.h"

namespace telvane::test {

inline constexpr const char* kTestUdid = "0123456789abcdef0123456789abcdef01234567";
// A period the timer never reaches during a test: the test runs the checks itself.
inline constexpr long long kNeverMs = 3'600'000;

class DashboardTestBase : public BackendTestBase {
 protected:
  Value profileFor(std::uint16_t port, std::optional<long long> reliableMs = std::nullopt) {
    Dictionary profile{{"ip", Value("127.0.0.1")},
                       {"port", Value(static_cast<long long>(port))},
                       {"display_url", Value("dashboard.example")},
                       {"post_url", Value("https://logs.example/upload")}};
    if (reliableMs) profile.set("reliable", Value(*reliableMs));
    return Value(std::move(profile));
  }

  void giveIdentity(TelvaneBackendBase& backend) {
    backend.setSessionID(4242);
    backend.setCompType(7);
    backend.setClientVersion(12);
    backend.setUdid(kTestUdid);
    backend.setSelfVersion("8.1.2");
  }

  std::shared_ptr<DashboardBackend> makeDashboard(const Value& profile, DashboardOptions options = {}) {
    auto backend = DashboardBackend::create("dashboard", profile, std::string("Laptop"), platform(), options);
    if (backend) giveIdentity(*backend);
    return backend;
  }

  // Makes and cleans up one reliable backend, so that whatever the executors open on
  // first use (their event loop, their threads' descriptors) is open before a test
  // counts the process's descriptors.
  void warmUp() {
    UdpTestCollector collector(UdpTestCollector::Mode::Silent);
    auto backend = makeDashboard(profileFor(collector.port(), kNeverMs));
    ASSERT_NE(backend, nullptr);
    backend->cleanup();
    ASSERT_TRUE(waitUntil([&] { return backend->socketDescriptor() == -1; }));
    capture.clear();
  }

  static Value event(Dictionary entries) { return Value(std::move(entries)); }

  // Sends one event with the given id at a fixed time.
  static std::optional<std::string> send(DashboardBackend& backend, std::uint16_t eventID,
                                         Dictionary entries = {{"k", Value("v")}}) {
    return backend.sendMessage(event(std::move(entries)), TimeValue{1'700'000'000, 0}, std::uint16_t{3},
                               std::uint16_t{4}, eventID);
  }

  static std::vector<std::uint16_t> queuedIDs(const DashboardBackend& backend) {
    std::vector<std::uint16_t> ids;
    for (const UDPPacketToSend& packet : backend.messageQueueSnapshot()) ids.push_back(packet.eventNumber());
    return ids;
  }
};

}  // namespace telvane::test
