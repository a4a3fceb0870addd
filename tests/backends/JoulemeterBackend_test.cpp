#include "backends/telemetry/JoulemeterBackend.h"

#include <gtest/gtest.h>

#include "backends/BackendTestSupport.h"
#include "support/FakePowerLog.h"

namespace telvane {
namespace {

class JoulemeterBackendTest : public test::BackendTestBase {
 protected:
  std::shared_ptr<JoulemeterBackend> make() {
    BackendPlatform withPowerLog = platform();
    withPowerLog.powerLog = powerLog;
    return JoulemeterBackend::create("power", Value::dictionary(), std::string("Laptop"), withPowerLog);
  }

  // Calls the recording operation; the explicit 16-bit types select it over the
  // base's five-argument send.
  static void record(JoulemeterBackend& backend, const Value& dictionary, std::uint16_t method,
                     std::uint16_t respCode, std::uint16_t eventID) {
    backend.sendMessage(dictionary, TimeValue{1'700'000'000, 250'000}, method, respCode, eventID);
  }

  std::shared_ptr<test::FakePowerLog> powerLog = std::make_shared<test::FakePowerLog>();
};

TEST_F(JoulemeterBackendTest, IsMadeByTheBaseInitialiserWithAnyProfile) {
  auto backend = make();
  ASSERT_NE(backend, nullptr);
  EXPECT_EQ(backend->kind(), BackendKind::Joulemeter);
  EXPECT_EQ(backend->name(), "power");
  EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
  auto defaulted = JoulemeterBackend::create("power", Value(), std::nullopt, platform());
  ASSERT_NE(defaulted, nullptr);
  EXPECT_EQ(defaulted->platform().powerLog, PowerLog::journal()) << "without one set, the journal";
  EXPECT_EQ(backend->platform().powerLog, powerLog);
}

TEST_F(JoulemeterBackendTest, RecordsACopyWithMethodResponseCodeAndEventUnderCategory28) {
  auto backend = make();
  ASSERT_NE(backend, nullptr);
  Value dictionary(Dictionary{{"codec", Value("opus")}, {"jitterMs", Value(12)}});
  record(*backend, dictionary, 12, 3, 41);

  auto events = powerLog->events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].category, 28u);
  EXPECT_EQ(events[0].eventName, "Vistacore-TVX");
  EXPECT_EQ(events[0].dictionary, Value(Dictionary{{"codec", Value("opus")},
                                                   {"event", Value(41u)},
                                                   {"jitterMs", Value(12)},
                                                   {"method", Value(12u)},
                                                   {"respCode", Value(3u)}}));
  EXPECT_EQ(events[0].dictionary["method"].type(), Value::Type::Unsigned);
  EXPECT_EQ(events[0].dictionary["respCode"].type(), Value::Type::Unsigned);
  EXPECT_EQ(events[0].dictionary["event"].type(), Value::Type::Unsigned);
  EXPECT_EQ(dictionary.asDictionary()->size(), 2u) << "the caller's dictionary is not changed";
  EXPECT_TRUE(capture.lines().empty()) << "nothing is reported";
}

TEST_F(JoulemeterBackendTest, TheAddedKeysReplaceEntriesOfTheSameName) {
  auto backend = make();
  record(*backend, Value(Dictionary{{"method", Value("mine")}, {"other", Value(1)}}), 65535, 0, 65535);
  auto events = powerLog->events();
  ASSERT_EQ(events.size(), 1u);
  EXPECT_EQ(events[0].dictionary["method"], Value(65535u));
  EXPECT_EQ(events[0].dictionary["respCode"], Value(0u));
  EXPECT_EQ(events[0].dictionary["event"], Value(65535u));
  EXPECT_EQ(events[0].dictionary["other"], Value(1));
}

TEST_F(JoulemeterBackendTest, MethodZeroIsDroppedEvenWithAFullDictionary) {
  auto backend = make();
  Dictionary full;
  for (int i = 0; i < 50; ++i) full.set("key" + std::to_string(i), Value(i));
  record(*backend, Value(std::move(full)), 0, 7, 1);
  EXPECT_TRUE(powerLog->events().empty());
}

TEST_F(JoulemeterBackendTest, AnEmptyOrAbsentDictionaryRecordsNothing) {
  auto backend = make();
  record(*backend, Value::dictionary(), 5, 1, 1);
  record(*backend, Value(), 5, 1, 2);
  record(*backend, Value("not a map"), 5, 1, 3);
  record(*backend, Value(Array{Value(1)}), 5, 1, 4);
  EXPECT_TRUE(powerLog->events().empty());
  // The same backend records a dictionary that has entries.
  record(*backend, Value(Dictionary{{"k", Value(1)}}), 5, 1, 5);
  EXPECT_EQ(powerLog->events().size(), 1u);
}

TEST_F(JoulemeterBackendTest, EventsOfTheSessionPathAreNotRecorded) {
  auto backend = make();
  Value event = blob({{"codec", Value("opus")}});
  // What a session calls: the five-argument send of the interface, with a flag.
  TelvaneBackend& asSessionSeesIt = *backend;
  EXPECT_EQ(asSessionSeesIt.sendMessage(event, at(1'700'000'000), 12, 3, kMessageFlagOrdinary), std::nullopt);
  EXPECT_EQ(asSessionSeesIt.sendMessage(event, at(1'700'000'000), 12, 3, kMessageFlagRealtime), std::nullopt);
  // And the six-argument send, which the class leaves to the base.
  TelvaneBackendBase& asBase = *backend;
  EXPECT_EQ(asBase.sendMessage(event, at(1'700'000'000), 12, 3, std::uint16_t{9}, kMessageFlagOrdinary), std::nullopt);
  EXPECT_TRUE(powerLog->events().empty());
  EXPECT_EQ(backend->eventID(), 2) << "the base counted the two events";
}

TEST_F(JoulemeterBackendTest, ARefusingPowerLogIsNotReported) {
  powerLog->setAnswer(false);
  auto backend = make();
  record(*backend, Value(Dictionary{{"k", Value(1)}}), 1, 1, 1);
  EXPECT_EQ(powerLog->events().size(), 1u);
  EXPECT_TRUE(capture.lines().empty());
}

}  // namespace
}  // namespace telvane
