// The server-driven state of the HTTPS post backend: rule choice, consent, country,
// devices, filters, sampling, URLs and the settings a rule sets.
#include <gtest/gtest.h>

#include "backends/BackendTestSupport.h"
#include "util/PersistentIdentifiers.h"

namespace telvane {
namespace {

using test::enablingRule;
using test::numbers;
using test::profileWithRules;
using test::strings;
using test::userInfo;

class HTTPSPostBackendStateTest : public test::BackendTestBase {
 protected:
  // The state of a backend with these rules, for client "app" of service "svc".
  std::int32_t stateFor(std::vector<Dictionary> rules, std::uint32_t draw = 5000) {
    backend = makeBackend(profileWithRules(std::move(rules)), "splunk", draw);
    backend->setUserInfoDict(userInfo("app", "svc"));
    return backend->updateState();
  }

  static Dictionary with(Dictionary rule, std::initializer_list<Dictionary::Entry> changes) {
    for (const auto& [key, value] : changes) rule.set(key, value);
    return rule;
  }

  std::shared_ptr<HTTPSPostBackend> backend;
};

TEST_F(HTTPSPostBackendStateTest, WithoutRequiredUserInfoTheStateIsTwoAndTheFirstPostURLWins) {
  backend = makeBackend(profileWithRules({Dictionary{{"client", Value("nobody")}},
                                          Dictionary{{"client", Value("other")},
                                                     {"post_url", Value("https://first.test/p")},
                                                     {"event_threshold", Value(10)}},
                                          Dictionary{{"post_url", Value("https://second.test/p")}}}));
  backend->setRequireUserInfo(false);
  EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
  EXPECT_EQ(backend->state(), kBackendStateEnabled);
  EXPECT_EQ(backend->postURL(), std::optional<std::string>("https://first.test/p"));
  EXPECT_EQ(backend->realtimePostURL(), std::optional<std::string>("https://first.test/p"));
  EXPECT_EQ(backend->eventThreshold(), 10);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updatePostLink): Storebag 'https://first.test/p' for postURL"));
  EXPECT_TRUE(capture.contains(
      "HTTPSPostBackend(updatePostLink): realtimePostURL defaults to postURL 'https://first.test/p'"));
  EXPECT_TRUE(capture.contains("resetBackendStateWithClient: event_threshold set to 10"));
  EXPECT_TRUE(capture.contains("setBackendStateWithClient: extras on internal is set to 0"));
  // No consent, country or sampling rule applies in this mode.
  EXPECT_FALSE(capture.containsPrefix("HTTPSPostBackend(updateBackendState): splunk: client found"));
}

TEST_F(HTTPSPostBackendStateTest, WithoutRequiredUserInfoAndNoPostURLTheDefaultsStand) {
  consent = false;
  backend = makeBackend(profileWithRules({Dictionary{{"event_threshold", Value(3)}}}));
  backend->setRequireUserInfo(false);
  EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
  EXPECT_FALSE(backend->postURL().has_value());
  EXPECT_EQ(backend->eventThreshold(), HTTPSPostBackend::kDefaultEventThreshold);
  EXPECT_TRUE(capture.contains("resetBackendStateWithClient: event_threshold set to 49"));
}

TEST_F(HTTPSPostBackendStateTest, RequiredButEmptyUserInfoIsPending) {
  backend = makeBackend(profileWithRules({enablingRule()}));
  EXPECT_EQ(backend->updateState(), kBackendStatePending);
  backend->setUserInfoDict(Value::dictionary());
  EXPECT_EQ(backend->updateState(), kBackendStatePending);
  EXPECT_EQ(backend->state(), kBackendStatePending);
}

TEST_F(HTTPSPostBackendStateTest, ClientNamesMatchWholeIgnoringCase) {
  EXPECT_EQ(stateFor({with(enablingRule(), {{"client", Value("Other,APP")}})}), kBackendStateEnabled);
  EXPECT_EQ(stateFor({with(enablingRule(), {{"client", Value("application")}})}), kBackendStateDisabled);
  EXPECT_EQ(stateFor({with(enablingRule(), {{"client", Value("ap")}})}), kBackendStateDisabled);
  // Parts are not trimmed.
  EXPECT_EQ(stateFor({with(enablingRule(), {{"client", Value("other, app")}})}), kBackendStateDisabled);
}

TEST_F(HTTPSPostBackendStateTest, ServiceNamesMatchBySubstringIgnoringCase) {
  EXPECT_EQ(stateFor({with(enablingRule(), {{"service", Value("x,SV")}})}), kBackendStateEnabled);
  EXPECT_EQ(stateFor({with(enablingRule(), {{"service", Value("svcs")}})}), kBackendStateDisabled);
}

TEST_F(HTTPSPostBackendStateTest, ARuleNamingAClientDoesNotApplyToASessionWithoutOne) {
  backend = makeBackend(profileWithRules({with(enablingRule(), {{"client", Value("app")}})}));
  backend->setUserInfoDict(userInfo(nullptr, "svc"));
  EXPECT_EQ(backend->updateState(), kBackendStateDisabled);
}

TEST_F(HTTPSPostBackendStateTest, TheFirstMatchingRuleIsTheSessionsRule) {
  EXPECT_EQ(stateFor({with(enablingRule(), {{"client", Value("app")}, {"sampling_threshold", Value(0.0)}}),
                      enablingRule()}),
            kBackendStateDeferred);
}

TEST_F(HTTPSPostBackendStateTest, ARuleEnabledSinceALaterVersionIsSkipped) {
  auto rules = [] {
    return std::vector<Dictionary>{
        with(enablingRule(), {{"enabledSince", Value("7.2")}, {"post_url", Value("https://new.test")}}),
        with(enablingRule(), {{"post_url", Value("https://old.test")}})};
  };
  backend = makeBackend(profileWithRules(rules()));
  backend->setSelfVersion("7.1.9");
  backend->setUserInfoDict(userInfo("app", "svc"));
  EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
  EXPECT_EQ(backend->postURL(), std::optional<std::string>("https://old.test"));

  backend = makeBackend(profileWithRules(rules()));
  backend->setSelfVersion("7.2");
  backend->setUserInfoDict(userInfo("app", "svc"));
  EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
  EXPECT_EQ(backend->postURL(), std::optional<std::string>("https://new.test"));
}

TEST_F(HTTPSPostBackendStateTest, FrameworkVersionComparison) {
  backend = makeBackend(profileWithRules({enablingRule()}));
  backend->setSelfVersion("7.1.9");
  auto since = [](Value v) { return Value(Dictionary{{"enabledSince", std::move(v)}}); };
  EXPECT_TRUE(backend->isFrameworkEnabledForClient(Value::dictionary()));
  EXPECT_TRUE(backend->isFrameworkEnabledForClient(since(Value("7.1.9"))));
  EXPECT_TRUE(backend->isFrameworkEnabledForClient(since(Value("7.1"))));
  EXPECT_TRUE(backend->isFrameworkEnabledForClient(since(Value("6.9.9"))));
  EXPECT_FALSE(backend->isFrameworkEnabledForClient(since(Value("7.1.10"))));
  EXPECT_FALSE(backend->isFrameworkEnabledForClient(since(Value("8"))));
  EXPECT_TRUE(backend->isFrameworkEnabledForClient(since(Value("263.1.9"))));  // 263 mod 256 is 7
  EXPECT_TRUE(backend->isFrameworkEnabledForClient(since(Value(7))));
  EXPECT_TRUE(backend->isFrameworkEnabledForClient(since(Value::array())));  // not a version: no condition
}

TEST_F(HTTPSPostBackendStateTest, NoMatchingRuleDisables) {
  EXPECT_EQ(stateFor({with(enablingRule(), {{"client", Value("other")}})}), kBackendStateDisabled);
}

TEST_F(HTTPSPostBackendStateTest, WithoutConsentTheBackendIsDisabledUnlessTheRuleOverridesIt) {
  consent = false;
  EXPECT_EQ(stateFor({enablingRule()}), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): reporting disabled by DNU: 0."));
  EXPECT_EQ(backend->dnuType(), 0);

  capture.clear();
  EXPECT_EQ(stateFor({with(enablingRule(), {{"override_dnu", Value(2)}})}), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): reporting disabled by DNU: 2."));

  EXPECT_EQ(stateFor({with(enablingRule(), {{"override_dnu", Value(1)}})}), kBackendStateEnabled);
  EXPECT_EQ(backend->dnuType(), 1);
  EXPECT_EQ(backend->clientIdentifier(), backend->uuidOverrideDnu());

  consent = true;
  EXPECT_EQ(stateFor({with(enablingRule(), {{"override_dnu", Value("1")}})}), kBackendStateEnabled);
  EXPECT_EQ(backend->dnuType(), 2);
  EXPECT_EQ(stateFor({enablingRule()}), kBackendStateEnabled);
  EXPECT_EQ(backend->dnuType(), 0);
  EXPECT_EQ(backend->clientIdentifier(), backend->uuidRespectDnu());
  EXPECT_NE(backend->uuidRespectDnu(), backend->uuidOverrideDnu());
}

TEST_F(HTTPSPostBackendStateTest, ARuleWithoutALocaleWhitelistDisables) {
  Dictionary rule = enablingRule();
  rule.erase("locale_whitelist");
  EXPECT_EQ(stateFor({rule}), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): (US) isn't in country code list (null)"));
  capture.clear();
  EXPECT_EQ(stateFor({with(enablingRule(), {{"locale_whitelist", Value::array()}})}), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): (US) isn't in country code list []"));
}

TEST_F(HTTPSPostBackendStateTest, CountryCodesMatchBySubstringAndADeviceWithoutOnePasses) {
  EXPECT_EQ(stateFor({with(enablingRule(), {{"locale_whitelist", strings({"CA", "us"})}})}), kBackendStateEnabled);
  capture.clear();
  EXPECT_EQ(stateFor({with(enablingRule(), {{"locale_whitelist", strings({"CA", "DE"})}})}), kBackendStateDisabled);
  EXPECT_TRUE(
      capture.contains("HTTPSPostBackend(updateBackendState): (US) isn't in country code list [\"CA\", \"DE\"]"));
  {
    std::lock_guard<std::mutex> lock(mutex);
    countryCode.reset();
  }
  EXPECT_EQ(stateFor({with(enablingRule(), {{"locale_whitelist", strings({"CA"})}})}), kBackendStateEnabled);
}

TEST_F(HTTPSPostBackendStateTest, DeviceWhitelistAndBlacklist) {
  EXPECT_EQ(stateFor({with(enablingRule(), {{"device_whitelist", strings({"desk", "LAP"})}})}),
            kBackendStateEnabled);
  capture.clear();
  EXPECT_EQ(stateFor({with(enablingRule(), {{"device_whitelist", strings({"Desk"})}})}), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): (Laptop) isn't in device whitelist [\"Desk\"]"));
  capture.clear();
  EXPECT_EQ(stateFor({with(enablingRule(), {{"device_blacklist", strings({"board"})}})}), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): (Board9) is in device blacklist [\"board\"]"));
  EXPECT_EQ(stateFor({with(enablingRule(), {{"device_blacklist", strings({"Phone"})}})}), kBackendStateEnabled);

  // With a non-empty blacklist, a device without a model counts as blacklisted.
  backend = makeBackend(profileWithRules({with(enablingRule(), {{"device_blacklist", strings({"Phone"})}})}));
  backend->setHardwareType(std::nullopt);
  backend->setUserInfoDict(userInfo("app", "svc"));
  EXPECT_EQ(backend->updateState(), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): ((null)) is in device blacklist [\"Phone\"]"));
}

TEST_F(HTTPSPostBackendStateTest, FiltersAreRequired) {
  Dictionary rule = enablingRule();
  rule.erase("filters");
  EXPECT_EQ(stateFor({rule}), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains(log::Level::Error, "HTTPSPostBackend(updateBackendState): filters are required."));
  capture.clear();
  EXPECT_EQ(stateFor({with(enablingRule(), {{"filters", Value("remove everything")}})}), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains(log::Level::Error, "HTTPSPostBackend(updateBackendState): filters are required."));
}

TEST_F(HTTPSPostBackendStateTest, SamplingDecision) {
  Dictionary rule = with(enablingRule(), {{"sampling_threshold", Value(0.3)}});
  EXPECT_EQ(stateFor({rule}, 2000), kBackendStateEnabled);
  EXPECT_EQ(stateFor({rule}, 5000), kBackendStateDeferred);
  EXPECT_EQ(stateFor({with(rule, {{"override_sampling", Value(0.4)}})}, 5000), kBackendStateDisabled);
  EXPECT_EQ(backend->overrideSampling(), std::optional<double>(0.4));
  EXPECT_EQ(stateFor({with(rule, {{"override_sampling", Value(0.6)}})}, 5000), kBackendStateDeferred);
  EXPECT_EQ(stateFor({with(rule, {{"override_sampling", Value(0.5)}})}, 5000), kBackendStateDisabled);
  // The threshold must be strictly above the draw.
  EXPECT_EQ(stateFor({rule}, 3000), kBackendStateDeferred);
  Dictionary without = enablingRule();
  without.erase("sampling_threshold");
  EXPECT_EQ(stateFor({without}, 0), kBackendStateDisabled);
  EXPECT_FALSE(backend->samplingThreshold().has_value());
}

TEST_F(HTTPSPostBackendStateTest, TheFirstCountryEntryNamingTheCountryWins) {
  Dictionary rule = with(enablingRule(),
                         {{"sampling_threshold", Value(0.3)},
                          {"per_country_sampling_thresholds",
                           Value(Array{Value(Dictionary{{"country", strings({"DE"})}, {"threshold", Value(0.9)}}),
                                       Value("junk"),
                                       Value(Dictionary{{"country", strings({"CA", "US"})}, {"threshold", Value(0.1)}}),
                                       Value(Dictionary{{"country", strings({"US"})}, {"threshold", Value(0.8)}})})}});
  EXPECT_EQ(stateFor({rule}, 2000), kBackendStateDeferred);
  EXPECT_EQ(backend->samplingThreshold(), std::optional<double>(0.1));
  EXPECT_TRUE(
      capture.contains("HTTPSPostBackend(updateBackendState): sampling threshold for US changed from 0.30 to 0.10"));
  EXPECT_FALSE(capture.containsPrefix(
      "HTTPSPostBackend(updateBackendState): sampling threshold for US changed from 0.10"));
}

TEST_F(HTTPSPostBackendStateTest, UserDefaultPostURLWinsOverEveryRule) {
  settings->write(kBackendDefaultsDomain, kHttpsPostURLDefaultsKey, Value("https://local.test/post"));
  EXPECT_EQ(stateFor({enablingRule()}), kBackendStateEnabled);
  EXPECT_TRUE(
      capture.contains("HTTPSPostBackend(initWithName): Using user default 'https://local.test/post' for postURL"));
  EXPECT_EQ(backend->postURL(), std::optional<std::string>("https://local.test/post"));
  EXPECT_EQ(backend->realtimePostURL(), std::optional<std::string>("https://collector.test/realtime"));
  EXPECT_FALSE(backend->updatePostLink(Value(Dictionary{{"post_url", Value("https://other.test")}})));
  EXPECT_EQ(backend->postURL(), std::optional<std::string>("https://local.test/post"));

  settings->write(kBackendDefaultsDomain, kHttpsRealtimePostURLDefaultsKey, Value("https://local.test/rt"));
  EXPECT_EQ(stateFor({enablingRule()}), kBackendStateEnabled);
  EXPECT_TRUE(capture.contains(
      "HTTPSPostBackend(initWithName): Using user default 'https://local.test/rt' for realtimePostURL"));
  EXPECT_EQ(backend->postURL(), std::optional<std::string>("https://local.test/post"));
  EXPECT_EQ(backend->realtimePostURL(), std::optional<std::string>("https://local.test/rt"));
}

TEST_F(HTTPSPostBackendStateTest, UpdatePostLinkDefaultsTheRealtimeURLToThePostURL) {
  backend = makeBackend(profileWithRules({enablingRule()}));
  EXPECT_TRUE(backend->updatePostLink(Value(Dictionary{{"post_url", Value("https://a.test")}})));
  EXPECT_EQ(backend->realtimePostURL(), std::optional<std::string>("https://a.test"));
  EXPECT_FALSE(backend->updatePostLink(Value(Dictionary{{"realtime_post_url", Value("https://rt.test")}})));
  EXPECT_EQ(backend->postURL(), std::optional<std::string>("https://a.test"));
  EXPECT_EQ(backend->realtimePostURL(), std::optional<std::string>("https://rt.test"));
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updatePostLink): Storebag 'https://rt.test' for realtimePostURL"));
  // A URL of the wrong type counts as absent.
  EXPECT_FALSE(backend->updatePostLink(Value(Dictionary{{"post_url", Value(5)}})));
  EXPECT_EQ(backend->postURL(), std::optional<std::string>("https://a.test"));
}

TEST_F(HTTPSPostBackendStateTest, ExpediteComesFromTheFirstRuleNamingTheSession) {
  backend = makeBackend(profileWithRules({with(enablingRule(), {{"expedite", Value(1)}})}));
  backend->setBatchEvents(true);
  backend->setUserInfoDict(userInfo("app", "svc"));
  backend->updateState();
  EXPECT_FALSE(backend->batchEvents());
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=0"));

  backend = makeBackend(profileWithRules({with(enablingRule(), {{"expedite", Value(0)}})}));
  backend->setUserInfoDict(userInfo("app", "svc"));
  backend->updateState();
  EXPECT_TRUE(backend->batchEvents());
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): Store bag override  _batchEvent=1"));

  // The first rule naming the session ends the search, with or without the key.
  capture.clear();
  backend = makeBackend(profileWithRules(
      {with(enablingRule(), {{"client", Value("other")}, {"expedite", Value(0)}}), enablingRule(),
       with(enablingRule(), {{"expedite", Value(0)}})}));
  backend->setUserInfoDict(userInfo("app", "svc"));
  backend->updateState();
  EXPECT_FALSE(backend->batchEvents());
  EXPECT_FALSE(capture.containsPrefix("HTTPSPostBackend(updateBackendState): Store bag override"));
}

TEST_F(HTTPSPostBackendStateTest, TheMatchedRuleSetsItsSettings) {
  Dictionary rule = with(enablingRule(), {{"event_threshold", Value("12")},
                                          {"extras_on_internal", Value(1)},
                                          {"event_whitelist", numbers({1, 2})},
                                          {"event_blacklist", numbers({9})},
                                          {"use_wifi_only", Value(1)},
                                          {"custom_clientId", Value(true)}});
  EXPECT_EQ(stateFor({rule}), kBackendStateEnabled);
  EXPECT_EQ(backend->eventThreshold(), 12);
  EXPECT_EQ(backend->extrasOnInternal(), 1);
  EXPECT_EQ(backend->eventWhitelist(), std::optional<Array>(*numbers({1, 2}).asArray()));
  EXPECT_EQ(backend->eventBlacklist(), std::optional<Array>(*numbers({9}).asArray()));
  EXPECT_TRUE(backend->shouldUseWiFiOnly());
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): splunk: eventWhitelist=[1, 2]"));
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): splunk: eventBlacklist=[9]"));
  EXPECT_TRUE(capture.contains(
      "HTTPSPostBackend(updateBackendState): splunk: client found app:svc, state=2, samplingFactor=0.500000"));
  EXPECT_TRUE(capture.contains("setBackendStateWithClient: extras on internal is set to 1"));
  // The custom identifier is the persistent one of the client and service names.
  std::optional<Value> stored = settings->read(kTelvaneDefaultsDomain, "uuid:app:svc");
  ASSERT_TRUE(stored.has_value());
  EXPECT_EQ(backend->uuidCustom(), std::optional<std::string>(stored->stringOrEmpty()));
  EXPECT_EQ(backend->clientIdentifier(), stored->stringOrEmpty());
  // Internal sessions whose rule asks for extras send the device identifier.
  backend->setIsInternal(true);
  EXPECT_EQ(backend->clientIdentifier(), "udid-0001");

  // "use_wifi_only" is kept as 8 bits.
  EXPECT_EQ(stateFor({with(enablingRule(), {{"use_wifi_only", Value(256)}})}), kBackendStateEnabled);
  EXPECT_FALSE(backend->shouldUseWiFiOnly());
}

TEST_F(HTTPSPostBackendStateTest, SettingsOfAnEarlierEvaluationStayWhenALaterOneEndsEarly) {
  EXPECT_EQ(stateFor({with(enablingRule(), {{"client", Value("app")}, {"event_whitelist", numbers({4})}})}),
            kBackendStateEnabled);
  backend->setUserInfoDict(userInfo("someone", "svc"));
  EXPECT_EQ(backend->updateState(), kBackendStateDisabled);
  EXPECT_EQ(backend->eventWhitelist(), std::optional<Array>(*numbers({4}).asArray()));
}

TEST_F(HTTPSPostBackendStateTest, RuleValuesOfTheWrongTypeNeverCrash) {
  // Every key of the wrong type: no crash, and a defined answer.
  Dictionary rule{{"client", Value::array()},
                  {"service", Value::dictionary()},
                  {"expedite", Value::array()},
                  {"enabledSince", Value::dictionary()},
                  {"override_dnu", Value::array()},
                  {"locale_whitelist", Value("US")},
                  {"device_whitelist", Value(3)},
                  {"device_blacklist", Value("Board9")},
                  {"filters", Value::dictionary()},
                  {"sampling_threshold", Value::array()},
                  {"per_country_sampling_thresholds", Value("US")},
                  {"override_sampling", Value::dictionary()},
                  {"event_threshold", Value::array()},
                  {"extras_on_internal", Value("many")},
                  {"custom_clientId", Value()},
                  {"post_url", Value(7)},
                  {"realtime_post_url", Value::array()},
                  {"event_whitelist", Value("1,2")},
                  {"event_blacklist", Value(9)},
                  {"use_wifi_only", Value::dictionary()}};
  // A list given as text is no list: the country rule disables the backend.
  EXPECT_EQ(stateFor({rule}), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains("HTTPSPostBackend(updateBackendState): (US) isn't in country code list \"US\""));

  rule.set("locale_whitelist", strings({"US"}));
  EXPECT_EQ(stateFor({rule}), kBackendStateDisabled);
  EXPECT_TRUE(capture.contains(log::Level::Error, "HTTPSPostBackend(updateBackendState): filters are required."));

  rule.set("filters", Value(Array{Value("junk"), Value(5)}));
  EXPECT_EQ(stateFor({rule}), kBackendStateDisabled);  // no usable sampling threshold
  EXPECT_EQ(backend->numberOfFilters(), 2u);

  rule.set("sampling_threshold", Value("0.9"));  // text read as a number
  EXPECT_EQ(stateFor({rule}), kBackendStateEnabled);
  EXPECT_FALSE(backend->eventWhitelist().has_value());
  EXPECT_FALSE(backend->eventBlacklist().has_value());
  EXPECT_FALSE(backend->postURL().has_value());
  EXPECT_EQ(backend->eventThreshold(), HTTPSPostBackend::kDefaultEventThreshold);
  EXPECT_EQ(backend->extrasOnInternal(), 0);
  EXPECT_FALSE(backend->batchEvents());
  EXPECT_FALSE(backend->shouldUseWiFiOnly());
  EXPECT_FALSE(backend->uuidCustom().has_value());
  EXPECT_FALSE(capture.containsPrefix("HTTPSPostBackend(updateBackendState): Store bag override"));

  // Entries of the client list that are not rules apply to nobody.
  backend = makeBackend(Value(Dictionary{{"clients", Value(Array{Value("x"), Value(3)})}}));
  ASSERT_NE(backend, nullptr);
  backend->setUserInfoDict(userInfo("app", "svc"));
  EXPECT_EQ(backend->updateState(), kBackendStateDisabled);
}

TEST_F(HTTPSPostBackendStateTest, ProfileAndDefaultsOfTheWrongTypeCountAsAbsent) {
  settings->write(kBackendDefaultsDomain, kHttpsPostURLDefaultsKey, Value(17));
  settings->write(kBackendDefaultsDomain, kForceEventLoggingDefaultsKey, Value::array());
  Value profile(Dictionary{{"clients", Value(Array{Value(enablingRule())})}, {"display_url", Value(5)}});
  backend = makeBackend(profile);
  ASSERT_NE(backend, nullptr);
  EXPECT_FALSE(backend->displayURL().has_value());
  EXPECT_FALSE(backend->postURL().has_value());
  EXPECT_FALSE(backend->forceEventLogging());
  backend->setUserInfoDict(userInfo("app", "svc"));
  EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
  EXPECT_EQ(backend->postURL(), std::optional<std::string>("https://collector.test/batch"));
}

TEST_F(HTTPSPostBackendStateTest, UserInfoNamesOfTheWrongTypeCountAsAbsent) {
  backend = makeBackend(profileWithRules({with(enablingRule(), {{"client", Value("app")}})}));
  backend->setUserInfoDict(Value(Dictionary{{"_clientName", Value(5)}, {"_serviceName", Value::array()}}));
  EXPECT_EQ(backend->updateState(), kBackendStateDisabled);
}

}  // namespace
}  // namespace telvane
