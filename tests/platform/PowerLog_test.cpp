#include "platform/PowerLog.h"

#include <gtest/gtest.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cmath>
#include <cstdio>
#include <filesystem>
#include <sstream>
#include <string>
#include <vector>

#include "platform/Json.h"
#include "platform/Random.h"
#include "support/WaitUntil.h"

namespace telvane {
namespace {

constexpr const char* kJournalSocket = "/run/systemd/journal/socket";

// The standard output of a shell command and its exit status.
struct CommandOutput {
  int status = -1;
  std::string text;
};

CommandOutput run(const std::string& command) {
  CommandOutput output;
  FILE* pipe = ::popen(command.c_str(), "r");
  if (!pipe) return output;
  char buffer[4096];
  std::size_t n;
  while ((n = std::fread(buffer, 1, sizeof buffer, pipe)) > 0) output.text.append(buffer, n);
  int status = ::pclose(pipe);
  output.status = WIFEXITED(status) ? WEXITSTATUS(status) : -1;
  return output;
}

bool journalRuns() {
  if (!std::filesystem::exists(kJournalSocket)) return false;
  return run("journalctl -n 0 --output=json >/dev/null 2>&1").status == 0;
}

TEST(JournalPowerLog, KeysMapToJournalFieldNames) {
  EXPECT_EQ(JournalPowerLog::fieldNameForKey("jitterMs"), "TELVANE_EVENT_JITTERMS");
  EXPECT_EQ(JournalPowerLog::fieldNameForKey("respCode"), "TELVANE_EVENT_RESPCODE");
  EXPECT_EQ(JournalPowerLog::fieldNameForKey("a-b.c d"), "TELVANE_EVENT_A_B_C_D");
  EXPECT_EQ(JournalPowerLog::fieldNameForKey("_private"), "TELVANE_EVENT__PRIVATE");
  EXPECT_EQ(JournalPowerLog::fieldNameForKey("9lives"), "TELVANE_EVENT_9LIVES");
  EXPECT_EQ(JournalPowerLog::fieldNameForKey("caf\xc3\xa9"), "TELVANE_EVENT_CAF__");
  EXPECT_EQ(JournalPowerLog::fieldNameForKey(""), "TELVANE_EVENT_");
  std::string longName = JournalPowerLog::fieldNameForKey(std::string(100, 'k'));
  EXPECT_EQ(longName.size(), JournalPowerLog::kMaxFieldNameLength);
  EXPECT_EQ(longName, "TELVANE_EVENT_" + std::string(64 - 14, 'K'));
}

TEST(JournalPowerLog, OneEntryCarriesCategoryNameTheDictionaryAndAFieldPerKey) {
  Value dictionary(Dictionary{{"codec", Value("opus")},
                              {"event", Value(41u)},
                              {"ratio", Value(0.25)},
                              {"ok", Value(true)},
                              {"raw", Value(Bytes{'h', 'i'})},
                              {"when", Value::date(1'700'000'000.5)},
                              {"nested", Value(Dictionary{{"a", Value(1)}})},
                              {"text", Value("two\nlines")}});
  std::vector<std::string> fields = JournalPowerLog::entryFields(28, "Vistacore-TVX", dictionary);
  std::vector<std::string> expected = {
      "MESSAGE=power log event Vistacore-TVX (category 28)",
      "PRIORITY=6",
      "TELVANE_POWERLOG_CATEGORY=28",
      "TELVANE_POWERLOG_EVENT=Vistacore-TVX",
      R"(TELVANE_POWERLOG_DICTIONARY={"codec":"opus","event":41,"nested":{"a":1},"ok":true,"ratio":0.25,)"
      R"("raw":"aGk=","text":"two\nlines","when":1700000000.5})",
      "TELVANE_EVENT_CODEC=opus",
      "TELVANE_EVENT_EVENT=41",
      "TELVANE_EVENT_NESTED={\"a\":1}",
      "TELVANE_EVENT_OK=true",
      "TELVANE_EVENT_RATIO=0.25",
      "TELVANE_EVENT_RAW=aGk=",
      "TELVANE_EVENT_TEXT=two\nlines",
      "TELVANE_EVENT_WHEN=1700000000.5",
  };
  EXPECT_EQ(fields, expected);
}

TEST(JournalPowerLog, ValuesJsonCannotCarryKeepTheirOwnFieldOnly) {
  Value dictionary(Dictionary{{"nan", Value(std::nan(""))}, {"kept", Value(1)}});
  std::vector<std::string> fields = JournalPowerLog::entryFields(28, "Vistacore-TVX", dictionary);
  ASSERT_EQ(fields.size(), 7u);
  EXPECT_EQ(fields[4], R"(TELVANE_POWERLOG_DICTIONARY={"kept":1})");
  EXPECT_EQ(fields[5], "TELVANE_EVENT_KEPT=1");
  EXPECT_EQ(fields[6], "TELVANE_EVENT_NAN=" + Value(std::nan("")).description());
  // Anything but a dictionary gives an entry with an empty object.
  std::vector<std::string> none = JournalPowerLog::entryFields(28, "Vistacore-TVX", Value("text"));
  ASSERT_EQ(none.size(), 5u);
  EXPECT_EQ(none[4], "TELVANE_POWERLOG_DICTIONARY={}");
}

TEST(JournalPowerLog, WritesOneEntryTheJournalReadsBack) {
  if (!journalRuns()) GTEST_SKIP() << "no journal on this machine (" << kJournalSocket << " or journalctl missing)";
  const std::string marker = Random::system()->uuidString();
  Value dictionary(Dictionary{{"marker", Value(marker)}, {"method", Value(12u)}, {"codec", Value("opus")}});
  ASSERT_TRUE(PowerLog::journal()->recordRegisteredEvent(28, "Vistacore-TVX", dictionary));

  Value entry;
  const std::string command = "journalctl --output=json --no-pager TELVANE_EVENT_MARKER=" + marker + " 2>/dev/null";
  ASSERT_TRUE(test::waitUntil(
      [&] {
        CommandOutput output = run(command);
        std::istringstream lines(output.text);
        std::string line;
        while (std::getline(lines, line)) {
          Result<Value> parsed = json::parse(line);
          if (parsed.ok() && parsed.value().isDictionary()) entry = parsed.value();
        }
        return entry.isDictionary();
      },
      std::chrono::seconds(10)))
      << "the entry did not show up in the journal";
  EXPECT_EQ(entry["MESSAGE"], Value("power log event Vistacore-TVX (category 28)"));
  EXPECT_EQ(entry["PRIORITY"], Value("6"));
  EXPECT_EQ(entry["TELVANE_POWERLOG_CATEGORY"], Value("28"));
  EXPECT_EQ(entry["TELVANE_POWERLOG_EVENT"], Value("Vistacore-TVX"));
  EXPECT_EQ(entry["TELVANE_EVENT_MARKER"], Value(marker));
  EXPECT_EQ(entry["TELVANE_EVENT_METHOD"], Value("12"));
  EXPECT_EQ(entry["TELVANE_EVENT_CODEC"], Value("opus"));
  Result<Value> stored = json::parse(entry["TELVANE_POWERLOG_DICTIONARY"].stringOrEmpty());
  ASSERT_TRUE(stored.ok()) << stored.error();
  EXPECT_EQ(stored.value(), Value(Dictionary{{"codec", Value("opus")}, {"marker", Value(marker)}, {"method", Value(12)}}));
}

}  // namespace
}  // namespace telvane
