#include "platform/SqliteSettingsStore.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <spawn.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cmath>
#include <cstdlib>
#include <filesystem>
#include <limits>
#include <map>
#include <thread>
#include <vector>

#include "platform/Log.h"
#include "platform/MemorySettingsStore.h"
#include "support/TempDir.h"

extern char** environ;

namespace telvane {
namespace {

// Sets (or unsets, for nullptr) an environment variable for the scope of a test and
// restores what was there before.
class ScopedEnvironment {
 public:
  ScopedEnvironment(const char* name, const char* value) : name_(name) {
    if (const char* old = std::getenv(name)) old_ = old;
    if (value) {
      setenv(name, value, 1);
    } else {
      unsetenv(name);
    }
  }
  ~ScopedEnvironment() {
    if (old_) {
      setenv(name_.c_str(), old_->c_str(), 1);
    } else {
      unsetenv(name_.c_str());
    }
  }

 private:
  std::string name_;
  std::optional<std::string> old_;
};

std::string toolPath() {
  if (const char* dir = std::getenv("TELVANE_TEST_BINARY_DIR")) return std::string(dir) + "/tools/telvane-defaults";
  // Run by hand: the tests live in <build>/tests, the tools in <build>/tools.
  return (std::filesystem::canonical("/proc/self/exe").parent_path().parent_path() / "tools/telvane-defaults")
      .string();
}

// Starts telvane-defaults with the database path in its environment; the caller waits.
pid_t startTool(const std::vector<std::string>& args, const std::string& database) {
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
  posix_spawn_file_actions_t actions;
  posix_spawn_file_actions_init(&actions);
  posix_spawn_file_actions_addopen(&actions, STDOUT_FILENO, "/dev/null", O_WRONLY, 0);
  pid_t pid = -1;
  if (posix_spawn(&pid, argv[0].c_str(), &actions, nullptr, argvPointers.data(), envPointers.data()) != 0) pid = -1;
  posix_spawn_file_actions_destroy(&actions);
  return pid;
}

int waitTool(pid_t pid) {
  int status = 0;
  if (pid < 0 || waitpid(pid, &status, 0) != pid) return -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

int runTool(const std::vector<std::string>& args, const std::string& database) {
  return waitTool(startTool(args, database));
}

class SqliteSettingsStoreTest : public ::testing::Test {
 protected:
  std::string databasePath() const { return (dir_ / "state/telvane/defaults.sqlite3").string(); }
  std::shared_ptr<SettingsStore> open() { return openSqliteSettingsStore(databasePath()); }

  test::TempDir dir_;
};

TEST_F(SqliteSettingsStoreTest, TypedValuesRoundTrip) {
  auto store = open();
  ASSERT_NE(store, nullptr);
  const std::pair<const char*, Value> values[] = {
      {"string", Value("hello, world")},
      {"unicode", Value("gr\xc3\xbc\xc3\x9f dich")},
      {"with-nul", Value(std::string("a\0b", 3))},
      {"number-text", Value("123")},
      {"int", Value(42)},
      {"int-min", Value(std::numeric_limits<long long>::min())},
      {"int-max", Value(std::numeric_limits<long long>::max())},
      {"uint-max", Value(std::numeric_limits<unsigned long long>::max())},
      {"double", Value(0.1)},
      {"double-large", Value(-1.5e300)},
      {"true", Value(true)},
      {"false", Value(false)},
      {"bytes", Value(Bytes{0, 1, 0, 255})},
      {"bytes-empty", Value(Bytes{})},
      {"date", Value::date(1'700'000'000.25)},
      {"null", Value()},
  };
  for (const auto& [key, value] : values) ASSERT_TRUE(store->write("com.example", key, value)) << key;
  // Read back through a second connection, so nothing comes from a cache.
  auto reopened = open();
  ASSERT_NE(reopened, nullptr);
  for (const auto& [key, value] : values) {
    SCOPED_TRACE(key);
    auto read = reopened->read("com.example", key);
    ASSERT_TRUE(read.has_value());
    EXPECT_EQ(read->type(), value.type());
    EXPECT_EQ(*read, value);
  }
}

TEST_F(SqliteSettingsStoreTest, ContainersRoundTrip) {
  auto store = open();
  ASSERT_NE(store, nullptr);
  Value dict = Value(Dictionary{{"name", Value("x")}, {"count", Value(3)}, {"list", Value(Array{Value(1), Value("two")})}});
  ASSERT_TRUE(store->write("d", "dict", dict));
  auto read = store->read("d", "dict");
  ASSERT_TRUE(read.has_value());
  EXPECT_EQ(*read, dict);
  EXPECT_FALSE(read->sharesContainerWith(dict));
}

TEST_F(SqliteSettingsStoreTest, NaNIsKept) {
  auto store = open();
  ASSERT_NE(store, nullptr);
  store->write("d", "nan", Value(std::nan("")));
  auto read = store->read("d", "nan");
  ASSERT_TRUE(read.has_value());
  EXPECT_TRUE(read->isDouble());
  EXPECT_TRUE(std::isnan(read->doubleValue()));
}

TEST_F(SqliteSettingsStoreTest, AbsentIsToldApartFromEmptyAndFalse) {
  auto store = open();
  ASSERT_NE(store, nullptr);
  EXPECT_FALSE(store->read("d", "missing").has_value());
  store->write("d", "empty", Value(""));
  store->write("d", "no", Value(false));
  store->write("d", "zero", Value(0));
  ASSERT_TRUE(store->read("d", "empty").has_value());
  EXPECT_EQ(*store->read("d", "empty"), Value(""));
  ASSERT_TRUE(store->read("d", "no").has_value());
  EXPECT_EQ(*store->read("d", "no"), Value(false));
  ASSERT_TRUE(store->read("d", "zero").has_value());
  EXPECT_FALSE(store->read("d", "missing").has_value());
  EXPECT_FALSE(store->read("other", "empty").has_value());
}

TEST_F(SqliteSettingsStoreTest, OverwriteReplacesValueAndType) {
  auto store = open();
  ASSERT_NE(store, nullptr);
  store->write("d", "k", Value("text"));
  store->write("d", "k", Value(7));
  EXPECT_EQ(*store->read("d", "k"), Value(7));
  EXPECT_TRUE(store->read("d", "k")->isInteger());
  EXPECT_EQ(store->readDomain("d").size(), 1u);
}

TEST_F(SqliteSettingsStoreTest, RemoveKeyAndDomain) {
  auto store = open();
  ASSERT_NE(store, nullptr);
  store->write("d", "a", Value(1));
  store->write("d", "b", Value(2));
  store->write("keep", "a", Value(3));
  EXPECT_TRUE(store->remove("d", "a"));
  EXPECT_FALSE(store->remove("d", "a"));
  EXPECT_FALSE(store->read("d", "a").has_value());
  EXPECT_TRUE(store->read("d", "b").has_value());
  EXPECT_TRUE(store->removeDomain("d"));
  EXPECT_FALSE(store->removeDomain("d"));
  EXPECT_FALSE(store->read("d", "b").has_value());
  EXPECT_TRUE(store->readDomain("d").empty());
  EXPECT_EQ(*store->read("keep", "a"), Value(3));
}

TEST_F(SqliteSettingsStoreTest, DomainsAreSeparateAndReadDomainIsSorted) {
  auto store = open();
  ASSERT_NE(store, nullptr);
  store->write("one", "k", Value("first"));
  store->write("two", "k", Value("second"));
  store->write("one", "b", Value(2));
  store->write("one", "A", Value(1));
  EXPECT_EQ(*store->read("one", "k"), Value("first"));
  EXPECT_EQ(*store->read("two", "k"), Value("second"));
  auto entries = store->readDomain("one");
  ASSERT_EQ(entries.size(), 3u);
  EXPECT_EQ(entries[0].first, "A");
  EXPECT_EQ(entries[1].first, "b");
  EXPECT_EQ(entries[2].first, "k");
  EXPECT_EQ(entries[2].second, Value("first"));
}

TEST_F(SqliteSettingsStoreTest, CreatesPrivateFolderAndFile) {
  auto store = open();
  ASSERT_NE(store, nullptr);
  struct stat st {};
  ASSERT_EQ(::stat((dir_ / "state/telvane").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u);
  ASSERT_EQ(::stat((dir_ / "state").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0700u);
  ASSERT_EQ(::stat(databasePath().c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
  ASSERT_TRUE(store->write("d", "k", Value(1)));
  ASSERT_EQ(::stat((databasePath() + "-wal").c_str(), &st), 0);
  EXPECT_EQ(st.st_mode & 0777, 0600u);
}

TEST_F(SqliteSettingsStoreTest, UnopenablePathGivesNullAndLogs) {
  test::writeFile(dir_ / "file", "not a folder");
  log::LogCapture capture;
  EXPECT_EQ(openSqliteSettingsStore((dir_ / "file/defaults.sqlite3").string()), nullptr);
  EXPECT_TRUE(capture.containsPrefix("settings store " + (dir_ / "file/defaults.sqlite3").string()));
  EXPECT_EQ(openSqliteSettingsStore(""), nullptr);
  // A file that is not a database.
  test::writeFile(dir_ / "junk.sqlite3", std::string(4096, 'x'));
  EXPECT_EQ(openSqliteSettingsStore((dir_ / "junk.sqlite3").string()), nullptr);
}

TEST(SqliteSettingsStorePathTest, EachEnvironmentVariableInItsTurn) {
  ScopedEnvironment home("HOME", "/home/someone");
  {
    ScopedEnvironment db("TELVANE_DEFAULTS_DB", "/tmp/explicit.db");
    ScopedEnvironment state("STATE_DIRECTORY", "/var/lib/telvaned");
    ScopedEnvironment xdg("XDG_STATE_HOME", "/xdg/state");
    EXPECT_EQ(defaultSettingsDatabasePath(), "/tmp/explicit.db");
  }
  {
    ScopedEnvironment db("TELVANE_DEFAULTS_DB", nullptr);
    ScopedEnvironment state("STATE_DIRECTORY", "/var/lib/telvaned");
    ScopedEnvironment xdg("XDG_STATE_HOME", "/xdg/state");
    EXPECT_EQ(defaultSettingsDatabasePath(), "/var/lib/telvaned/defaults.sqlite3");
  }
  {
    ScopedEnvironment db("TELVANE_DEFAULTS_DB", "");
    ScopedEnvironment state("STATE_DIRECTORY", "/var/lib/first:/var/lib/second");
    EXPECT_EQ(defaultSettingsDatabasePath(), "/var/lib/first/defaults.sqlite3");
  }
  {
    ScopedEnvironment db("TELVANE_DEFAULTS_DB", nullptr);
    ScopedEnvironment state("STATE_DIRECTORY", nullptr);
    ScopedEnvironment xdg("XDG_STATE_HOME", "/xdg/state");
    EXPECT_EQ(defaultSettingsDatabasePath(), "/xdg/state/telvane/defaults.sqlite3");
  }
  {
    ScopedEnvironment db("TELVANE_DEFAULTS_DB", nullptr);
    ScopedEnvironment state("STATE_DIRECTORY", nullptr);
    ScopedEnvironment xdg("XDG_STATE_HOME", nullptr);
    EXPECT_EQ(defaultSettingsDatabasePath(), "/home/someone/.local/state/telvane/defaults.sqlite3");
  }
  {
    ScopedEnvironment db("TELVANE_DEFAULTS_DB", nullptr);
    ScopedEnvironment state("STATE_DIRECTORY", "");
    ScopedEnvironment xdg("XDG_STATE_HOME", "relative/state");
    EXPECT_EQ(defaultSettingsDatabasePath(), "/home/someone/.local/state/telvane/defaults.sqlite3");
  }
}

TEST(SqliteSettingsStoreDefaultTest, OpenedOnceForAllThreads) {
  test::TempDir dir;
  ScopedEnvironment db("TELVANE_DEFAULTS_DB", (dir / "defaults.sqlite3").c_str());
  std::vector<std::shared_ptr<SettingsStore>> seen(8);
  std::vector<std::thread> threads;
  for (std::size_t i = 0; i < seen.size(); ++i) threads.emplace_back([&seen, i] { seen[i] = defaultSettingsStore(); });
  for (auto& thread : threads) thread.join();
  ASSERT_NE(seen[0], nullptr);
  for (const auto& store : seen) EXPECT_EQ(store.get(), seen[0].get());
  EXPECT_EQ(defaultSettingsStore().get(), seen[0].get());
}

TEST(SqliteSettingsStoreDefaultTest, FallsBackToMemoryWhenTheFileCannotBeOpened) {
  // In a fresh process, where the default store was not made yet.
  GTEST_FLAG_SET(death_test_style, "threadsafe");
  const std::string path = "/dev/null/telvane/defaults.sqlite3";
  EXPECT_EXIT(
      {
        setenv("TELVANE_DEFAULTS_DB", path.c_str(), 1);
        log::LogCapture capture;
        auto store = defaultSettingsStore();
        bool ok = dynamic_cast<MemorySettingsStore*>(store.get()) != nullptr && store->write("d", "k", Value(1)) &&
                  store->read("d", "k") == std::optional<Value>(Value(1)) &&
                  capture.contains(log::Level::Error, "settings store " + path +
                                                          " cannot be opened; settings are kept in memory by this "
                                                          "process only");
        std::_Exit(ok ? 0 : 1);
      },
      ::testing::ExitedWithCode(0), "");
}

TEST_F(SqliteSettingsStoreTest, WrittenByOneProcessReadByAnother) {
  auto store = open();
  ASSERT_NE(store, nullptr);
  // The tool writes, this process reads.
  ASSERT_EQ(runTool({"write", "com.example", "fromTool", "-string", "written elsewhere"}, databasePath()), 0);
  ASSERT_EQ(runTool({"write", "com.example", "count", "-int", "17"}, databasePath()), 0);
  auto read = store->read("com.example", "fromTool");
  ASSERT_TRUE(read.has_value());
  EXPECT_EQ(*read, Value("written elsewhere"));
  EXPECT_EQ(*store->read("com.example", "count"), Value(17));

  // This process writes and deletes, the tool reads.
  ASSERT_TRUE(store->write("com.example", "fromTest", Value(true)));
  EXPECT_EQ(runTool({"read", "com.example", "fromTest"}, databasePath()), 0);
  ASSERT_TRUE(store->remove("com.example", "fromTest"));
  EXPECT_EQ(runTool({"read", "com.example", "fromTest"}, databasePath()), 1);

  // The tool deletes, this process sees it gone.
  ASSERT_EQ(runTool({"delete", "com.example", "fromTool"}, databasePath()), 0);
  EXPECT_FALSE(store->read("com.example", "fromTool").has_value());
}

TEST_F(SqliteSettingsStoreTest, ConcurrentWritersFromThreadsAndProcesses) {
  auto store = open();
  ASSERT_NE(store, nullptr);
  auto second = open();  // a second connection in this process competes as well
  ASSERT_NE(second, nullptr);
  constexpr int kProcesses = 6;
  constexpr int kThreads = 6;
  constexpr int kKeysPerThread = 40;

  std::vector<pid_t> children;
  for (int p = 0; p < kProcesses; ++p) {
    children.push_back(startTool({"write", "shared", "proc" + std::to_string(p), "-int", std::to_string(p)},
                                 databasePath()));
  }
  std::vector<std::thread> threads;
  for (int t = 0; t < kThreads; ++t) {
    threads.emplace_back([&, t] {
      auto& target = (t % 2 == 0) ? store : second;
      for (int i = 0; i < kKeysPerThread; ++i) {
        std::string key = "t" + std::to_string(t) + "-" + std::to_string(i);
        EXPECT_TRUE(target->write("shared", key, Value(t * 1000 + i)));
        EXPECT_TRUE(target->read("shared", key).has_value());
      }
    });
  }
  for (auto& thread : threads) thread.join();
  for (pid_t child : children) EXPECT_EQ(waitTool(child), 0);

  auto entries = store->readDomain("shared");
  EXPECT_EQ(entries.size(), static_cast<std::size_t>(kProcesses + kThreads * kKeysPerThread));
  std::map<std::string, Value> byKey(entries.begin(), entries.end());
  for (int p = 0; p < kProcesses; ++p) EXPECT_EQ(byKey["proc" + std::to_string(p)], Value(p));
  EXPECT_EQ(byKey["t5-39"], Value(5039));
}

}  // namespace
}  // namespace telvane
