// DevServerProcess: runs the built `telvane-devserver` for end-to-end tests, on ports
// the system picks, with its state folder, events file and ready file under a test's
// temporary folder, and reads what it reported.
//
// start() waits for the ready file (the server writes it once both its HTTPS and UDP
// sides listen) and reads the ports, URLs and file paths from it. The arrivals are
// read back from the events file (one JSON object a line) and from standard output
// (one readable line each).
//
// Threading: one test thread uses the object; the server is a separate process.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <spawn.h>
#include <sys/wait.h>
#include <unistd.h>

#include <chrono>
#include <filesystem>
#include <fstream>
#include <functional>
#include <map>
#include <optional>
#include <sstream>
#include <string>
#include <thread>
#include <vector>

#include "platform/Json.h"
#include "support/ToolRunner.h"
#include "support/WaitUntil.h"
#include "telvane/Value.h"

extern char** environ;

namespace telvane::test {

class DevServerProcess {
 public:
  // `directory` holds the state folder, the events file, the ready file and the
  // server's output. `extraArguments` follow the defaults (a later option wins).
  explicit DevServerProcess(std::string directory, std::vector<std::string> extraArguments = {})
      : directory_(std::move(directory)), extraArguments_(std::move(extraArguments)) {}
  ~DevServerProcess() {
    if (pid_ > 0) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, nullptr, 0);
    }
  }
  DevServerProcess(const DevServerProcess&) = delete;
  DevServerProcess& operator=(const DevServerProcess&) = delete;

  std::string stateDir() const { return directory_ + "/devserver-state"; }
  std::string eventsFile() const { return directory_ + "/devserver-events.jsonl"; }
  std::string readyFile() const { return directory_ + "/devserver.ready"; }
  std::string outputFile() const { return directory_ + "/devserver.out"; }
  std::string errorFile() const { return directory_ + "/devserver.err"; }

  // The arguments start() passes.
  std::vector<std::string> arguments() const {
    std::vector<std::string> arguments = {"--port",   "0",          "--udp-port",        "0",
                                          "--state",  stateDir(),   "--events",          eventsFile(),
                                          "--once-ready-file", readyFile(), "--exit-with-parent"};
    arguments.insert(arguments.end(), extraArguments_.begin(), extraArguments_.end());
    return arguments;
  }

  // Starts the server and waits for its ready file. False when it ended first or did
  // not get ready in time.
  bool start(std::chrono::milliseconds timeout = std::chrono::seconds(30)) {
    std::filesystem::create_directories(directory_);
    std::vector<std::string> argv = {builtToolPath("telvane-devserver")};
    for (const auto& argument : arguments()) argv.push_back(argument);
    std::vector<char*> argvPointers;
    for (auto& a : argv) argvPointers.push_back(a.data());
    argvPointers.push_back(nullptr);
    int out = ::open(outputFile().c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    int err = ::open(errorFile().c_str(), O_WRONLY | O_CREAT | O_APPEND | O_CLOEXEC, 0644);
    if (out < 0 || err < 0) return false;
    posix_spawn_file_actions_t actions;
    posix_spawn_file_actions_init(&actions);
    posix_spawn_file_actions_adddup2(&actions, out, STDOUT_FILENO);
    posix_spawn_file_actions_adddup2(&actions, err, STDERR_FILENO);
    int rc = ::posix_spawn(&pid_, argv[0].c_str(), &actions, nullptr, argvPointers.data(), environ);
    posix_spawn_file_actions_destroy(&actions);
    ::close(out);
    ::close(err);
    if (rc != 0) {
      pid_ = -1;
      return false;
    }
    bool ready = waitUntil(
        [&] {
          if (std::filesystem::exists(readyFile())) return true;
          int status = 0;
          if (::waitpid(pid_, &status, WNOHANG) == pid_) {
            pid_ = -1;
            return true;
          }
          return false;
        },
        timeout);
    if (!ready || pid_ <= 0) return false;
    readReadyFile();
    return !value("TELVANE_DEVSERVER_URL").empty();
  }

  // SIGTERM and wait; the exit status (-1 when it did not end in time).
  int stop(std::chrono::milliseconds timeout = std::chrono::seconds(20)) {
    if (pid_ <= 0) return -1;
    ::kill(pid_, SIGTERM);
    int status = 0;
    bool ended = waitUntil([&] { return ::waitpid(pid_, &status, WNOHANG) == pid_; }, timeout);
    if (!ended) {
      ::kill(pid_, SIGKILL);
      ::waitpid(pid_, nullptr, 0);
      pid_ = -1;
      return -1;
    }
    pid_ = -1;
    return WIFEXITED(status) ? WEXITSTATUS(status) : 128 + WTERMSIG(status);
  }
  bool running() const { return pid_ > 0; }

  // A value of the ready file (empty when absent).
  std::string value(const std::string& name) const {
    auto found = ready_.find(name);
    return found == ready_.end() ? std::string() : found->second;
  }
  const std::map<std::string, std::string>& readyValues() const { return ready_; }
  int httpsPort() const { return std::stoi(value("TELVANE_DEVSERVER_HTTPS_PORT")); }
  int udpPort() const { return std::stoi(value("TELVANE_DEVSERVER_UDP_PORT")); }
  std::string url() const { return value("TELVANE_DEVSERVER_URL"); }
  std::string storebagURL() const { return value("TELVANE_DEVSERVER_STOREBAG_URL"); }
  std::string caFile() const { return value("TELVANED_CA_FILE"); }
  std::string publicKeyFile() const { return value("TELVANED_PUBLIC_KEY"); }

  // Every arrival of the events file so far, in order.
  std::vector<Value> events() const {
    std::vector<Value> arrivals;
    std::ifstream in(eventsFile());
    std::string line;
    while (std::getline(in, line)) {
      auto parsed = json::parse(line);
      if (parsed) arrivals.push_back(*parsed);
    }
    return arrivals;
  }
  // The arrivals for which the predicate holds.
  std::vector<Value> events(const std::function<bool(const Value&)>& predicate) const {
    std::vector<Value> matching;
    for (const Value& arrival : events()) {
      if (predicate(arrival)) matching.push_back(arrival);
    }
    return matching;
  }
  // Waits until at least `count` arrivals satisfy the predicate; returns them.
  std::vector<Value> waitForEvents(const std::function<bool(const Value&)>& predicate, std::size_t count = 1,
                                   std::chrono::milliseconds timeout = std::chrono::seconds(20)) const {
    std::vector<Value> matching;
    waitUntil(
        [&] {
          matching = events(predicate);
          return matching.size() >= count;
        },
        timeout);
    return matching;
  }

  // Everything the server wrote to standard output and standard error.
  std::string output() const { return readText(outputFile()); }
  std::string errors() const { return readText(errorFile()); }
  // The readable arrival lines, without their time-of-day prefix ("HH:MM:SS.mmm ").
  std::vector<std::string> arrivalLines() const {
    std::vector<std::string> lines;
    std::istringstream in(output());
    std::string line;
    while (std::getline(in, line)) {
      if (line.size() > 13 && line[2] == ':' && line[5] == ':' && line[8] == '.' && line[12] == ' ') {
        lines.push_back(line.substr(13));
      }
    }
    return lines;
  }
  bool waitForArrivalLine(const std::string& text, std::chrono::milliseconds timeout = std::chrono::seconds(20)) const {
    return waitUntil(
        [&] {
          for (const auto& line : arrivalLines()) {
            if (line == text) return true;
          }
          return false;
        },
        timeout);
  }

 private:
  static std::string readText(const std::string& path) {
    std::ifstream in(path);
    std::stringstream text;
    text << in.rdbuf();
    return text.str();
  }

  // NAME=value lines; a value may be single-quoted the way a shell reads it.
  void readReadyFile() {
    std::istringstream in(readText(readyFile()));
    std::string line;
    while (std::getline(in, line)) {
      auto equals = line.find('=');
      if (equals == std::string::npos) continue;
      std::string raw = line.substr(equals + 1), text;
      bool quoted = false, escaped = false;
      for (char c : raw) {
        if (escaped) {
          text += c;
          escaped = false;
        } else if (c == '\'') {
          quoted = !quoted;
        } else if (c == '\\' && !quoted) {
          escaped = true;
        } else {
          text += c;
        }
      }
      ready_[line.substr(0, equals)] = text;
    }
  }

  std::string directory_;
  std::vector<std::string> extraArguments_;
  pid_t pid_ = -1;
  std::map<std::string, std::string> ready_;
};

}  // namespace telvane::test
