// The telvane-defaults command line, run as a real process against a temporary
// database.
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <string>
#include <vector>

#include "platform/SettingsStore.h"
#include "support/TempDir.h"

extern char** environ;

namespace telvane {
namespace {

struct ToolRun {
  int exitCode = -1;
  std::string out;
  std::string err;
};

std::string toolPath() {
  if (const char* dir = std::getenv("TELVANE_TEST_BINARY_DIR")) return std::string(dir) + "/tools/telvane-defaults";
  // Run by hand: the tests live in <build>/tests, the tools in <build>/tools.
  return (std::filesystem::canonical("/proc/self/exe").parent_path().parent_path() / "tools/telvane-defaults")
      .string();
}

// Runs the tool to its end, collecting both output streams.
ToolRun runTool(const std::vector<std::string>& args, const std::string& database) {
  ToolRun run;
  std::vector<std::string> env;
  for (char** e = environ; *e; ++e) {
    if (std::string_view(*e).rfind("TELVANE_DEFAULTS_DB=", 0) != 0) env.emplace_back(*e);
  }
  env.push_back("TELVANE_DEFAULTS_DB=" + database);
  std::vector<std::string> argv = {toolPath()};
  argv.insert(argv.end(), args.begin(), args.end());
  std::vector<char*> argvPointers, envPointers;
  for (auto& a : argv) argvPointers.push_back(a.data());
  argvPointers.push_back(nullptr);
  for (auto& e : env) envPointers.push_back(e.data());
  envPointers.push_back(nullptr);

  int outPipe[2], errPipe[2];
  if (pipe2(outPipe, O_CLOEXEC) != 0) return run;
  if (pipe2(errPipe, O_CLOEXEC) != 0) {
    close(outPipe[0]);
    close(outPipe[1]);
    return run;
  }
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_adddup2(&actions, outPipe[1], STDOUT_FILENO);
  posix_spawn_file_actions_adddup2(&actions, errPipe[1], STDERR_FILENO);
  pid_t pid = -1;
  int rc = posix_spawn(&pid, argv[0].c_str(), &actions, nullptr, argvPointers.data(), envPointers.data());
  posix_spawn_file_actions_destroy(&actions);
  close(outPipe[1]);
  close(errPipe[1]);
  if (rc == 0) {
    pollfd fds[2] = {{outPipe[0], POLLIN, 0}, {errPipe[0], POLLIN, 0}};
    std::string* sinks[2] = {&run.out, &run.err};
    int open = 2;
    while (open > 0) {
      if (poll(fds, 2, -1) < 0) break;
      for (int i = 0; i < 2; ++i) {
        if (fds[i].fd < 0 || fds[i].revents == 0) continue;
        char buf[4096];
        ssize_t n = read(fds[i].fd, buf, sizeof buf);
        if (n > 0) {
          sinks[i]->append(buf, static_cast<std::size_t>(n));
        } else {
          fds[i].fd = -1;
          --open;
        }
      }
    }
    int status = 0;
    if (waitpid(pid, &status, 0) == pid && WIFEXITED(status)) run.exitCode = WEXITSTATUS(status);
  }
  close(outPipe[0]);
  close(errPipe[0]);
  return run;
}

class TelvaneDefaultsToolTest : public ::testing::Test {
 protected:
  ToolRun run(const std::vector<std::string>& args) { return runTool(args, database_); }

  test::TempDir dir_;
  std::string database_ = (dir_ / "defaults.sqlite3").string();
};

TEST_F(TelvaneDefaultsToolTest, WriteThenReadEachType) {
  EXPECT_EQ(run({"write", "com.example", "name", "-string", "hello world"}).exitCode, 0);
  EXPECT_EQ(run({"write", "com.example", "count", "-int", "-42"}).exitCode, 0);
  EXPECT_EQ(run({"write", "com.example", "plus", "-int", "+5"}).exitCode, 0);
  EXPECT_EQ(run({"write", "com.example", "ratio", "-float", "0.1"}).exitCode, 0);
  EXPECT_EQ(run({"write", "com.example", "big", "-float", "1e3"}).exitCode, 0);
  EXPECT_EQ(run({"write", "com.example", "on", "-bool", "YES"}).exitCode, 0);
  EXPECT_EQ(run({"write", "com.example", "off", "-bool", "false"}).exitCode, 0);

  ToolRun r = run({"read", "com.example", "name"});
  EXPECT_EQ(r.exitCode, 0);
  EXPECT_EQ(r.out, "hello world\n");
  EXPECT_EQ(r.err, "");
  EXPECT_EQ(run({"read", "com.example", "count"}).out, "-42\n");
  EXPECT_EQ(run({"read", "com.example", "plus"}).out, "5\n");
  EXPECT_EQ(run({"read", "com.example", "ratio"}).out, "0.1\n");
  EXPECT_EQ(run({"read", "com.example", "big"}).out, "1000\n");
  EXPECT_EQ(run({"read", "com.example", "on"}).out, "1\n");
  EXPECT_EQ(run({"read", "com.example", "off"}).out, "0\n");

  // The types are the real ones, not text.
  auto store = openSqliteSettingsStore(database_);
  ASSERT_NE(store, nullptr);
  EXPECT_EQ(*store->read("com.example", "count"), Value(-42));
  EXPECT_EQ(*store->read("com.example", "ratio"), Value(0.1));
  EXPECT_EQ(*store->read("com.example", "on"), Value(true));
  EXPECT_EQ(*store->read("com.example", "name"), Value("hello world"));
}

TEST_F(TelvaneDefaultsToolTest, BoolAcceptsTheUsualWordsInAnyCase) {
  const std::pair<const char*, const char*> cases[] = {{"YES", "1"}, {"yes", "1"}, {"True", "1"}, {"1", "1"},
                                                       {"NO", "0"},  {"no", "0"},  {"FALSE", "0"}, {"0", "0"}};
  for (const auto& [text, printed] : cases) {
    SCOPED_TRACE(text);
    EXPECT_EQ(run({"write", "d", "flag", "-bool", text}).exitCode, 0);
    EXPECT_EQ(run({"read", "d", "flag"}).out, std::string(printed) + "\n");
  }
}

TEST_F(TelvaneDefaultsToolTest, BadValuesAreRefusedAndNothingIsWritten) {
  const std::vector<std::vector<std::string>> bad = {
      {"-int", "4.5"},    {"-int", "abc"},    {"-int", ""},      {"-int", "12abc"},
      {"-int", "99999999999999999999"},       {"-bool", "maybe"}, {"-bool", "2"},
      {"-bool", ""},      {"-bool", "yess"},  {"-float", "abc"}, {"-float", ""},
      {"-float", "1.5x"}, {"-float", "nan"},  {"-float", "1e999"},
  };
  for (const auto& typeAndValue : bad) {
    SCOPED_TRACE(typeAndValue[0] + " '" + typeAndValue[1] + "'");
    ToolRun r = run({"write", "d", "k", typeAndValue[0], typeAndValue[1]});
    EXPECT_EQ(r.exitCode, 2);
    EXPECT_EQ(r.err, "telvane-defaults: " + typeAndValue[0] + " takes " +
                         (typeAndValue[0] == "-int"    ? std::string("an integer")
                          : typeAndValue[0] == "-bool" ? std::string("YES, NO, true, false, 1 or 0")
                                                       : std::string("a number")) +
                         ", not '" + typeAndValue[1] + "'\n");
    EXPECT_EQ(run({"read", "d", "k"}).exitCode, 1);
  }
}

TEST_F(TelvaneDefaultsToolTest, ReadOfAbsentKeyFails) {
  ToolRun r = run({"read", "com.example", "missing"});
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_EQ(r.out, "");
  EXPECT_EQ(r.err, "The domain/default pair of (com.example, missing) does not exist\n");
}

TEST_F(TelvaneDefaultsToolTest, ReadOfDomainListsEveryKeySorted) {
  run({"write", "com.example", "zeta", "-string", "last"});
  run({"write", "com.example", "alpha", "-int", "1"});
  run({"write", "com.example", "mid", "-bool", "yes"});
  run({"write", "com.other", "beta", "-int", "2"});
  ToolRun r = run({"read", "com.example"});
  EXPECT_EQ(r.exitCode, 0);
  EXPECT_EQ(r.out, "alpha = 1\nmid = 1\nzeta = last\n");

  r = run({"read", "com.empty"});
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_EQ(r.out, "");
  EXPECT_EQ(r.err, "Domain com.empty does not exist\n");
}

TEST_F(TelvaneDefaultsToolTest, ValuesWrittenBySystemCodeAreDescribed) {
  auto store = openSqliteSettingsStore(database_);
  ASSERT_NE(store, nullptr);
  store->write("sys", "data", Value(Bytes{0xde, 0xad}));
  store->write("sys", "when", Value::date(0));
  store->write("sys", "dict", Value(Dictionary{{"a", Value(1)}}));
  EXPECT_EQ(run({"read", "sys", "data"}).out, "<dead>\n");
  EXPECT_EQ(run({"read", "sys", "when"}).out, "1970-01-01 00:00:00 +0000\n");
  EXPECT_EQ(run({"read", "sys", "dict"}).out, "{\"a\": 1}\n");
}

TEST_F(TelvaneDefaultsToolTest, DeleteKeyAndDomain) {
  run({"write", "d", "a", "-int", "1"});
  run({"write", "d", "b", "-int", "2"});
  ToolRun r = run({"delete", "d", "a"});
  EXPECT_EQ(r.exitCode, 0);
  EXPECT_EQ(r.err, "");
  EXPECT_EQ(run({"read", "d", "a"}).exitCode, 1);
  EXPECT_EQ(run({"read", "d", "b"}).exitCode, 0);

  r = run({"delete", "d", "a"});
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_EQ(r.err, "The domain/default pair of (d, a) does not exist\n");

  EXPECT_EQ(run({"delete", "d"}).exitCode, 0);
  EXPECT_EQ(run({"read", "d", "b"}).exitCode, 1);
  r = run({"delete", "d"});
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_EQ(r.err, "Domain d does not exist\n");
}

TEST_F(TelvaneDefaultsToolTest, UsageErrorsExitWithTwo) {
  const std::vector<std::vector<std::string>> commands = {
      {},
      {"read"},
      {"read", "d", "k", "extra"},
      {"write", "d", "k", "-string"},
      {"write", "d", "k", "-string", "v", "extra"},
      {"write", "d", "k", "-date", "v"},
      {"delete"},
      {"delete", "d", "k", "extra"},
      {"frobnicate", "d"},
  };
  for (const auto& args : commands) {
    std::string joined;
    for (const auto& a : args) joined += a + " ";
    SCOPED_TRACE(joined);
    ToolRun r = run(args);
    EXPECT_EQ(r.exitCode, 2);
    EXPECT_EQ(r.out, "");
    EXPECT_NE(r.err.find("usage: telvane-defaults read DOMAIN [KEY]\n"), std::string::npos) << r.err;
  }
  // Nothing was written by any of them.
  EXPECT_EQ(run({"read", "d"}).exitCode, 1);
}

TEST_F(TelvaneDefaultsToolTest, UnusableDatabaseFails) {
  test::writeFile(dir_ / "file", "not a folder");
  ToolRun r = runTool({"write", "d", "k", "-int", "1"}, (dir_ / "file/defaults.sqlite3").string());
  EXPECT_EQ(r.exitCode, 1);
  EXPECT_NE(r.err.find("telvane-defaults: cannot open the settings database " +
                       (dir_ / "file/defaults.sqlite3").string() + "\n"),
            std::string::npos)
      << r.err;
}

}  // namespace
}  // namespace telvane
