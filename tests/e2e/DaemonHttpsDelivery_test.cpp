// Events from the real client library through the real daemon to an HTTPS collector
// on loopback, under a signed storebag with one HTTPS post backend: the records and
// headers that arrive, batching, realtime ordering, sampling states, filters, consent,
// the request digest, server errors, the https rewrite and the session's own start and
// end messages.
#include <gtest/gtest.h>

#include <algorithm>
#include <cmath>
#include <filesystem>
#include <future>

#include "e2e/E2eHelpers.h"
#include "platform/Crypto.h"
#include "platform/Json.h"
#include "platform/SqliteSettingsStore.h"
#include "support/DaemonProcess.h"
#include "support/Gunzip.h"
#include "support/SignedEnvelope.h"
#include "support/StorebagBuilder.h"
#include "support/TempDir.h"
#include "support/TestCertificates.h"
#include "support/TlsTestServer.h"
#include "support/WaitUntil.h"
#include "telvane/Telvane.h"
#include "telvane/TelvaneKeys.h"
#include "util/ComponentTags.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;

namespace {

constexpr const char* kClient = "com.example.delivery";
constexpr const char* kOverrideClient = "com.example.override";

// One post as the collector understood it.
struct Post {
  ReceivedRequest request;
  std::string json;  // the uncompressed body
  Value document;

  const Array& events() const {
    static const Array none;
    const Array* events = document["events"].asArray();
    return events ? *events : none;
  }
};

Post decode(const ReceivedRequest& request) {
  Post post{request, request.body, Value()};
  // The test server may already have inflated the body; a body that is not gzip
  // stays as it came.
  if (request.header("Content-Encoding") == "gzip") {
    if (std::optional<std::string> inflated = gunzip(request.body)) post.json = std::move(*inflated);
  }
  auto parsed = json::parse(post.json);
  if (parsed.ok()) post.document = parsed.value();
  return post;
}

Value rule(const std::string& client, const std::string& postURL, const std::string& realtimeURL) {
  return Value(Dictionary{
      {"client", Value(client)},
      {"service", Value("calls")},
      {"locale_whitelist", Value(Array{Value("US"), Value("DE")})},
      {"filters", Value(Array{Value(Dictionary{{"key", Value("PostTime")}, {"action", Value("remove")}}),
                              Value(Dictionary{{"key", Value("account")}, {"action", Value("sha256")}})})},
      {"sampling_threshold", Value(1)},
      {"post_url", Value(postURL)},
      {"realtime_post_url", Value(realtimeURL)}});
}

class DaemonHttpsDelivery : public ::testing::Test {
 protected:
  void SetUp() override {
    keyPath_ = dir_.path() / "storebag-key.der";
    TestKeyPair::shared().writePublicKey(keyPath_);
    settings_ = SqliteSettingsStore::open(dir_.str() + "/defaults.sqlite3");
    ASSERT_TRUE(settings_);
    ASSERT_TRUE(settings_->write("com.zembra.telvane", "telvane_storebag_url", Value(server_.url("/bags"))));
    rules_ = {rule(kClient, server_.url("/post"), server_.url("/rt")),
              rule(kOverrideClient, server_.url("/post"), server_.url("/rt"))};
    rules_[1].asDictionary()->set("override_dnu", Value(1));
    ScriptedAnswer ok;
    ok.body = "{}";
    server_.setAnswer("/post", ok);
    server_.setAnswer("/rt", ok);
  }

  void TearDown() override {
    sessions_.clear();
    if (daemon_) {
      EXPECT_EQ(daemon_->stop(), 0) << daemon_->log();
    }
  }

  void giveConsent() {
    ASSERT_TRUE(settings_->write("com.zembra.diagnostics", "SubmitDiagnostics", Value(true)));
  }

  void startDaemon() {
    StorebagBuilder builder;
    builder.version("delivery-7");
    for (const char* section : {"zembra_internal", "development", "seed", "release"}) {
      Dictionary profile{{"display_url", Value(server_.url("/post"))}};
      Array clients;
      for (const Value& r : rules_) clients.push_back(r);
      profile.set("clients", Value(std::move(clients)));
      builder.backend(section, backendName_, Value(std::move(profile)));
    }
    serveConferaStorebag(server_, builder);

    DaemonOptions options;
    options.environment = {{"TELVANED_CA_FILE", TestCertificates::shared().caFile()},
                           {"TELVANED_PUBLIC_KEY", keyPath_.string()},
                           {"LC_ALL", "en_US.UTF-8"}};
    daemon_ = std::make_unique<DaemonProcess>(dir_.str(), options);
    ASSERT_TRUE(daemon_->start());
    useDaemon(*daemon_);
  }

  // Sessions carry a hierarchy token, so that they have shared data.
  Telvane& open(const std::string& client, Value extraUserInfo = Value::dictionary(), unsigned sessionID = 1) {
    Dictionary userInfo{{kTelvaneUserInfoClientName, Value(client)}, {kTelvaneUserInfoServiceName, Value("calls")}};
    if (const Dictionary* extra = extraUserInfo.asDictionary()) {
      for (const auto& [key, value] : *extra) userInfo.set(key, value);
    }
    sessions_.push_back(startedSession(Value(Dictionary{{kTelvaneSessionInfoClientType, Value(7)},
                                                        {kTelvaneSessionInfoSessionID, Value(sessionID)},
                                                        {kTelvaneSessionInfoClientVersion, Value(12)},
                                                        {kTelvaneSessionInfoBatchEvent, Value(true)},
                                                        {kTelvaneSessionInfoRequireUserInfo, Value(true)},
                                                        {kTelvaneSessionInfoHierarchyToken,
                                                         Telvane::newHierarchyTokenFromParentToken(Value())}}),
                                       Value(std::move(userInfo))));
    return *sessions_.back();
  }

  // Flushes and waits for the daemon's answer; the error text, empty on success.
  std::string flush(Telvane& session) {
    auto promise = std::make_shared<std::promise<std::string>>();
    session.flushMessagesWithCompletion([promise](const std::optional<Error>& error) {
      promise->set_value(error ? (error->description.empty() ? "error" : error->description) : "");
    });
    auto future = promise->get_future();
    if (future.wait_for(30s) != std::future_status::ready) return "no answer";
    return future.get();
  }

  void finish(Telvane& session) {
    session.finishSession();
    for (auto it = sessions_.begin(); it != sessions_.end(); ++it) {
      if (it->get() == &session) {
        sessions_.erase(it);
        break;
      }
    }
  }

  std::vector<Post> posts(const std::string& path) const {
    std::vector<Post> out;
    for (const auto& request : server_.requestsForPath(path)) out.push_back(decode(request));
    return out;
  }

  // Every record that arrived on the path, in arrival order.
  std::vector<Value> records(const std::string& path) const {
    std::vector<Value> out;
    for (const Post& post : posts(path)) {
      for (const Value& event : post.events()) out.push_back(event);
    }
    return out;
  }

  // Waits until a record of the category and type has arrived on the path.
  std::optional<Value> waitForRecord(const std::string& path, std::int64_t category, std::int64_t type,
                                     std::chrono::milliseconds timeout = 20s) const {
    std::optional<Value> found;
    waitUntil(
        [&] {
          for (const Value& record : records(path)) {
            if (record["_method"].integerValue() == category && record["_status"].integerValue() == type) {
              found = record;
              return true;
            }
          }
          return false;
        },
        timeout);
    return found;
  }

  TempDir dir_;
  TlsTestServer server_;
  std::filesystem::path keyPath_;
  std::shared_ptr<SqliteSettingsStore> settings_;
  std::vector<Value> rules_;
  std::string backendName_ = "brindle";
  std::unique_ptr<DaemonProcess> daemon_;
  std::vector<std::unique_ptr<Telvane>> sessions_;
};

TEST_F(DaemonHttpsDelivery, RecordCarriesItsFieldsUserInfoSharedDataAndFilteredValues) {
  giveConsent();
  startDaemon();
  Telvane& session = open(kClient, Value(Dictionary{{"email", Value("someone@example.net")},
                                                    {"account", Value("abc")},
                                                    {"tier", Value("gold")}}));
  session.updateSharedDataWithDictionary(Value(Dictionary{{"callID", Value("C-2041")}}));
  ASSERT_TRUE(session.sendMessageWithCategory(12, 3, Value(Dictionary{{"codec", Value("opus")}, {"jitterMs", Value(12)}})));
  EXPECT_EQ(flush(session), "");

  std::optional<Value> record = waitForRecord("/post", 12, 3);
  ASSERT_TRUE(record) << daemon_->log();
  const Value& r = *record;
  EXPECT_EQ(r["codec"].stringOrEmpty(), "opus");
  EXPECT_EQ(r["jitterMs"].integerValue(), 12);
  EXPECT_EQ(r["callID"].stringOrEmpty(), "C-2041");
  EXPECT_EQ(r["tier"].stringOrEmpty(), "gold");
  EXPECT_EQ(r["_clientName"].stringOrEmpty(), kClient);
  EXPECT_EQ(r["_serviceName"].stringOrEmpty(), "calls");
  // The hashing filter acts on the user information merged at the flush; it overrides
  // the plain value the record received when it was made.
  EXPECT_EQ(r["account"].stringOrEmpty(), crypto::hex(crypto::sha256("abc")));
  EXPECT_EQ(r["_sender"].stringOrEmpty(), std::string(*componentTag(7)));
  EXPECT_EQ(r["_clientVersion"].integerValue(), 12);
  EXPECT_GE(r["_eventNumber"].integerValue(), 1);
  EXPECT_EQ(r["_internal"].integerValue(), 2) << "not an internal release";
  EXPECT_EQ(r["_startTS"].integerValue() % 60, 0) << "rounded down to a minute";
  EXPECT_TRUE(r["_clientTS"].isNumber());
  EXPECT_EQ(r["_clientTS"].doubleValue(), r["eventTime"].doubleValue());
  EXPECT_GE(r["_clientTS"].doubleValue(), static_cast<double>(r["_startTS"].integerValue()));
  EXPECT_TRUE(r.asDictionary()->contains("_productFamily"));
  EXPECT_TRUE(r["_reportVers"].isString());
  EXPECT_TRUE(r["_timezoneOffset"].isInteger());
  EXPECT_TRUE(r["_sessionID"].isString()) << "the combined session identifier";

  const std::vector<Post> arrived = posts("/post");
  ASSERT_FALSE(arrived.empty());
  const Post& post = arrived.back();
  EXPECT_FALSE(post.document["clientId"].stringOrEmpty().empty());
  EXPECT_TRUE(post.document.asDictionary()->contains("clientId"));
  EXPECT_FALSE(post.document.asDictionary()->contains("postTime")) << "the filter on \"PostTime\" removes it";
  EXPECT_EQ(post.request.header("X-TVX-Client-Name"), kClient);
  EXPECT_EQ(post.request.header("X-TVX-Service-Name"), "calls");
  EXPECT_EQ(post.request.header("X-TVX-Client-Version"), "12");
  EXPECT_EQ(post.request.header("X-TVX-Sender"), std::string(*componentTag(7)));
  EXPECT_EQ(post.request.header("User-Agent").rfind("Telvane/", 0), 0u);
  EXPECT_EQ(post.request.header("Content-Type"), "application/json");
  EXPECT_EQ(post.request.header("Accept"), "application/json");
  EXPECT_EQ(post.request.header("X-TVX-Event-Map"), "") << "a flushed batch has no event map";
  EXPECT_EQ(post.request.header("X-TVX-DIGEST"), "") << "no digest key was set";
}

TEST_F(DaemonHttpsDelivery, StartAndEndMessagesCarryTheirPayloadKeys) {
  giveConsent();
  startDaemon();
  Telvane& session = open(kClient);
  ASSERT_TRUE(session.sendMessageWithCategory(12, 1, Value(Dictionary{{"n", Value(1)}})));
  EXPECT_EQ(flush(session), "");
  std::optional<Value> start = waitForRecord("/post", 0, 0);
  ASSERT_TRUE(start) << daemon_->log();
  EXPECT_TRUE(start->asDictionary()->contains("AutomaticTimeSet"));
  EXPECT_TRUE(start->asDictionary()->contains("Locale"));

  finish(session);
  std::optional<Value> end = waitForRecord("/post", 0, 1);
  ASSERT_TRUE(end) << daemon_->log();
  EXPECT_EQ((*end)["Opt"].integerValue(), 0) << "consent respected";
  EXPECT_EQ((*end)["SamplingThreshold"].doubleValue(), 1.0);
  EXPECT_EQ((*end)["OverrideSampling"].integerValue(), -1);
  EXPECT_EQ((*end)["Batch"].integerValue(), 1);
  EXPECT_TRUE((*end)["_totalBytesSent"].isNumber());
  EXPECT_EQ((*end)["StorebagVersion"].stringOrEmpty(), "delivery-7");
}

TEST_F(DaemonHttpsDelivery, TheFiftyFirstEventOfACategoryFlushesFiftyAndFlushSendsTheRest) {
  giveConsent();
  startDaemon();
  Telvane& session = open(kClient);
  for (int i = 0; i < 51; ++i) {
    ASSERT_TRUE(session.sendMessageWithCategory(21, 1, Value(Dictionary{{"i", Value(i)}})));
  }
  ASSERT_TRUE(waitUntil([&] { return records("/post").size() >= 50; }, 20s)) << daemon_->log();
  std::vector<Value> first;
  for (const Value& record : records("/post")) {
    if (record["_method"].integerValue() == 21) first.push_back(record);
  }
  ASSERT_EQ(first.size(), 50u) << "50 events of the category go out with the 51st";
  EXPECT_EQ(first.front()["i"].integerValue(), 0);
  EXPECT_EQ(first.back()["i"].integerValue(), 49);

  EXPECT_EQ(flush(session), "");
  std::optional<Value> last;
  ASSERT_TRUE(waitUntil(
      [&] {
        for (const Value& record : records("/post")) {
          if (record["_method"].integerValue() == 21 && record["i"].integerValue() == 50) last = record;
        }
        return last.has_value();
      },
      20s));
  EXPECT_TRUE(daemon_->waitForLogLine(
      "HTTPSPostBackend(batchEvent): Flushing all batched events as we reached event threshold for method 21"));
}

TEST_F(DaemonHttpsDelivery, ARealtimeEventFlushesTheBatchFirstAndTravelsAlone) {
  giveConsent();
  startDaemon();
  Telvane& session = open(kClient);
  ASSERT_TRUE(session.sendMessageWithCategory(30, 1, Value(Dictionary{{"order", Value(1)}})));
  ASSERT_TRUE(session.sendMessageWithCategory(30, 1, Value(Dictionary{{"order", Value(2)}})));
  ASSERT_TRUE(session.sendMessageWithDictionary(Value(Dictionary{
      {kTelvaneMessageParametersCategory, Value(31)},
      {kTelvaneMessageParametersType, Value(2)},
      {kTelvaneMessageParametersFlag, Value(1)},
      {kTelvaneMessageParametersPayload, Value(Dictionary{{"order", Value(3)}})}})));
  std::optional<Value> realtime = waitForRecord("/rt", 31, 2);
  ASSERT_TRUE(realtime) << daemon_->log();
  EXPECT_EQ((*realtime)["order"].integerValue(), 3);
  const std::vector<Post> rt = posts("/rt");
  ASSERT_EQ(rt.size(), 1u);
  EXPECT_EQ(rt[0].events().size(), 1u);
  EXPECT_EQ(rt[0].request.header("X-TVX-Event-Map"), "31 2");

  // The batch was flushed: its records arrive too. The two posts may travel on
  // different connections, so the order of their arrival says nothing; the order in
  // which the backend handed them over is in its log.
  std::optional<Value> batched = waitForRecord("/post", 30, 1);
  ASSERT_TRUE(batched) << daemon_->log();
  std::size_t batchRecords = 0;
  for (const Value& record : records("/post")) {
    if (record["_method"].integerValue() == 30) ++batchRecords;
  }
  EXPECT_EQ(batchRecords, 2u);
  ASSERT_TRUE(daemon_->waitForLogLine("HTTPSPostBackend(sendMessage): Sending 2, 1, 1"));
  const std::vector<std::string> lines = daemon_->logTexts();
  const auto at = [&lines](const std::string& text) {
    return std::find(lines.begin(), lines.end(), text) - lines.begin();
  };
  const auto forced = at(
      "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. Forcing "
      "Flush here to keep events in order.");
  const auto flushed = at("HTTPSPostBackend(flushMessagesWithCompletion): called");
  const auto sent = at("HTTPSPostBackend(sendMessage): Sending 2, 1, 1");
  EXPECT_LT(forced, flushed);
  EXPECT_LT(flushed, sent);
  EXPECT_LT(sent, static_cast<std::ptrdiff_t>(lines.size()));
  EXPECT_TRUE(daemon_->waitForLogLine(
      "HTTPSPostBackend(sendMessage): Got a realtime event and some events have already been batched. Forcing "
      "Flush here to keep events in order."));
}

TEST_F(DaemonHttpsDelivery, SampledOutDeviceDefersItsEventsUntilAPromotingEvent) {
  giveConsent();
  // A threshold of 0 samples every device out; without "override_sampling" the
  // backend defers instead of turning off.
  rules_[0].asDictionary()->set("sampling_threshold", Value(0));
  startDaemon();
  Telvane& session = open(kClient);
  ASSERT_TRUE(session.sendMessageWithCategory(40, 1, Value(Dictionary{{"k", Value(1)}})));
  ASSERT_TRUE(session.sendMessageWithDictionary(Value(Dictionary{
      {kTelvaneMessageParametersCategory, Value(41)},
      {kTelvaneMessageParametersType, Value(1)},
      {kTelvaneMessageParametersFlag, Value(1)},
      {kTelvaneMessageParametersPayload, Value(Dictionary{{"k", Value(2)}})}})));
  // Deferred: even the realtime event is kept back.
  EXPECT_NE(flush(session), "") << "a deferred backend discards its batch at a flush";
  EXPECT_TRUE(records("/rt").empty());
  EXPECT_FALSE(waitForRecord("/post", 40, 1, 500ms).has_value());

  // A promoting event (flag 2) is batched and enables the backend for later events.
  ASSERT_TRUE(session.sendMessageWithDictionary(Value(Dictionary{
      {kTelvaneMessageParametersCategory, Value(42)},
      {kTelvaneMessageParametersType, Value(1)},
      {kTelvaneMessageParametersFlag, Value(2)},
      {kTelvaneMessageParametersPayload, Value(Dictionary{{"k", Value(3)}})}})));
  ASSERT_TRUE(session.sendMessageWithDictionary(Value(Dictionary{
      {kTelvaneMessageParametersCategory, Value(43)},
      {kTelvaneMessageParametersType, Value(1)},
      {kTelvaneMessageParametersFlag, Value(1)},
      {kTelvaneMessageParametersPayload, Value(Dictionary{{"k", Value(4)}})}})));
  EXPECT_TRUE(waitForRecord("/post", 42, 1).has_value()) << daemon_->log();
  EXPECT_TRUE(waitForRecord("/rt", 43, 1).has_value()) << daemon_->log();
}

TEST_F(DaemonHttpsDelivery, SampledOutDeviceBelowTheOverrideIsDisabled) {
  giveConsent();
  rules_[0].asDictionary()->set("sampling_threshold", Value(0));
  rules_[0].asDictionary()->set("override_sampling", Value(0));
  startDaemon();
  Telvane& session = open(kClient);
  EXPECT_TRUE(session.enabledBackendNames().empty()) << "state 1 is not active";
  ASSERT_TRUE(session.sendMessageWithCategory(44, 1, Value(Dictionary{{"k", Value(1)}})));
  EXPECT_EQ(flush(session), "Nothing to flush");
  EXPECT_FALSE(waitForRecord("/post", 44, 1, 500ms).has_value());
}

TEST_F(DaemonHttpsDelivery, ClientIdentifierFollowsConsentAndTheServersOverride) {
  startDaemon();  // no consent yet
  Telvane& refused = open(kClient);
  EXPECT_TRUE(refused.enabledBackendNames().empty());
  EXPECT_TRUE(daemon_->waitForLogLine("HTTPSPostBackend(updateBackendState): reporting disabled by DNU: 0."));

  Telvane& overriding = open(kOverrideClient, Value::dictionary(), 2);
  ASSERT_EQ(overriding.enabledBackendNames(), std::vector<std::string>{"brindle"});
  ASSERT_TRUE(overriding.sendMessageWithCategory(50, 1, Value(Dictionary{{"k", Value(1)}})));
  EXPECT_EQ(flush(overriding), "");
  ASSERT_TRUE(waitForRecord("/post", 50, 1).has_value()) << daemon_->log();
  const std::string overrideId = posts("/post").back().document["clientId"].stringOrEmpty();
  finish(overriding);
  std::optional<Value> end = waitForRecord("/post", 0, 1);
  ASSERT_TRUE(end);
  EXPECT_EQ((*end)["Opt"].integerValue(), 1) << "server override without consent";

  giveConsent();
  Telvane& respecting = open(kClient, Value::dictionary(), 3);
  ASSERT_EQ(respecting.enabledBackendNames(), std::vector<std::string>{"brindle"});
  ASSERT_TRUE(respecting.sendMessageWithCategory(51, 1, Value(Dictionary{{"k", Value(1)}})));
  EXPECT_EQ(flush(respecting), "");
  ASSERT_TRUE(waitForRecord("/post", 51, 1).has_value()) << daemon_->log();
  const std::string respectId = posts("/post").back().document["clientId"].stringOrEmpty();
  EXPECT_FALSE(overrideId.empty());
  EXPECT_FALSE(respectId.empty());
  EXPECT_NE(overrideId, respectId) << "consent-respecting and overriding identifiers differ";
}

TEST_F(DaemonHttpsDelivery, DigestHeaderIsTheHmacOfTheUncompressedBody) {
  giveConsent();
  backendName_ = "quarl";  // the backend that receives the session's digest key
  startDaemon();
  Telvane& session = open(kClient);
  const Bytes key{'s', 'e', 'c', 'r', 'e', 't'};
  ASSERT_TRUE(session.setDigestKey(key, 0));
  ASSERT_TRUE(session.sendMessageWithCategory(60, 1, Value(Dictionary{{"k", Value(1)}})));
  EXPECT_EQ(flush(session), "");
  ASSERT_TRUE(waitForRecord("/post", 60, 1).has_value()) << daemon_->log();
  const Post post = posts("/post").back();
  const Bytes mac = crypto::hmacSha1(key, reinterpret_cast<const std::uint8_t*>(post.json.data()), post.json.size());
  const std::string hex = crypto::hex(mac);
  std::string expected = "<";
  for (std::size_t i = 0; i < hex.size(); i += 8) {
    if (i) expected += ' ';
    expected += hex.substr(i, 8);
  }
  expected += '>';
  EXPECT_EQ(post.request.header("X-TVX-DIGEST"), expected);
}

TEST_F(DaemonHttpsDelivery, ServerErrorDisablesTheBackend) {
  giveConsent();
  ScriptedAnswer unavailable;
  unavailable.status = 503;
  server_.setAnswer("/post", unavailable);
  startDaemon();
  Telvane& session = open(kClient);
  ASSERT_TRUE(session.sendMessageWithCategory(70, 1, Value(Dictionary{{"k", Value(1)}})));
  EXPECT_EQ(flush(session), "backend brindle disabled by server 503 return code");
  EXPECT_TRUE(daemon_->waitForLogLine("postJSONMessage: backend brindle disabled by server 503 return code"));
  const std::size_t before = server_.requestsForPath("/post").size();
  ASSERT_TRUE(session.sendMessageWithCategory(70, 2, Value(Dictionary{{"k", Value(2)}})));
  EXPECT_EQ(flush(session), "Nothing to flush");
  EXPECT_EQ(server_.requestsForPath("/post").size(), before) << "a disabled backend posts nothing";
}

TEST_F(DaemonHttpsDelivery, PlainHttpURLIsPostedOverHttpsOnANonInternalDevice) {
  giveConsent();
  std::string plain = server_.url("/post");
  plain.replace(0, 5, "http");  // "https" -> "http"
  rules_[0].asDictionary()->set("post_url", Value(plain));
  startDaemon();
  Telvane& session = open(kClient);
  ASSERT_TRUE(session.sendMessageWithCategory(80, 1, Value(Dictionary{{"k", Value(1)}})));
  EXPECT_EQ(flush(session), "");
  EXPECT_TRUE(waitForRecord("/post", 80, 1).has_value()) << "the TLS collector got it: " << daemon_->log();
}

TEST_F(DaemonHttpsDelivery, ValuesJsonCannotCarryAreDroppedKeyByKey) {
  giveConsent();
  startDaemon();
  Telvane& session = open(kClient);
  ASSERT_TRUE(session.sendMessageWithCategory(
      90, 1,
      Value(Dictionary{{"when", Value::date(1700000000.5)},
                       {"nested", Value(Dictionary{{"a", Value(1)}})},
                       {"nan", Value(std::nan(""))},
                       {"big", Value(std::string(256 * 1024, 'x'))},
                       {"kept", Value("yes")}})));
  EXPECT_EQ(flush(session), "");
  std::optional<Value> record = waitForRecord("/post", 90, 1);
  ASSERT_TRUE(record) << daemon_->log();
  EXPECT_EQ((*record)["when"].doubleValue(), 1700000000.5);
  EXPECT_FALSE(record->asDictionary()->contains("nested"));
  EXPECT_FALSE(record->asDictionary()->contains("nan"));
  EXPECT_EQ((*record)["big"].stringOrEmpty().size(), 256u * 1024u);
  EXPECT_EQ((*record)["kept"].stringOrEmpty(), "yes");
  EXPECT_TRUE(daemon_->waitForLogContaining(
      "HTTPSPostBackend(createMessageForPostAndLogging): JSON serializer unable to handle key: ", "nested"));

  // The daemon keeps serving.
  ASSERT_TRUE(session.sendMessageWithCategory(91, 1, Value(Dictionary{{"k", Value(1)}})));
  EXPECT_EQ(flush(session), "");
  EXPECT_TRUE(waitForRecord("/post", 91, 1).has_value());
}

}  // namespace
