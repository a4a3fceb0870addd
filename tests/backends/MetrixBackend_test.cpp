#include "backends/telemetry/MetrixBackend.h"

#include <gtest/gtest.h>

#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <limits>
#include <set>
#include <sstream>
#include <thread>
#include <vector>

#include "backends/BackendTestSupport.h"
#include "support/DaemonProcess.h"
#include "support/TempDir.h"

namespace telvane {
namespace {

constexpr const char* kMissingAdaptor = "/nonexistent/telvane-test/metrix-adaptor.so";
// A library every test process has loaded, which defines no adaptor entry.
constexpr const char* kObjectWithoutEntry = "libz.so.1";
constexpr const char* kOutputEnv = "METRIX_ADAPTOR_OUTPUT";

std::string missingSelectorLine(const std::string& description) {
  return "MetrixBackend(sendMessage): Metrix adaptor " + description +
         " does not respond to forwarding selector sendMessageWithMethod:respCode:dict:";
}

// One line the example adaptor wrote.
struct AdaptorLine {
  unsigned method = 0;
  unsigned respCode = 0;
  std::string json;
};

std::vector<AdaptorLine> readAdaptorLines(const std::filesystem::path& path) {
  std::vector<AdaptorLine> lines;
  if (!std::filesystem::exists(path)) return lines;
  std::istringstream in(test::readFile(path));
  std::string text;
  while (std::getline(in, text)) {
    AdaptorLine line;
    std::istringstream fields(text);
    fields >> line.method >> line.respCode;
    fields.get();  // the blank before the JSON
    std::getline(fields, line.json);
    lines.push_back(std::move(line));
  }
  return lines;
}

class MetrixBackendTest : public test::BackendTestBase {
 protected:
  void TearDown() override { ::unsetenv(kOutputEnv); }

  BackendPlatform platformWithAdaptor(const std::string& path) {
    BackendPlatform withAdaptor = platform();
    withAdaptor.metrixAdaptorPath = path;
    return withAdaptor;
  }

  std::shared_ptr<MetrixBackend> make(std::int32_t clientType, const std::string& adaptorPath = kMissingAdaptor) {
    return MetrixBackend::create("metrix", Value(Dictionary{{"active", Value(true)}}), std::string("Laptop"),
                                 clientType, platformWithAdaptor(adaptorPath));
  }

  // The example adaptor, which appends what it receives to $METRIX_ADAPTOR_OUTPUT.
  static std::string exampleAdaptorPath() { return test::builtBinary("examples/metrix_adaptor_file.so"); }

  // Points the example adaptor at a file of the test's folder; false when the adaptor
  // is not built.
  bool useExampleAdaptorOutput() {
    if (!std::filesystem::exists(exampleAdaptorPath())) return false;
    ::setenv(kOutputEnv, output_.c_str(), 1);
    return true;
  }

  // The blob a session hands over: the client's payload and the shared data.
  static Value sessionBlob(Dictionary payload) {
    return Value(Dictionary{{"ClientData", Value(std::move(payload))},
                            {"SharedData", Value(Dictionary{{"callID", Value("C-7")}})}});
  }

  test::TempDir dir_;
  std::filesystem::path output_ = dir_ / "adaptor.out";
};

TEST_F(MetrixBackendTest, OnlyClientTypesSevenElevenAndThirteenAreAllowed) {
  std::set<std::int32_t> allowed;
  for (std::int32_t type = -2; type <= 40; ++type) {
    if (MetrixBackend::isClientTypeAllowed(type)) allowed.insert(type);
  }
  EXPECT_EQ(allowed, (std::set<std::int32_t>{7, 11, 13}));
  EXPECT_FALSE(MetrixBackend::isClientTypeAllowed(std::numeric_limits<std::int32_t>::min()));
  EXPECT_FALSE(MetrixBackend::isClientTypeAllowed(std::numeric_limits<std::int32_t>::max()));
}

TEST_F(MetrixBackendTest, ClientTypesSixEightTwelveAndFourteenGetNoBackend) {
  for (std::int32_t type : {6, 8, 12, 14}) {
    capture.clear();
    EXPECT_EQ(make(type), nullptr) << type;
    const std::string n = std::to_string(type);
    EXPECT_TRUE(capture.contains(log::Level::Info,
                                 "MetrixBackend(initWithName): Loading Metrix adaptor class for client type " + n));
    EXPECT_TRUE(capture.contains(log::Level::Error,
                                 "MetrixBackend(initWithName): No matching bundle found for client type " + n));
  }
}

TEST_F(MetrixBackendTest, ClientTypesSevenElevenAndThirteenGetABackend) {
  for (std::int32_t type : {7, 11, 13}) {
    capture.clear();
    auto backend = make(type);
    ASSERT_NE(backend, nullptr) << type;
    EXPECT_EQ(backend->kind(), BackendKind::Metrix);
    EXPECT_EQ(backend->clientType(), type);
    EXPECT_EQ(backend->name(), "metrix");
    EXPECT_EQ(backend->updateState(), kBackendStateEnabled);
    EXPECT_TRUE(capture.contains(log::Level::Info, "MetrixBackend(initWithName): Loading Metrix adaptor class for "
                                                   "client type " + std::to_string(type)));
    EXPECT_FALSE(capture.containsPrefix("MetrixBackend(initWithName): No matching bundle"));
  }
}

TEST_F(MetrixBackendTest, TheFormWithoutClientTypeNeverMakesABackend) {
  EXPECT_EQ(MetrixBackend::create("metrix", Value::dictionary(), std::string("Laptop"),
                                  platformWithAdaptor(exampleAdaptorPath())),
            nullptr);
  EXPECT_TRUE(capture.contains(log::Level::Info,
                               "MetrixBackend(initWithName): Loading Metrix adaptor class for client type 0"));
  EXPECT_TRUE(
      capture.contains(log::Level::Error, "MetrixBackend(initWithName): No matching bundle found for client type 0"));
}

TEST_F(MetrixBackendTest, AMissingAdaptorObjectTurnsEveryEventIntoAnErrorLine) {
  auto backend = make(7, kMissingAdaptor);
  ASSERT_NE(backend, nullptr) << "a missing object does not stop the backend";
  EXPECT_FALSE(backend->hasAdaptor());
  EXPECT_EQ(backend->adaptorDescription(), "(null)");
  EXPECT_FALSE(capture.containsPrefix("MetrixBackend(sendMessage)")) << "no error before the first event";
  for (std::uint16_t i = 1; i <= 3; ++i) {
    EXPECT_EQ(backend->sendMessage(test::BackendTestBase::blob({{"n", Value(i)}}), at(1'700'000'000), 12, i,
                                   kMessageFlagOrdinary),
              std::nullopt);
  }
  EXPECT_EQ(capture.count(missingSelectorLine("(null)")), 3u);
  EXPECT_TRUE(capture.contains(log::Level::Error, missingSelectorLine("(null)")));
  EXPECT_EQ(backend->eventID(), 3) << "the base still counts each event";
}

TEST_F(MetrixBackendTest, AnObjectWithoutTheForwardingEntryIsDescribedByItsPath) {
  auto library = MetrixAdaptorLibrary::loadIfNeeded(kObjectWithoutEntry);
  ASSERT_NE(library, nullptr);
  EXPECT_EQ(library->sendMessageEntry(), nullptr);

  auto backend = make(13, kObjectWithoutEntry);
  ASSERT_NE(backend, nullptr);
  EXPECT_FALSE(backend->hasAdaptor());
  EXPECT_EQ(backend->adaptorDescription(), kObjectWithoutEntry);
  backend->sendMessage(test::BackendTestBase::blob({{"k", Value(1)}}), at(1'700'000'000), 3, 4, kMessageFlagRealtime);
  EXPECT_TRUE(capture.contains(log::Level::Error, missingSelectorLine(kObjectWithoutEntry)));
}

TEST_F(MetrixBackendTest, AnObjectIsLoadedOncePerProcess) {
  auto first = MetrixAdaptorLibrary::loadIfNeeded(kObjectWithoutEntry);
  auto second = MetrixAdaptorLibrary::loadIfNeeded(kObjectWithoutEntry);
  ASSERT_NE(first, nullptr);
  EXPECT_EQ(first.get(), second.get());
  EXPECT_EQ(MetrixAdaptorLibrary::loadIfNeeded(kMissingAdaptor), nullptr);
}

TEST_F(MetrixBackendTest, TheAdaptorPathComesFromTheEnvironmentOrTheInstallation) {
  const char* saved = std::getenv("TELVANED_METRIX_ADAPTOR");
  std::optional<std::string> savedValue = saved ? std::optional<std::string>(saved) : std::nullopt;

  ::setenv("TELVANED_METRIX_ADAPTOR", "/opt/example/adaptor.so", 1);
  EXPECT_EQ(MetrixAdaptorLibrary::defaultPath(), "/opt/example/adaptor.so");
  EXPECT_EQ(platform().withSystemDefaults().metrixAdaptorPath, std::optional<std::string>("/opt/example/adaptor.so"));
  BackendPlatform chosen = platformWithAdaptor("/elsewhere/adaptor.so");
  EXPECT_EQ(chosen.withSystemDefaults().metrixAdaptorPath, std::optional<std::string>("/elsewhere/adaptor.so"));

  ::setenv("TELVANED_METRIX_ADAPTOR", "", 1);  // set but empty counts as unset
  EXPECT_EQ(MetrixAdaptorLibrary::defaultPath(), std::string(TELVANE_LIBDIR) + "/telvane/metrix-adaptor.so");
  ::unsetenv("TELVANED_METRIX_ADAPTOR");
  EXPECT_EQ(MetrixAdaptorLibrary::defaultPath(), std::string(TELVANE_LIBDIR) + "/telvane/metrix-adaptor.so");

  if (savedValue) ::setenv("TELVANED_METRIX_ADAPTOR", savedValue->c_str(), 1);
}

TEST_F(MetrixBackendTest, ForwardsMethodResponseCodeAndTheDictionaryOnly) {
  if (!useExampleAdaptorOutput()) GTEST_SKIP() << "example adaptor not built: " << exampleAdaptorPath();
  auto backend = make(7, exampleAdaptorPath());
  ASSERT_NE(backend, nullptr);
  EXPECT_TRUE(backend->hasAdaptor());
  EXPECT_EQ(backend->adaptorDescription(), exampleAdaptorPath());

  Value event = sessionBlob({{"codec", Value("opus")}, {"jitterMs", Value(12)}});
  EXPECT_EQ(backend->sendMessage(event, at(1'700'000'000, 5), 12, 3, kMessageFlagRealtime), std::nullopt);
  // The six-argument send directly, with an event id of its own.
  EXPECT_EQ(backend->sendMessage(event, at(1'700'000'001), 65535, 65534, std::uint16_t{777}, kMessageFlagPromote),
            std::nullopt);

  std::vector<AdaptorLine> lines = readAdaptorLines(output_);
  ASSERT_EQ(lines.size(), 2u);
  EXPECT_EQ(lines[0].method, 12u);
  EXPECT_EQ(lines[0].respCode, 3u);
  EXPECT_EQ(lines[0].json, R"({"ClientData":{"codec":"opus","jitterMs":12},"SharedData":{"callID":"C-7"}})");
  EXPECT_EQ(lines[1].method, 65535u);
  EXPECT_EQ(lines[1].respCode, 65534u);
  EXPECT_EQ(lines[1].json, lines[0].json) << "time stamp, event id and flag stay behind";
  EXPECT_FALSE(capture.containsPrefix("MetrixBackend(sendMessage)"));
  EXPECT_EQ(event, sessionBlob({{"codec", Value("opus")}, {"jitterMs", Value(12)}})) << "the event is not changed";
}

TEST_F(MetrixBackendTest, ValuesJsonCanCarryAreWrittenByTheJsonRules) {
  Value dictionary(Dictionary{
      {"ClientData", Value(Dictionary{{"blob", Value(Bytes{0x00, 0x01, 0xfe})},
                                      {"when", Value::date(1'700'000'000.5)},
                                      {"nested", Value(Dictionary{{"list", Value(Array{Value(1), Value("two")})}})},
                                      {"flag", Value(true)},
                                      {"none", Value()},
                                      {"big", Value(std::numeric_limits<std::uint64_t>::max())}})}});
  EXPECT_EQ(MetrixBackend::adaptorJsonForDictionary(dictionary),
            R"({"ClientData":{"big":18446744073709551615,"blob":"AAH+","flag":true,)"
            R"("nested":{"list":[1,"two"]},"none":null,"when":1700000000.5}})");
  EXPECT_TRUE(capture.lines().empty());
  EXPECT_EQ(MetrixBackend::adaptorJsonForDictionary(Value("not a map")), "{}");
  EXPECT_EQ(MetrixBackend::adaptorJsonForDictionary(Value()), "{}");
}

TEST_F(MetrixBackendTest, ValuesJsonCannotCarryAreLeftOutWithAnErrorLineEach) {
  const double nan = std::nan("");
  const double inf = std::numeric_limits<double>::infinity();
  Value deep(Dictionary{{"leaf", Value(1)}});
  for (int i = 0; i < json::kMaxNestingDepth + 10; ++i) deep = Value(Dictionary{{"d", deep}});
  Value dictionary(Dictionary{
      {"ClientData", Value(Dictionary{{"ratio", Value(nan)},
                                      {"samples", Value(Array{Value(1.5), Value(inf), Value(2)})},
                                      {"when", Value::date(nan)},
                                      {"name", Value(std::string("bad\xff\xfe"))},
                                      {std::string("key\xc3"), Value(1)},
                                      {"deep", deep},
                                      {"kept", Value("yes")}})}});
  std::string text = MetrixBackend::adaptorJsonForDictionary(dictionary);
  Result<Value> parsed = json::parse(text);
  ASSERT_TRUE(parsed.ok()) << parsed.error() << ": " << text.substr(0, 200);
  const Value& client = parsed.value()["ClientData"];
  ASSERT_TRUE(client.isDictionary());
  EXPECT_FALSE(client.asDictionary()->contains("ratio"));
  EXPECT_FALSE(client.asDictionary()->contains("when"));
  EXPECT_FALSE(client.asDictionary()->contains("name"));
  EXPECT_EQ(client["samples"], Value(Array{Value(1.5), Value(), Value(2)})) << "the element keeps its place as null";
  EXPECT_EQ(client["kept"], Value("yes"));
  EXPECT_TRUE(client["deep"].isDictionary()) << "only the part beyond the nesting limit goes";
  EXPECT_EQ(client.asDictionary()->size(), 3u) << "samples, deep and kept";

  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "MetrixBackend(sendMessage): JSON can't carry the value of ClientData.ratio; left out"));
  EXPECT_TRUE(capture.contains(
      log::Level::Error, "MetrixBackend(sendMessage): JSON can't carry the value of ClientData.samples[1]; left out"));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "MetrixBackend(sendMessage): JSON can't carry the value of ClientData.when; left out"));
  EXPECT_TRUE(capture.contains(log::Level::Error,
                               "MetrixBackend(sendMessage): JSON can't carry the value of ClientData.name; left out"));
  EXPECT_TRUE(capture.containsPrefix("MetrixBackend(sendMessage): JSON can't carry the key "));
  EXPECT_TRUE(capture.containsPrefix("MetrixBackend(sendMessage): JSON can't carry the value of ClientData.deep.d.d"));
}

TEST_F(MetrixBackendTest, BadValuesReachTheAdaptorAsWellFormedJson) {
  if (!useExampleAdaptorOutput()) GTEST_SKIP() << "example adaptor not built: " << exampleAdaptorPath();
  auto backend = make(11, exampleAdaptorPath());
  ASSERT_NE(backend, nullptr);
  backend->sendMessage(sessionBlob({{"nan", Value(std::nan(""))},
                                    {"bytes", Value(Bytes{'h', 'i'})},
                                    {"line\nbreak", Value("a\nb")},
                                    {"kept", Value(5)}}),
                       at(1'700'000'000), 40, 2, kMessageFlagOrdinary);
  std::vector<AdaptorLine> lines = readAdaptorLines(output_);
  ASSERT_EQ(lines.size(), 1u) << "a line break inside a value stays escaped in the JSON";
  Result<Value> parsed = json::parse(lines[0].json);
  ASSERT_TRUE(parsed.ok()) << parsed.error();
  EXPECT_EQ(parsed.value()["ClientData"],
            Value(Dictionary{{"bytes", Value("aGk=")}, {"kept", Value(5)}, {"line\nbreak", Value("a\nb")}}));
}

TEST_F(MetrixBackendTest, ManyThreadsSendToOneBackendWithoutAMissingEvent) {
  if (!useExampleAdaptorOutput()) GTEST_SKIP() << "example adaptor not built: " << exampleAdaptorPath();
  auto backend = make(7, exampleAdaptorPath());
  ASSERT_NE(backend, nullptr);
  constexpr int kThreads = 6;
  constexpr int kEventsPerThread = 150;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&backend, t] {
      for (int i = 0; i < kEventsPerThread; ++i) {
        Value event = test::BackendTestBase::blob({{"thread", Value(t)}, {"i", Value(i)}, {"pad", Value("xxxxxxxx")}});
        backend->sendMessage(event, TimeValue{1'700'000'000, 0}, static_cast<std::uint16_t>(100 + t),
                             static_cast<std::uint16_t>(i), kMessageFlagOrdinary);
      }
    });
  }
  for (auto& thread : threads) thread.join();

  EXPECT_EQ(backend->eventID(), kThreads * kEventsPerThread);
  std::vector<AdaptorLine> lines = readAdaptorLines(output_);
  ASSERT_EQ(lines.size(), static_cast<std::size_t>(kThreads * kEventsPerThread));
  std::set<std::pair<unsigned, unsigned>> seen;
  for (const AdaptorLine& line : lines) {
    Result<Value> parsed = json::parse(line.json);
    ASSERT_TRUE(parsed.ok()) << "interleaved or broken line: " << line.json;
    const Value& client = parsed.value()["ClientData"];
    EXPECT_EQ(client["thread"].integerValue() + 100, static_cast<std::int64_t>(line.method));
    EXPECT_EQ(client["i"].integerValue(), static_cast<std::int64_t>(line.respCode));
    seen.insert({line.method, line.respCode});
  }
  EXPECT_EQ(seen.size(), static_cast<std::size_t>(kThreads * kEventsPerThread)) << "every event exactly once";
}

TEST_F(MetrixBackendTest, ManyThreadsSendingToAMissingAdaptorEachGetTheirErrorLine) {
  auto backend = make(13, kMissingAdaptor);
  ASSERT_NE(backend, nullptr);
  constexpr int kThreads = 4;
  constexpr int kEventsPerThread = 100;
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&backend] {
      for (int i = 0; i < kEventsPerThread; ++i) {
        backend->sendMessage(test::BackendTestBase::blob({{"i", Value(i)}}), TimeValue{}, 1, 2, kMessageFlagOrdinary);
      }
    });
  }
  for (auto& thread : threads) thread.join();
  EXPECT_EQ(capture.count(missingSelectorLine("(null)")), static_cast<std::size_t>(kThreads * kEventsPerThread));
  EXPECT_EQ(backend->eventID(), kThreads * kEventsPerThread);
}

}  // namespace
}  // namespace telvane
