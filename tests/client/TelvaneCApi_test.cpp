// The C interface against a fake daemon: what its JSON arguments become on the wire,
// the errors it hands back (the library's, the daemon's, its own), the _wait functions'
// time-outs, the daemon's refusal of a session, the statistics a periodic service fills
// and when the user data of callbacks is released.
#include "telvane/telvane.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cmath>
#include <memory>
#include <string>

#include "client/TelvaneCApi.h"
#include "support/ClientTestHelpers.h"
#include "support/FakeDaemon.h"
#include "support/WaitUntil.h"
#include "telvane/TelvaneKeys.h"

namespace telvane {
namespace {

using Op = ipc::Operation;

constexpr const char* kSessionInfo = "{\"ComponentType\": 7, \"SessionID\": 42}";

// The error of a call, owned by the test.
struct ErrorHolder {
  telvane_error* error = nullptr;
  ~ErrorHolder() { telvane_error_free(error); }
  telvane_error** out() {
    telvane_error_free(error);
    error = reinterpret_cast<telvane_error*>(1);  // success must set it to null
    return &error;
  }
  long code() const { return telvane_error_code(error); }
  std::string domain() const { return telvane_error_domain(error) ? telvane_error_domain(error) : "(none)"; }
  std::string message() const { return telvane_error_message(error) ? telvane_error_message(error) : "(none)"; }
};

struct SessionDeleter {
  void operator()(telvane_session* session) const { telvane_session_free(session); }
};
using SessionPtr = std::unique_ptr<telvane_session, SessionDeleter>;

SessionPtr create(ErrorHolder& error) {
  return SessionPtr(telvane_session_create(kSessionInfo, "{\"_clientName\": \"com.example.conference\"}", error.out()));
}

TEST(TelvaneCApi, SendHandsTheDaemonTheEventMapReadFromJson) {
  test::FakeDaemon daemon;
  ErrorHolder error;
  SessionPtr session = create(error);
  ASSERT_TRUE(session) << error.message();
  EXPECT_EQ(error.error, nullptr);

  EXPECT_TRUE(telvane_session_send(session.get(), 12, 1, "{\"codec\": \"opus\", \"jitterMs\": 12.5, \"n\": [1, 2]}",
                                   error.out()));
  EXPECT_EQ(error.error, nullptr);
  ASSERT_TRUE(daemon.waitForCalls(Op::SendMessageWithDictionary, 1));
  const Value sent = daemon.calls(Op::SendMessageWithDictionary)[0].arguments.at(0);
  EXPECT_EQ(sent[kTelvaneMessageParametersCategory].integerValue(), 12);
  EXPECT_EQ(sent[kTelvaneMessageParametersType].integerValue(), 1);
  EXPECT_EQ(sent[kTelvaneMessageParametersFlag].integerValue(), 0);
  EXPECT_EQ(sent[kTelvaneMessageParametersPayload],
            Value(Dictionary{{"codec", Value("opus")},
                             {"jitterMs", Value(12.5)},
                             {"n", Value(Array{Value(1), Value(2)})}}));

  // Without a payload the map has none.
  EXPECT_TRUE(telvane_session_send(session.get(), 12, 2, nullptr, error.out()));
  ASSERT_TRUE(daemon.waitForCalls(Op::SendMessageWithDictionary, 2));
  EXPECT_FALSE(daemon.calls(Op::SendMessageWithDictionary)[1].arguments.at(0).asDictionary()->contains(
      kTelvaneMessageParametersPayload));
}

TEST(TelvaneCApi, RefusalsCarryTheLibrarysCodesAndDomains) {
  test::FakeDaemon daemon;
  ErrorHolder error;
  SessionPtr session = create(error);
  ASSERT_TRUE(session);

  EXPECT_FALSE(telvane_session_send(session.get(), 0, 1, nullptr, error.out()));
  EXPECT_EQ(error.code(), TELVANE_ERROR_CATEGORY_ZERO);
  EXPECT_EQ(error.domain(), TELVANE_ERROR_DOMAIN);

  EXPECT_FALSE(telvane_session_send_dictionary(session.get(), "{\"ParametersCategory\": 3}", error.out()));
  EXPECT_EQ(error.code(), TELVANE_ERROR_MISSING_PARAMETER);
  EXPECT_EQ(error.domain(), "Missing mandatory parameter 'type'");
  EXPECT_EQ(error.message(), "Missing mandatory parameter 'type'");

  EXPECT_FALSE(telvane_session_send(session.get(), 3, 1, "{\"a\": 1,}", error.out()));
  EXPECT_EQ(error.code(), TELVANE_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(error.domain(), TELVANE_INTERFACE_ERROR_DOMAIN);
  EXPECT_EQ(error.message().rfind("the payload is not valid JSON: ", 0), 0u) << error.message();

  EXPECT_FALSE(telvane_session_update_shared_data_for_key(session.get(), "\xff", "1", error.out()));
  EXPECT_EQ(error.code(), TELVANE_ERROR_INVALID_ARGUMENT);
  EXPECT_EQ(std::string(telvane_error_user_info_json(error.error)), "null");
  // Nothing refused reached the daemon.
  EXPECT_TRUE(daemon.calls(Op::SendMessageWithDictionary).empty());
  EXPECT_TRUE(daemon.calls(Op::UpdateSharedDataForKey).empty());

  // A refused session information gives no session.
  EXPECT_EQ(telvane_session_create("{\"ComponentType\": 31}", nullptr, error.out()), nullptr);
  EXPECT_EQ(error.code(), TELVANE_ERROR_COMPONENT_TYPE_INVALID);
  EXPECT_EQ(error.domain(), TELVANE_ERROR_DOMAIN);
  EXPECT_EQ(telvane_session_create("[7]", nullptr, error.out()), nullptr);
  EXPECT_EQ(error.code(), TELVANE_ERROR_SESSION_INFO_MISSING);
}

TEST(TelvaneCApi, ADisabledSessionIsNoSession) {
  ErrorHolder error;
  EXPECT_EQ(telvane_session_create("{\"ComponentType\": 7, \"EnableFlag\": 0}", nullptr, error.out()), nullptr);
  EXPECT_EQ(error.code(), TELVANE_ERROR_NO_SESSION);
  EXPECT_EQ(error.domain(), TELVANE_INTERFACE_ERROR_DOMAIN);
}

TEST(TelvaneCApi, SharedDataKeysAndRemovals) {
  test::FakeDaemon daemon;
  ErrorHolder error;
  SessionPtr session = create(error);
  ASSERT_TRUE(session);
  EXPECT_TRUE(telvane_session_update_shared_data_for_key(session.get(), "room", "\"Blue\"", error.out()));
  EXPECT_TRUE(telvane_session_update_shared_data_for_key(session.get(), "room", nullptr, error.out()));
  EXPECT_TRUE(telvane_session_update_shared_data_json(session.get(), "{\"callID\": \"C-2041\"}", error.out()));
  ASSERT_TRUE(daemon.waitForCalls(Op::UpdateSharedDataForKey, 2));
  ASSERT_TRUE(daemon.waitForCalls(Op::UpdateSharedDataWithDictionary, 1));
  const auto keys = daemon.calls(Op::UpdateSharedDataForKey);
  EXPECT_EQ(keys[0].arguments, (Array{Value("room"), Value("Blue")}));
  EXPECT_EQ(keys[1].arguments, (Array{Value("room"), Value()})) << "a null value removes the key";
  EXPECT_EQ(daemon.calls(Op::UpdateSharedDataWithDictionary)[0].arguments.at(0),
            Value(Dictionary{{"callID", Value("C-2041")}}));
}

TEST(TelvaneCApi, FlushWaitReturnsTheDaemonsErrorOrTimesOut) {
  test::FakeDaemon daemon;
  daemon.setReply(Op::FlushMessages,
                  Array{Value(), Value(Dictionary{{"domain", Value("TelvaneErrorDomain")},
                                                  {"code", Value(-1)},
                                                  {"description", Value("Nothing to flush")},
                                                  {"userInfo", Value(Dictionary{{"backend", Value("brindle")}})}})});
  ErrorHolder error;
  SessionPtr session = create(error);
  ASSERT_TRUE(session);
  EXPECT_FALSE(telvane_session_flush_wait(session.get(), 10000, error.out()));
  EXPECT_EQ(error.code(), -1);
  EXPECT_EQ(error.domain(), TELVANE_ERROR_DOMAIN);
  EXPECT_EQ(error.message(), "Nothing to flush");
  EXPECT_EQ(std::string(telvane_error_user_info_json(error.error)), "{\"backend\":\"brindle\"}");
  telvane_error* copy = telvane_error_copy(error.error);
  EXPECT_EQ(std::string(telvane_error_message(copy)), "Nothing to flush");
  telvane_error_free(copy);

  // An unanswered flush: the wait ends at its time-out.
  daemon.setResponder(Op::FlushMessages, [](const test::FakeDaemon::Call&) { return std::nullopt; });
  EXPECT_FALSE(telvane_session_flush_wait(session.get(), 50, error.out()));
  EXPECT_EQ(error.code(), TELVANE_ERROR_TIMED_OUT);
  EXPECT_EQ(error.domain(), TELVANE_INTERFACE_ERROR_DOMAIN);
}

TEST(TelvaneCApi, TheDaemonsRefusalOfTheSessionIsItsConnectionError) {
  test::FakeDaemon daemon;
  daemon.refuseOnCall(Op::SetSessionInfo, "too many active sessions for client type 7 (at most 5)");
  ErrorHolder error;
  SessionPtr session = create(error);
  ASSERT_TRUE(session);
  EXPECT_FALSE(telvane_session_start_wait(session.get(), 10000, error.out()));
  EXPECT_EQ(error.error, nullptr) << "answered (the start failed), not timed out: " << error.message();
  telvane_error* refused = telvane_session_connection_error(session.get());
  ASSERT_NE(refused, nullptr);
  EXPECT_EQ(telvane_error_code(refused), TELVANE_ERROR_REFUSED_BY_DAEMON);
  EXPECT_EQ(std::string(telvane_error_domain(refused)), TELVANE_ERROR_DOMAIN);
  EXPECT_EQ(std::string(telvane_error_message(refused)), "too many active sessions for client type 7 (at most 5)");
  telvane_error_free(refused);
}

TEST(TelvaneCApi, StatisticsTakeWhatJsonCarriesAndRefuseTheRest) {
  Value dictionary;  // not a dictionary yet: the first value makes it one
  telvane_stats stats{&dictionary};
  EXPECT_TRUE(telvane_stats_set_int(&stats, "rxKbps", 512));
  EXPECT_TRUE(telvane_stats_set_double(&stats, "load", 0.25));
  EXPECT_TRUE(telvane_stats_set_bool(&stats, "charging", true));
  EXPECT_TRUE(telvane_stats_set_string(&stats, "device", "Gadget1"));
  EXPECT_TRUE(telvane_stats_set_json(&stats, "samples", "[1, 2]"));
  EXPECT_TRUE(telvane_stats_update_json(&stats, "{\"device\": \"Gadget2\", \"up\": {\"s\": 3}}"));

  EXPECT_FALSE(telvane_stats_set_double(&stats, "nan", std::nan("")));
  EXPECT_FALSE(telvane_stats_set_double(&stats, "inf", INFINITY));
  EXPECT_FALSE(telvane_stats_set_string(&stats, "bad", "\xc3\x28"));
  EXPECT_FALSE(telvane_stats_set_string(&stats, "\xff", "key"));
  EXPECT_FALSE(telvane_stats_set_string(&stats, "none", nullptr));
  EXPECT_FALSE(telvane_stats_set_int(&stats, nullptr, 1));
  EXPECT_FALSE(telvane_stats_set_json(&stats, "broken", "{"));
  EXPECT_FALSE(telvane_stats_update_json(&stats, "[1]"));
  EXPECT_FALSE(telvane_stats_set_int(nullptr, "x", 1));

  EXPECT_EQ(dictionary, Value(Dictionary{{"charging", Value(true)},
                                         {"device", Value("Gadget2")},
                                         {"load", Value(0.25)},
                                         {"rxKbps", Value(512)},
                                         {"samples", Value(Array{Value(1), Value(2)})},
                                         {"up", Value(Dictionary{{"s", Value(3)}})}}));
}

// Counts the releases of a callback's user data.
void countRelease(void* userData) { ++*static_cast<std::atomic<int>*>(userData); }
void fillNothing(telvane_stats*, void*) {}
void ignoreText(const char*, void*) {}

TEST(TelvaneCApi, UserDataIsReleasedOnceWhenTheLibraryLetsGo) {
  test::FakeDaemon daemon;
  ErrorHolder error;
  SessionPtr session = create(error);
  ASSERT_TRUE(session);
  std::atomic<int> refused{0}, replaced{0}, registered{0}, logging{0};

  // Refused at once: released at once.
  EXPECT_FALSE(telvane_session_register_periodic_task(session.get(), 1, true, true, nullptr, &refused, countRelease));
  EXPECT_FALSE(telvane_session_register_periodic_task(nullptr, 1, true, true, fillNothing, &refused, countRelease));
  EXPECT_EQ(refused, 2);

  // Replaced by a second registration of the module, or unregistered.
  EXPECT_TRUE(telvane_session_register_periodic_task(session.get(), 7, false, true, fillNothing, &replaced, countRelease));
  EXPECT_TRUE(telvane_session_register_periodic_task(session.get(), 7, true, false, fillNothing, &registered,
                                                     countRelease));
  EXPECT_TRUE(test::waitUntil([&] { return replaced == 1; }));
  EXPECT_EQ(registered, 0);
  EXPECT_TRUE(telvane_session_unregister_periodic_task(session.get(), 7));
  EXPECT_FALSE(telvane_session_unregister_periodic_task(session.get(), 7));
  EXPECT_TRUE(test::waitUntil([&] { return registered == 1; }));

  // The logging callback's user data goes when the callback is replaced, or with the session.
  telvane_session_set_logging_callback(session.get(), ignoreText, &logging, countRelease);
  telvane_session_set_logging_callback(session.get(), nullptr, &logging, countRelease);
  EXPECT_EQ(logging, 2) << "the replaced one and the one not taken";
  telvane_session_set_logging_callback(session.get(), ignoreText, &logging, countRelease);
  session.reset();
  EXPECT_EQ(logging, 3);
  EXPECT_EQ(refused, 2);
  EXPECT_EQ(replaced, 1);
  EXPECT_EQ(registered, 1);
}

TEST(TelvaneCApi, WithoutASessionNothingHappens) {
  ErrorHolder error;
  EXPECT_FALSE(telvane_session_flush_wait(nullptr, 10, error.out()));
  EXPECT_EQ(error.code(), TELVANE_ERROR_INVALID_ARGUMENT);
  EXPECT_FALSE(telvane_session_upload_file(nullptr, "/tmp/x", nullptr, nullptr));
  EXPECT_FALSE(telvane_session_server_supports_file_upload(nullptr));
  EXPECT_EQ(telvane_session_connection_error(nullptr), nullptr);
  EXPECT_EQ(telvane_session_enabled_backends_json(nullptr), nullptr);
  EXPECT_FALSE(telvane_session_unregister_periodic_task(nullptr, 1));
  telvane_session_start(nullptr, nullptr, nullptr);
  telvane_session_flush(nullptr, nullptr, nullptr);
  telvane_session_finish(nullptr);
  telvane_session_start_log_timer(nullptr, 1, 1, 1, 1);
  telvane_session_stop_log_timer(nullptr);
  telvane_session_free(nullptr);
  EXPECT_EQ(telvane_error_code(nullptr), 0);
  EXPECT_EQ(telvane_error_message(nullptr), nullptr);
  EXPECT_EQ(telvane_error_copy(nullptr), nullptr);

  char* child = telvane_new_hierarchy_token("{\"token\": \"5D0C1F9A-0000-4000-8000-000000000001\", \"level\": 2}");
  ASSERT_NE(child, nullptr);
  EXPECT_EQ(std::string(child), "{\"level\":3,\"token\":\"5D0C1F9A-0000-4000-8000-000000000001\"}");
  telvane_string_free(child);
  EXPECT_EQ(telvane_new_hierarchy_token("\"token\""), nullptr);
  EXPECT_EQ(telvane_new_hierarchy_token("{"), nullptr);
}

}  // namespace
}  // namespace telvane
