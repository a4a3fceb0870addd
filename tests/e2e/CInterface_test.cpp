// The C interface end to end: the C program tests/capi/telvane_c_test.c (built as C,
// against telvane/telvane.h and the shared library only) reports through the real
// daemon under a signed storebag with an HTTPS post backend and an upload server on
// loopback, and the example wireless-diagnostics adaptor (which receives every event
// dictionary whole, nested values included); the events it sends (batched, realtime
// and from its periodic tasks), the shared data and user information they carry and
// the file it uploads arrive as sent. The program checks every result of the
// interface itself; its exit status says whether all held.
#include <gtest/gtest.h>

#include <algorithm>
#include <filesystem>
#include <sstream>

#include "e2e/StorebagDaemonTest.h"
#include "platform/Json.h"
#include "support/Gunzip.h"
#include "support/TempDir.h"
#include "support/ToolRunner.h"
#include "support/WaitUntil.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;
namespace fs = std::filesystem;

namespace {

constexpr const char* kClient = "com.example.conference";
constexpr auto kArrivalTimeout = 30s;
const Value kSharedData(Dictionary{{"callID", Value("C-2041")}, {"room", Value("Blue")}});

class CInterface : public StorebagDaemonTest {
 protected:
  void SetUp() override {
    StorebagDaemonTest::SetUp();
    answerPath("/post", "{}");
    answerPath("/rt", "{}");
    answerPath("/upload", "success");
  }

  void startDaemon() {
    StorebagBuilder builder;
    builder.version("c-interface-1");
    for (const char* section : {"zembra_internal", "development", "seed", "release"}) {
      Value rule(Dictionary{{"client", Value(kClient)},
                            {"service", Value("calls")},
                            {"override_dnu", Value(1)},
                            {"locale_whitelist", Value(Array{Value("US")})},
                            {"filters", Value::array()},
                            {"sampling_threshold", Value(1)},
                            {"post_url", Value(server_.url("/post"))},
                            {"realtime_post_url", Value(server_.url("/rt"))}});
      builder.backend(section, "brindle",
                      Value(Dictionary{{"display_url", Value(server_.url("/post"))}, {"clients", Value(Array{rule})}}));
      builder.backend(section, "upload_server",
                      Value(Dictionary{{"post_url", Value(server_.url("/upload"))}, {"display_url", Value("uploads.test")}}));
      builder.backend(section, "metrix", Value(Dictionary{{"active", Value(true)}}));
    }
    DaemonOptions options;
    // A country the rule lists.
    options.environment["LC_ALL"] = "en_US.UTF-8";
    options.environment["TELVANED_METRIX_ADAPTOR"] = builtBinary("examples/metrix_adaptor_file.so");
    options.environment["METRIX_ADAPTOR_OUTPUT"] = adaptorOutput_.string();
    startDaemonWith(builder, options);
  }

  // The event dictionary the adaptor received for the category and type: the lines it
  // writes are "<category> <type> <JSON>".
  std::optional<Value> waitForAdaptorEvent(unsigned category, unsigned type) const {
    std::optional<Value> found;
    waitUntil(
        [&] {
          if (!fs::exists(adaptorOutput_)) return false;
          std::istringstream in(readFile(adaptorOutput_));
          std::string line;
          while (std::getline(in, line)) {
            std::istringstream fields(line);
            unsigned lineCategory = 0, lineType = 0;
            fields >> lineCategory >> lineType;
            fields.get();
            std::string text;
            std::getline(fields, text);
            Result<Value> event = json::parse(text);
            if (lineCategory == category && lineType == type && event) {
              found = *event;
              return true;
            }
          }
          return false;
        },
        kArrivalTimeout);
    return found;
  }

  ToolRun runProgram(const std::vector<std::string>& arguments, const std::string& socketPath) {
    return runTool(builtBinary("tests/telvane_c_test"), arguments, {"TELVANED_SOCKET=" + socketPath});
  }

  // Every event record posted to the path, in arrival order.
  std::vector<Value> records(const std::string& path) const {
    std::vector<Value> out;
    for (const ReceivedRequest& request : server_.requestsForPath(path)) {
      std::string body = request.body;
      // The test server may have inflated the body already.
      if (std::optional<std::string> inflated = gunzip(body)) body = std::move(*inflated);
      Result<Value> document = json::parse(body);
      if (!document) continue;
      if (const Array* events = (*document)["events"].asArray()) out.insert(out.end(), events->begin(), events->end());
    }
    return out;
  }

  std::optional<Value> waitForRecord(const std::string& path, std::int64_t category, std::int64_t type) const {
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
        kArrivalTimeout);
    return found;
  }

  fs::path adaptorOutput_ = dir_.path() / "adaptor.out";
};

TEST_F(CInterface, TheCProgramsEventsSharedDataPeriodicStatisticsAndUploadArrive) {
  startDaemon();
  TempDir files;
  const fs::path upload = files.path() / "call 9.log";
  const std::string contents = "12:00:01 call started on Gadget1\n12:03:30 call ended\n";
  writeFile(upload, contents);

  ToolRun run = runProgram({"report", upload.string()}, daemon_->socketPath());
  ASSERT_EQ(run.exitCode, 0) << run.out << run.err << daemon_->log();
  EXPECT_NE(run.out.find("all checks passed\n"), std::string::npos) << run.out;
  EXPECT_EQ(run.out.find("FAILED"), std::string::npos) << run.out;

  // The batched event, with the session's user information and shared data.
  std::optional<Value> batched = waitForRecord("/post", 12, 1);
  ASSERT_TRUE(batched) << run.out << daemon_->log();
  EXPECT_EQ((*batched)["codec"].stringOrEmpty(), "opus");
  EXPECT_EQ((*batched)["jitterMs"].doubleValue(), 12.5);
  EXPECT_EQ((*batched)["callID"].stringOrEmpty(), "C-2041");
  EXPECT_EQ((*batched)["room"].stringOrEmpty(), "Blue");
  EXPECT_EQ((*batched)["tier"].stringOrEmpty(), "gold");
  EXPECT_EQ((*batched)["_clientName"].stringOrEmpty(), kClient);
  EXPECT_EQ((*batched)["_serviceName"].stringOrEmpty(), "calls");
  EXPECT_EQ((*batched)["_clientVersion"].integerValue(), 5);

  std::optional<Value> last = waitForRecord("/post", 12, 3);
  ASSERT_TRUE(last) << daemon_->log();
  EXPECT_EQ((*last)["step"].stringOrEmpty(), "last");

  // The realtime event of the event map.
  std::optional<Value> realtime = waitForRecord("/rt", 12, 2);
  ASSERT_TRUE(realtime) << daemon_->log();
  EXPECT_EQ((*realtime)["reason"].stringOrEmpty(), "lost");

  // The periodic report: both modules' statistics merged into one realtime event, their
  // "samples" arrays joined in the order their services finished, "device" from the
  // later one. The adaptor gets the dictionary whole; the post carries its scalars.
  std::optional<Value> periodic = waitForAdaptorEvent(14, 3);
  ASSERT_TRUE(periodic) << daemon_->log();
  const Value& statistics = (*periodic)["ClientData"];
  const Array* samples = statistics["samples"].asArray();
  ASSERT_TRUE(samples) << periodic->description();
  std::vector<std::int64_t> numbers;
  for (const Value& sample : *samples) numbers.push_back(sample.integerValue());
  std::sort(numbers.begin(), numbers.end());
  EXPECT_EQ(numbers, (std::vector<std::int64_t>{1, 2, 3})) << periodic->description();
  const std::string device = statistics["device"].stringOrEmpty();
  EXPECT_TRUE(device == "Gadget1" || device == "Gadget2") << device;
  Dictionary scalars = *statistics.asDictionary();
  scalars.erase("samples");
  scalars.erase("device");
  EXPECT_EQ(Value(scalars), Value(Dictionary{{"charging", Value(true)}, {"load", Value(0.25)}, {"rxKbps", Value(512)}}))
      << "refused statistics stay out: " << periodic->description();
  EXPECT_EQ((*periodic)["SharedData"], kSharedData);
  std::optional<Value> posted = waitForRecord("/rt", 14, 3);
  ASSERT_TRUE(posted) << daemon_->log();
  EXPECT_EQ((*posted)["rxKbps"].integerValue(), 512);
  EXPECT_EQ((*posted)["load"].doubleValue(), 0.25);

  // Every event dictionary exactly as the program gave it.
  std::optional<Value> first = waitForAdaptorEvent(12, 1);
  ASSERT_TRUE(first);
  EXPECT_EQ((*first)["ClientData"], Value(Dictionary{{"codec", Value("opus")}, {"jitterMs", Value(12.5)}}));
  EXPECT_EQ((*first)["SharedData"], kSharedData);
  std::optional<Value> lost = waitForAdaptorEvent(12, 2);
  ASSERT_TRUE(lost);
  EXPECT_EQ((*lost)["ClientData"], Value(Dictionary{{"reason", Value("lost")}}));

  // The refused events never left the program.
  for (const std::string path : {"/post", "/rt"}) {
    for (const Value& record : records(path)) {
      const std::int64_t category = record["_method"].integerValue();
      if (category == 12 || category == 14) {
        const std::int64_t type = record["_status"].integerValue();
        EXPECT_TRUE((category == 12 && type >= 1 && type <= 3) || (category == 14 && type == 3))
            << record.description();
      }
    }
  }
  std::size_t batchedCount = 0;
  for (const Value& record : records("/post")) {
    if (record["_method"].integerValue() == 12 && record["_status"].integerValue() == 1) ++batchedCount;
  }
  EXPECT_EQ(batchedCount, 1u) << "only one of the 12/1 attempts was valid";

  // The upload: the file's bytes, named in the query; the file is gone.
  auto uploads = server_.requestsForPath("/upload");
  ASSERT_EQ(uploads.size(), 1u);
  EXPECT_NE(uploads[0].query.find("filename=call%209.log.gz"), std::string::npos) << uploads[0].query;
  EXPECT_NE(uploads[0].query.find("sequence=4242"), std::string::npos) << uploads[0].query;
  EXPECT_EQ(gunzip(uploads[0].body).value_or(uploads[0].body), contents);
  EXPECT_FALSE(fs::exists(upload));
}

TEST_F(CInterface, WithoutADaemonNoSessionIsMadeAndTheErrorSaysSo) {
  ToolRun run = runProgram({"no-daemon"}, (dir_.path() / "nobody-listens.sock").string());
  EXPECT_EQ(run.exitCode, 0) << run.out << run.err;
  EXPECT_NE(run.out.find("ok: no daemon: error 2 in TelvaneInterfaceErrorDomain: "), std::string::npos) << run.out;
  EXPECT_NE(run.out.find("all checks passed\n"), std::string::npos) << run.out;
}

}  // namespace
