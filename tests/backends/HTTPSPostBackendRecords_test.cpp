// Event records and post documents of the HTTPS post backend.
#include <gtest/gtest.h>

#include <cmath>
#include <limits>

#include "backends/BackendTestSupport.h"

namespace telvane {
namespace {

using test::enablingRule;
using test::profileWithRules;
using test::userInfo;

class HTTPSPostBackendRecordsTest : public test::BackendTestBase {
 protected:
  std::shared_ptr<HTTPSPostBackend> makeRecordBackend() { return makeBackend(profileWithRules({enablingRule()})); }

  Value record(HTTPSPostBackend& backend, Dictionary payload = {}, TimeValue time = TimeValue{1'700'000'050, 250'000},
               std::uint16_t method = 7, std::uint16_t status = 3, std::uint16_t eventID = 5) {
    return backend.newEventDictfromPayload(std::move(payload), time, method, status, eventID);
  }

  // The single record of the document a realtime send posted.
  Value postedRecord(std::size_t index = 0) {
    Value document = test::documentOf(helper->postedRequest(index));
    const Array* events = document["events"].asArray();
    EXPECT_TRUE(events && events->size() == 1);
    return events && !events->empty() ? (*events)[0] : Value();
  }
};

TEST_F(HTTPSPostBackendRecordsTest, ARecordCarriesTheSessionIdentity) {
  auto backend = makeRecordBackend();
  backend->setCombinedSessionIDString("1.4242");
  Value r = record(*backend, Dictionary{{"duration", Value(12)}, {"name", Value("call")}});
  EXPECT_EQ(r["duration"], Value(12));
  EXPECT_EQ(r["name"], Value("call"));
  EXPECT_EQ(r["_startTS"], Value(1'699'999'980LL));  // down to the whole minute
  EXPECT_EQ(r["_sender"], Value("CNF"));
  EXPECT_EQ(r["_clientVersion"], Value(12u));
  EXPECT_EQ(r["_sessionID"], Value("1.4242"));
  EXPECT_EQ(r["_eventNumber"], Value(5u));
  EXPECT_EQ(r["_method"], Value(7u));
  EXPECT_EQ(r["_status"], Value(3u));
  // Event time - start + coarse start.
  EXPECT_DOUBLE_EQ(r["_clientTS"].doubleValue(), 1'700'000'050.25 - 1'700'000'000.0 + 1'699'999'980.0);
  EXPECT_EQ(r["eventTime"], r["_clientTS"]);
  EXPECT_EQ(r["_productFamily"], Value("Laptop"));
  EXPECT_EQ(r["_productModel"], Value("Board9"));
  EXPECT_EQ(r["_osVersion"], Value("12.4"));
  EXPECT_EQ(r["_build"], Value("B77"));
  EXPECT_EQ(r["_internal"], Value(2u));
  EXPECT_EQ(r["_reportVers"], Value("8.1.2"));
  EXPECT_EQ(r["_timezoneOffset"], Value(7200));
}

TEST_F(HTTPSPostBackendRecordsTest, EveryRecordFollowsTheSettingsOfTheMoment) {
  auto backend = makeRecordBackend();
  Value first = record(*backend);
  backend->setProductVersion(std::string("13.0"));
  backend->setBuildVersion(std::nullopt);
  backend->setHardwareType(std::string("Board10"));
  backend->setClientVersion(13);
  backend->setCompType(5);
  backend->setCombinedSessionIDString("2.4242");
  backend->setSelfVersion("9.0.1");
  backend->setStartTimestamp(TimeValue{1'700'000'600, 0});
  Value second = record(*backend, {}, TimeValue{1'700'000'650, 0}, 8, 4, 6);
  EXPECT_EQ(first["_osVersion"], Value("12.4"));
  EXPECT_EQ(second["_osVersion"], Value("13.0"));
  EXPECT_TRUE(second["_build"].isNull());
  EXPECT_EQ(second["_productModel"], Value("Board10"));
  EXPECT_EQ(second["_clientVersion"], Value(13u));
  EXPECT_EQ(second["_sender"], Value("AUD"));
  EXPECT_EQ(second["_sessionID"], Value("2.4242"));
  EXPECT_EQ(second["_reportVers"], Value("9.0.1"));
  EXPECT_EQ(second["_startTS"], Value(1'700'000'580LL));
  EXPECT_DOUBLE_EQ(second["_clientTS"].doubleValue(), 1'700'000'630.0);
  EXPECT_EQ(second["_method"], Value(8u));
  EXPECT_EQ(second["_status"], Value(4u));
  EXPECT_EQ(second["_eventNumber"], Value(6u));
  // The posted form agrees.
  backend->setUserInfoDict(userInfo("app", "svc"));
  ASSERT_EQ(backend->updateState(), kBackendStateEnabled);
  backend->sendMessage(blob({}), TimeValue{1'700'000'650, 0}, 8, 4, kMessageFlagRealtime);
  Value posted = postedRecord();
  EXPECT_EQ(posted["_osVersion"], Value("13.0"));
  EXPECT_EQ(posted["_sessionID"], Value("2.4242"));
  EXPECT_EQ(posted["_sender"], Value("AUD"));
}

TEST_F(HTTPSPostBackendRecordsTest, StartTimeIsCutToTheMinuteExceptOnInternalReleases) {
  auto backend = makeRecordBackend();
  backend->setStartTimestamp(TimeValue{1'000'059, 700'000});
  EXPECT_EQ(record(*backend)["_startTS"], Value(1'000'020LL));

  internalRelease = true;
  auto internal = makeRecordBackend();
  internal->setStartTimestamp(TimeValue{1'000'059, 700'000});
  Value r = record(*internal);
  EXPECT_EQ(r["_startTS"], Value(1'000'059LL));
  EXPECT_EQ(r["_internal"], Value(3u));
}

TEST_F(HTTPSPostBackendRecordsTest, InternalSessionsOfSomeTypesAreIdentifiedByNumber) {
  auto backend = makeRecordBackend();
  backend->setCombinedSessionIDString("1.4242");
  backend->setIsInternal(true);
  for (std::int32_t type : {7, 11, 13}) {
    backend->setCompType(type);
    EXPECT_EQ(record(*backend)["_sessionID"], Value(4242u)) << type;
  }
  backend->setCompType(12);
  EXPECT_EQ(record(*backend)["_sessionID"], Value("1.4242"));
  backend->setIsInternal(false);
  backend->setCompType(11);
  EXPECT_EQ(record(*backend)["_sessionID"], Value("1.4242"));
  // Without a combined identifier, only the numeric rule can set one.
  auto fresh = makeRecordBackend();
  EXPECT_TRUE(record(*fresh)["_sessionID"].isNull());
}

TEST_F(HTTPSPostBackendRecordsTest, VersionWithoutMinorPart) {
  auto backend = makeRecordBackend();
  backend->setSelfVersion("3.4.0");
  EXPECT_EQ(record(*backend)["_reportVers"], Value("3.4"));
  backend->setUserInfoDict(userInfo("app", "svc"));
  ASSERT_EQ(backend->updateState(), kBackendStateEnabled);
  backend->postJSONMessage("{}", kMessageFlagOrdinary, std::nullopt, std::nullopt, nullptr);
  ASSERT_EQ(helper->postCount(), 1u);
  std::string agent = test::headerOf(helper->postedRequest(0), "User-Agent").value_or("");
  EXPECT_EQ(agent.rfind("Telvane/3.4 ", 0), 0u) << agent;
  EXPECT_EQ(agent, "Telvane/3.4 (Board9; 12.4)");
}

TEST_F(HTTPSPostBackendRecordsTest, UnknownComponentTypesAreNamedUnknown) {
  auto backend = makeRecordBackend();
  backend->setCompType(99);
  EXPECT_EQ(record(*backend)["_sender"], Value("Unknown"));
  backend->setCompType(-1);
  EXPECT_EQ(record(*backend)["_sender"], Value("Unknown"));
}

TEST_F(HTTPSPostBackendRecordsTest, SharedDataOverridesUserInformationWhichOverridesTheRecord) {
  auto backend = makeRecordBackend();
  backend->setUserInfoDict(Value(Dictionary{{"_clientName", Value("app")}, {"_sender", Value("mine")},
                                            {"team", Value("a")}}));
  Value r = record(*backend, Dictionary{{"team", Value("payload")}});
  backend->prepareEventForMessage(*r.asDictionary(),
                                  Value(Dictionary{{"team", Value("shared")}, {"group", Value(3)}}));
  EXPECT_EQ(r["_sender"], Value("mine"));
  EXPECT_EQ(r["team"], Value("shared"));
  EXPECT_EQ(r["group"], Value(3));
  EXPECT_EQ(r["_clientName"], Value("app"));
  // Shared data that is not a map adds nothing.
  Value other = record(*backend);
  backend->prepareEventForMessage(*other.asDictionary(), Value("junk"));
  EXPECT_EQ(other["_sender"], Value("mine"));
}

TEST_F(HTTPSPostBackendRecordsTest, ADocumentCarriesPostTimeClientAndRecordsInOrder) {
  auto backend = makeRecordBackend();
  std::vector<Value> records{record(*backend, Dictionary{{"n", Value(1)}}),
                             record(*backend, Dictionary{{"n", Value(2)}}),
                             record(*backend, Dictionary{{"n", Value(3)}})};
  auto json = backend->createMessageForPostAndLogging(records, nullptr);
  ASSERT_TRUE(json.has_value());
  Result<Value> document = json::parse(*json);
  ASSERT_TRUE(document.ok());
  EXPECT_DOUBLE_EQ(document.value()["postTime"].doubleValue(), 1'700'000'100.25);
  EXPECT_EQ(document.value()["clientId"], Value(backend->uuidRespectDnu()));
  const Array* events = document.value()["events"].asArray();
  ASSERT_NE(events, nullptr);
  ASSERT_EQ(events->size(), 3u);
  for (int i = 0; i < 3; ++i) EXPECT_EQ((*events)[i]["n"], Value(i + 1));
  // Compact JSON.
  EXPECT_EQ(json->find('\n'), std::string::npos);
}

TEST_F(HTTPSPostBackendRecordsTest, DatesBecomeSecondsAndNestedDataNeedsPermission) {
  auto backend = makeRecordBackend();
  Dictionary payload{{"when", Value::date(1'600'000'000.5)},
                     {"never", Value::date(std::numeric_limits<double>::infinity())},
                     {"inner", Value(Dictionary{{"a", Value(1)}})},
                     {"list", Value(Array{Value(1), Value(2)})},
                     {"nan", Value(std::nan(""))},
                     {"blob", Value(Bytes{1, 2, 3})},
                     {"nothing", Value()},
                     {"flag", Value(true)},
                     {"text", Value("ok")}};
  auto json = backend->createMessageForPostAndLogging({record(*backend, payload)}, nullptr);
  ASSERT_TRUE(json.has_value());
  Value r = (*json::parse(*json).value()["events"].asArray())[0];
  EXPECT_DOUBLE_EQ(r["when"].doubleValue(), 1'600'000'000.5);
  EXPECT_EQ(r["never"], Value(-1.0));
  EXPECT_TRUE(r["inner"].isNull());
  EXPECT_TRUE(r["list"].isNull());
  EXPECT_TRUE(r["nan"].isNull());
  EXPECT_TRUE(r["blob"].isNull());
  EXPECT_FALSE(r.asDictionary()->contains("nothing"));
  EXPECT_EQ(r["flag"], Value(true));
  EXPECT_EQ(r["text"], Value("ok"));
  EXPECT_EQ(r["_method"], Value(7));  // the record itself is kept
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "HTTPSPostBackend(createMessageForPostAndLogging): JSON serializer unable to handle "
                               "key: inner, value: {\"a\": 1}"));
  EXPECT_TRUE(capture.contains(
      log::Level::Error,
      "HTTPSPostBackend(createMessageForPostAndLogging): JSON serializer unable to handle key: nan, value: nan"));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "HTTPSPostBackend(createMessageForPostAndLogging): JSON serializer unable to handle "
                               "key: blob, value: <010203>"));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "HTTPSPostBackend(createMessageForPostAndLogging): JSON serializer unable to handle "
                               "key: nothing, value: null"));

  backend->setAllowNestedData(true);
  json = backend->createMessageForPostAndLogging({record(*backend, payload)}, nullptr);
  ASSERT_TRUE(json.has_value());
  r = (*json::parse(*json).value()["events"].asArray())[0];
  EXPECT_EQ(r["inner"]["a"], Value(1));
  EXPECT_EQ(r["list"], Value(Array{Value(1), Value(2)}));
}

TEST_F(HTTPSPostBackendRecordsTest, ValuesTheWriterRefusesAreDroppedKeyByKey) {
  auto backend = makeRecordBackend();
  backend->setAllowNestedData(true);
  Dictionary payload{{"bad", Value(std::string("\xff\xfe"))},
                     {"deep", Value(Array{Value(1.0), Value(std::nan(""))})},
                     {std::string("k\xc3"), Value(1)},
                     {"good", Value("fine")}};
  auto json = backend->createMessageForPostAndLogging({record(*backend, payload)}, nullptr);
  ASSERT_TRUE(json.has_value());
  Value r = (*json::parse(*json).value()["events"].asArray())[0];
  EXPECT_TRUE(r["bad"].isNull());
  EXPECT_TRUE(r["deep"].isNull());
  EXPECT_EQ(r["good"], Value("fine"));
  EXPECT_EQ(r["_method"], Value(7));
  EXPECT_TRUE(capture.containsPrefix(
      "HTTPSPostBackend(createMessageForPostAndLogging): JSON serializer unable to handle key: deep, value: "));
  EXPECT_TRUE(capture.containsPrefix(
      "HTTPSPostBackend(createMessageForPostAndLogging): JSON serializer unable to handle key: bad, value: "));
}

TEST_F(HTTPSPostBackendRecordsTest, AHugePayloadIsWrittenAndCompressed) {
  auto backend = makeEnabledBackend();
  backend->setBatchEvents(false);
  std::string big(4 * 1024 * 1024, 'x');
  auto text = backend->sendMessage(blob(Dictionary{{"big", Value(big)}}), at(1'700'000'060), 1, 1,
                                   kMessageFlagOrdinary);
  ASSERT_EQ(helper->postCount(), 1u);
  HttpRequest request = helper->postedRequest(0);
  EXPECT_EQ(test::headerOf(request, "Content-Encoding"), std::optional<std::string>("gzip"));
  EXPECT_LT(request.body.size(), big.size() / 100);
  Value r = (*test::documentOf(request)["events"].asArray())[0];
  EXPECT_EQ(r["big"].stringOrEmpty().size(), big.size());
  EXPECT_TRUE(text.has_value());
}

TEST_F(HTTPSPostBackendRecordsTest, TheReadableCopyNeedsConsentOrForcedLogging) {
  std::optional<std::string> readable;
  auto backend = makeEnabledBackend();  // consent given, respected
  ASSERT_TRUE(backend->createMessageForPostAndLogging({record(*backend)}, &readable).has_value());
  ASSERT_TRUE(readable.has_value());
  EXPECT_NE(readable->find('\n'), std::string::npos);  // pretty-printed
  EXPECT_EQ(json::parse(*readable).value()["clientId"], Value(backend->uuidRespectDnu()));

  // Consent absent but overridden: posted, not logged.
  consent = false;
  auto overridden = makeEnabledBackend(
      [] {
        Dictionary rule = enablingRule();
        rule.set("override_dnu", Value(1));
        return rule;
      }(),
      "splunk");
  readable.reset();
  ASSERT_TRUE(overridden->createMessageForPostAndLogging({record(*overridden)}, &readable).has_value());
  EXPECT_FALSE(readable.has_value());

  // Forced logging counts in the development and internal environments only.
  settings->write(kBackendDefaultsDomain, kForceEventLoggingDefaultsKey, Value("YES"));
  auto forced = makeEnabledBackend(
      [] {
        Dictionary rule = enablingRule();
        rule.set("override_dnu", Value(1));
        return rule;
      }(),
      "splunk");
  EXPECT_TRUE(forced->forceEventLogging());
  for (std::uint32_t env : {1u, 2u, 3u, 4u}) {
    environment = env;
    readable.reset();
    ASSERT_TRUE(forced->createMessageForPostAndLogging({record(*forced)}, &readable).has_value());
    EXPECT_EQ(readable.has_value(), env == 1 || env == 2) << env;
  }
}

TEST_F(HTTPSPostBackendRecordsTest, TheReadableCopyIsThePrettyFormOfThePostedDocument) {
  auto backend = makeEnabledBackend();
  backend->setAllowNestedData(true);
  std::optional<std::string> readable;
  Dictionary payload{{"quote", Value("say \"hi\" \\ {x} [y], z: 1\n\u00e9\u4e2d")},
                     {"emptyMap", Value::dictionary()},
                     {"emptyList", Value::array()},
                     {"nested", Value(Dictionary{{"list", Value(Array{Value(1), Value(2.5), Value("a,b")})},
                                                 {"map", Value(Dictionary{{"k", Value(true)}})}})},
                     {"negative", Value(-3)},
                     {"small", Value(1e-7)}};
  auto json = backend->createMessageForPostAndLogging({record(*backend, payload), record(*backend)}, &readable);
  ASSERT_TRUE(json.has_value());
  ASSERT_TRUE(readable.has_value());
  Result<Value> parsed = json::parse(*json);
  ASSERT_TRUE(parsed.ok());
  // The same text the JSON writer gives for the document, and the same document.
  EXPECT_EQ(*readable, *json::write(parsed.value(), true));
  EXPECT_EQ(*json, *json::write(parsed.value()));
  EXPECT_EQ((*parsed.value()["events"].asArray())[0]["quote"], payload.get("quote"));
}

TEST_F(HTTPSPostBackendRecordsTest, DocumentFiltersActOnTopLevelKeysOnly) {
  auto backend = makeEnabledBackend([] {
    Dictionary rule = enablingRule();
    rule.set("filters", Value(Array{Value(Dictionary{{"key", Value("clientid")}, {"action", Value("sha256")}}),
                                    Value(Dictionary{{"key", Value("postTime")}, {"action", Value("remove")}}),
                                    Value(Dictionary{{"key", Value("name")}, {"action", Value("remove")}})}));
    return rule;
  }());
  auto json = backend->createMessageForPostAndLogging({record(*backend, Dictionary{{"name", Value("kept")}})}, nullptr);
  ASSERT_TRUE(json.has_value());
  Value document = json::parse(*json).value();
  EXPECT_EQ(document["clientId"], Value(TelvaneBackendBase::convertIntoSHA256(backend->uuidRespectDnu())));
  EXPECT_FALSE(document.asDictionary()->contains("postTime"));
  // Records inside "events" are not walked.
  EXPECT_EQ((*document["events"].asArray())[0]["name"], Value("kept"));
}

}  // namespace
}  // namespace telvane
