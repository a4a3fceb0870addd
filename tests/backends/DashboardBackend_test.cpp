#include "backends/dashboard/DashboardBackend.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>

#include <gtest/gtest.h>

#include <cstdio>
#include <cstring>

#include "backends/DashboardTestSupport.h"
#include "util/ComponentTags.h"

namespace telvane {
namespace {

using test::UdpTestCollector;

class DashboardBackendTest : public test::DashboardTestBase {
 protected:
  // The one datagram the collector got after the backend sent it.
  test::ReadDatagram onlyDatagram(const UdpTestCollector& collector) {
    EXPECT_TRUE(collector.waitForCount(1));
    std::vector<Bytes> datagrams = collector.datagrams();
    EXPECT_EQ(datagrams.size(), 1u);
    if (datagrams.empty()) return {};
    std::optional<test::ReadDatagram> read = test::readDatagram(datagrams[0]);
    EXPECT_TRUE(read.has_value());
    if (read) {
      EXPECT_EQ(read->totalLength, datagrams[0].size());
    }
    return read.value_or(test::ReadDatagram{});
  }

  // The port the backend's socket is connected to.
  static std::optional<std::uint16_t> peerPort(const DashboardBackend& backend) {
    sockaddr_in peer{};
    socklen_t length = sizeof peer;
    if (::getpeername(backend.socketDescriptor(), reinterpret_cast<sockaddr*>(&peer), &length) != 0) {
      return std::nullopt;
    }
    return ntohs(peer.sin_port);
  }
};

TEST_F(DashboardBackendTest, TheDatagramCarriesTheHeaderFieldsAndTheTextSortedByValueLength) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeDashboard(profileFor(collector.port()));
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(backend->kind(), BackendKind::Dashboard);
  EXPECT_FALSE(backend->reliableUDP());
  EXPECT_TRUE(backend->usingProfile());
  EXPECT_EQ(backend->displayURL(), std::optional<std::string>("dashboard.example"));

  std::optional<std::string> record =
      backend->sendMessage(event({{"zeta", Value("ccc")}, {"alpha", Value("bb")}, {"mid", Value(7)}}),
                           TimeValue{12, 345678}, std::uint16_t{513}, std::uint16_t{1027}, std::uint16_t{300});
  test::ReadDatagram d = onlyDatagram(collector);
  EXPECT_EQ(d.majorVersion, 8u);
  EXPECT_EQ(d.componentType, 7u);
  EXPECT_EQ(d.constantOne, 1u);
  EXPECT_EQ(d.timeQuarterMs, 86u);
  EXPECT_EQ(d.seconds, 12u);
  EXPECT_EQ(d.sessionID, 4242u);
  EXPECT_EQ(d.clientVersion, 12u);
  EXPECT_EQ(d.method, 513u);
  EXPECT_EQ(d.responseCode, 1027u);
  EXPECT_EQ(d.deviceID, test::kTestUdid);
  EXPECT_EQ(d.eventID, 300u);
  EXPECT_EQ(d.flags, 0u);  // no reliability, address from the profile
  EXPECT_EQ(d.text, " mid=7 alpha=bb zeta=ccc");
  EXPECT_EQ(d.totalLength, 64u + d.text.size());

  // The complemented fields are written complemented on the wire.
  Bytes raw = collector.datagrams()[0];
  EXPECT_EQ(raw[8], 0xFF);
  EXPECT_EQ(raw[11], static_cast<std::uint8_t>(~(4242 & 0xFF)));
  EXPECT_EQ(raw[13], static_cast<std::uint8_t>(~12));

  ASSERT_TRUE(record.has_value());
  char expected[1152];
  std::snprintf(expected, sizeof expected, "12.344 %s 127.0.0.1 %s %5u %5u %5u %5u %5u %s", test::kTestUdid,
                std::string(*componentTag(7)).c_str(), 12u, 4242u, 300u, 513u, 1027u, " mid=7 alpha=bb zeta=ccc");
  EXPECT_EQ(*record, expected);
}

TEST_F(DashboardBackendTest, SanitisingEscapesEqualsAndBackslashAndDropsNewlines) {
  EXPECT_EQ(DashboardBackend::sanitize("a=b\\c"), "a\\=b\\\\c");
  EXPECT_EQ(DashboardBackend::sanitize("two\nlines\n"), "twolines");
  EXPECT_EQ(DashboardBackend::sanitize(""), "empty");
  EXPECT_EQ(DashboardBackend::sanitize("\n\n"), "empty");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value("text")), "text");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value(-5)), "-5");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value(18446744073709551615ull)), "18446744073709551615");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value(0.1)), "0.1");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value(2.5)), "2.5");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value(true)), "1");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value(false)), "0");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value()), "null");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value::array()), "null");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value::dictionary()), "null");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value(Bytes{1, 2})), "null");
  EXPECT_EQ(DashboardBackend::descriptionForObject(Value::date(5.0)), "null");
}

TEST_F(DashboardBackendTest, ValuesAreSanitisedInTheDatagramText) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeDashboard(profileFor(collector.port()));
  ASSERT_NE(backend, nullptr);
  backend->sendMessage(event({{"a", Value("a=b\\c")}, {"b", Value("")}, {"c", Value(Array{Value(1)})}}),
                       TimeValue{1, 0}, std::uint16_t{0}, std::uint16_t{0}, std::uint16_t{1});
  // Lengths before sanitising: "" 0, "null" 4, "a=b\c" 5.
  EXPECT_EQ(onlyDatagram(collector).text, " b=empty c=null a=a\\=b\\\\c");
}

TEST_F(DashboardBackendTest, ALongTextIsCutAt1023CharactersAndTheLengthFieldCoversTheCutText) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeDashboard(profileFor(collector.port()));
  ASSERT_NE(backend, nullptr);
  std::optional<std::string> record = backend->sendMessage(
      event({{"short", Value("s")}, {"long", Value(std::string(2000, 'x'))}, {"after", Value(std::string(50, 'y'))}}),
      TimeValue{1, 0}, std::uint16_t{0}, std::uint16_t{0}, std::uint16_t{1});
  ASSERT_TRUE(collector.waitForCount(1));
  Bytes raw = collector.datagrams()[0];
  EXPECT_EQ(raw.size(), 64u + 1023u);
  test::ReadDatagram d = *test::readDatagram(raw);
  EXPECT_EQ(d.totalLength, 64u + 1023u);
  const std::string expectedText = " short=s after=" + std::string(50, 'y') + " long=" +
                                   std::string(1023 - 15 - 50 - 6, 'x');
  EXPECT_EQ(d.text, expectedText);
  ASSERT_TRUE(record.has_value());
  EXPECT_NE(record->find(expectedText), std::string::npos);
}

TEST_F(DashboardBackendTest, TheLocalLogRecordShowsMillisecondsInStepsOfFour) {
  Bytes datagram(64, 0);
  datagram[1] = 7;
  datagram[3] = 86;
  datagram[7] = 12;
  datagram[8] = datagram[9] = datagram[10] = datagram[11] = 0xFF;  // session 0
  datagram[12] = datagram[13] = 0xFF;                               // client version 0
  std::memcpy(datagram.data() + 20, test::kTestUdid, 40);
  std::string record = DashboardBackend::writeLocalLog(datagram);
  EXPECT_EQ(record.rfind("12.344 ", 0), 0u) << record;
  // A component type beyond the table names no tag of its own.
  datagram[1] = 200;
  record = DashboardBackend::writeLocalLog(datagram);
  EXPECT_NE(record.find(" 127.0.0.1 Unknown "), std::string::npos) << record;
}

TEST_F(DashboardBackendTest, SessionEventsThroughTheBasePathNeverBecomeDatagrams) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeDashboard(profileFor(collector.port()));
  ASSERT_NE(backend, nullptr);
  TelvaneBackend& asSessionSeesIt = *backend;
  EXPECT_EQ(asSessionSeesIt.sendMessage(event({{"k", Value("session")}}), TimeValue{1, 0}, 1, 2, kMessageFlagRealtime),
            std::nullopt);
  EXPECT_EQ(backend->eventID(), 1u);  // counted by the base, then dropped by its six-argument send
  // The dashboard's own send does go out; it is the only datagram.
  send(*backend, 77, {{"k", Value("direct")}});
  ASSERT_TRUE(collector.waitForCount(1));
  backend->waitForNetworkQueue();
  std::vector<Bytes> datagrams = collector.datagrams();
  ASSERT_EQ(datagrams.size(), 1u);
  EXPECT_EQ(test::readDatagram(datagrams[0])->eventID, 77u);
  EXPECT_EQ(test::readDatagram(datagrams[0])->text, " k=direct");
}

// ---- Profile values ----

TEST_F(DashboardBackendTest, MissingOrNonTextIPCannotBeResolved) {
  warmUp();
  const std::size_t before = test::openDescriptorCount();
  for (Value ip : {Value(), Value(5), Value(Array{})}) {
    capture.clear();
    Dictionary profile{{"port", Value(9)}};
    if (!ip.isNull()) profile.set("ip", ip);
    EXPECT_EQ(makeDashboard(Value(std::move(profile))), nullptr);
    EXPECT_TRUE(capture.contains(log::Level::Error, "DashboardBackend(initWithName): can't resolve server IP"));
  }
  EXPECT_EQ(test::openDescriptorCount(), before);
}

TEST_F(DashboardBackendTest, AProfileThatIsNotADictionaryHasNoIP) {
  EXPECT_EQ(makeDashboard(Value("127.0.0.1:9")), nullptr);
  EXPECT_TRUE(capture.contains(log::Level::Error, "DashboardBackend(initWithName): can't resolve server IP"));
}

TEST_F(DashboardBackendTest, MissingOrNonNumericPortCannotBeResolved) {
  for (Value port : {Value(), Value("8080")}) {
    capture.clear();
    Dictionary profile{{"ip", Value("127.0.0.1")}};
    if (!port.isNull()) profile.set("port", port);
    EXPECT_EQ(makeDashboard(Value(std::move(profile))), nullptr);
    EXPECT_TRUE(capture.contains(log::Level::Error, "DashboardBackend(initWithName): can't resolve server port"));
  }
}

TEST_F(DashboardBackendTest, AnIPThatIsNotDottedIPv4FailsTheConnectAndLeavesNoSocket) {
  warmUp();
  const std::size_t before = test::openDescriptorCount();
  for (const char* ip : {"999.1.1.1", "collector.example", "", "127.0.0"}) {
    capture.clear();
    EXPECT_EQ(makeDashboard(Value(Dictionary{{"ip", Value(ip)}, {"port", Value(9)}})), nullptr) << ip;
    EXPECT_TRUE(capture.contains(log::Level::Error, "DashboardBackend(initWithName): socket connect() failed.")) << ip;
  }
  // Also after a bind for acknowledgements (the read source owned the socket).
  capture.clear();
  EXPECT_EQ(makeDashboard(Value(Dictionary{{"ip", Value("999.1.1.1")}, {"port", Value(9)}, {"reliable", Value(50)}})),
            nullptr);
  EXPECT_TRUE(capture.contains(log::Level::Error, "DashboardBackend(initWithName): socket connect() failed."));
  EXPECT_TRUE(test::waitUntil([&] { return test::openDescriptorCount() == before; }));
}

TEST_F(DashboardBackendTest, PortNumbersAreTruncatedTo16Bits) {
  auto wide = makeDashboard(Value(Dictionary{{"ip", Value("127.0.0.1")}, {"port", Value(70000)}}));
  ASSERT_NE(wide, nullptr);
  EXPECT_EQ(peerPort(*wide), std::optional<std::uint16_t>(70000 - 65536));
  auto negative = makeDashboard(Value(Dictionary{{"ip", Value("127.0.0.1")}, {"port", Value(-1)}}));
  ASSERT_NE(negative, nullptr);
  EXPECT_EQ(peerPort(*negative), std::optional<std::uint16_t>(65535));
  // A port that becomes 0 cannot be connected to.
  for (long long port : {0LL, 65536LL}) {
    capture.clear();
    EXPECT_EQ(makeDashboard(Value(Dictionary{{"ip", Value("127.0.0.1")}, {"port", Value(port)}})), nullptr) << port;
    EXPECT_TRUE(capture.contains(log::Level::Error, "DashboardBackend(initWithName): socket connect() failed."));
  }
}

TEST_F(DashboardBackendTest, AReliableKeySetsThePeriodAndReliableMode) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = makeDashboard(profileFor(collector.port(), 200));
  ASSERT_NE(backend, nullptr);
  EXPECT_TRUE(backend->reliableUDP());
  EXPECT_EQ(backend->timerPeriod(), std::chrono::milliseconds(200));
  EXPECT_NE(backend->localPort(), 0);
  send(*backend, 1);
  test::ReadDatagram d = onlyDatagram(collector);
  EXPECT_EQ(d.flags, DashboardBackend::kFlagReliableUDP);

  // Text with leading digits counts as its number.
  Value textual = profileFor(collector.port());
  textual.asDictionary()->set("reliable", Value("250"));
  auto fromText = makeDashboard(textual);
  ASSERT_NE(fromText, nullptr);
  EXPECT_EQ(fromText->timerPeriod(), std::chrono::milliseconds(250));

  // A period beyond a day is cut to a day.
  Value slow = profileFor(collector.port(), 1'000'000'000'000'000LL);
  auto slowBackend = makeDashboard(slow);
  ASSERT_NE(slowBackend, nullptr);
  EXPECT_EQ(slowBackend->timerPeriod(), std::chrono::milliseconds(std::chrono::hours(24)));

  // Without the key: no reliability and the default period.
  auto plain = makeDashboard(profileFor(collector.port()));
  ASSERT_NE(plain, nullptr);
  EXPECT_FALSE(plain->reliableUDP());
  EXPECT_EQ(plain->timerPeriod(), std::chrono::milliseconds(500));
}

TEST_F(DashboardBackendTest, AReliablePeriodThatIsNotPositiveKeepsTheDefaultSoTheTimerCannotSpin) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  for (Value reliable : {Value(0), Value(-20), Value("often")}) {
    capture.clear();
    Value profile = profileFor(collector.port());
    profile.asDictionary()->set("reliable", reliable);
    auto backend = makeDashboard(profile);
    ASSERT_NE(backend, nullptr);
    EXPECT_TRUE(backend->reliableUDP());
    EXPECT_EQ(backend->timerPeriod(), std::chrono::milliseconds(500));
    EXPECT_TRUE(capture.contains(log::Level::Error, "DashboardBackend(initWithName): reliable period " +
                                                        reliable.description() +
                                                        " is not a positive number of ms, using 500 ms."));
  }
}

TEST_F(DashboardBackendTest, WithoutProfileTheServerIPIsRequired) {
  EXPECT_EQ(DashboardBackend::createWithServerIP("dashboard", std::nullopt, 9, std::string("Laptop"), platform()),
            nullptr);
  EXPECT_TRUE(capture.lines().empty());
  warmUp();
  const std::size_t before = test::openDescriptorCount();
  EXPECT_EQ(DashboardBackend::createWithProfile("dashboard", std::nullopt, std::nullopt, 9, std::string("Laptop"),
                                                platform()),
            nullptr);
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "DashboardBackend(initWithName): initWitName with all null params."));
  EXPECT_EQ(test::openDescriptorCount(), before);
}

TEST_F(DashboardBackendTest, AServerIPWithoutProfileMeansReliableModeTheDefaultPeriodAndTheNotFromProfileFlag) {
  UdpTestCollector collector(UdpTestCollector::Mode::Silent);
  auto backend = DashboardBackend::createWithServerIP("dashboard", std::string("127.0.0.1"), collector.port(),
                                                      std::string("Laptop"), platform());
  ASSERT_NE(backend, nullptr);
  giveIdentity(*backend);
  EXPECT_TRUE(backend->reliableUDP());
  EXPECT_FALSE(backend->usingProfile());
  EXPECT_EQ(backend->timerPeriod(), std::chrono::milliseconds(500));
  EXPECT_EQ(backend->postURL(), std::nullopt);
  send(*backend, 5);
  EXPECT_EQ(onlyDatagram(collector).flags,
            DashboardBackend::kFlagReliableUDP | DashboardBackend::kFlagAddressNotFromProfile);
  backend->cleanup();
}

}  // namespace
}  // namespace telvane
