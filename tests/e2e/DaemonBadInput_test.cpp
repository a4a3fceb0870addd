// Bad input over the real socket: each offending connection ends with an error-level
// line, the daemon keeps serving a well-behaved client all along and leaks nothing.
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <future>

#include "e2e/E2eHelpers.h"
#include "platform/MessagePack.h"
#include "platform/UniqueFd.h"
#include "support/DaemonProcess.h"
#include "support/TempDir.h"

using namespace telvane;
using namespace telvane::test;
using namespace std::chrono_literals;

namespace {

UniqueFd rawConnect(const std::string& path) {
  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
  EXPECT_EQ(::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  return fd;
}

void sendFrame(int fd, const std::string& body, std::optional<std::uint32_t> declared = std::nullopt) {
  std::uint32_t n = declared.value_or(static_cast<std::uint32_t>(body.size()));
  std::string frame = {static_cast<char>(n >> 24), static_cast<char>(n >> 16), static_cast<char>(n >> 8),
                       static_cast<char>(n)};
  frame += body;
  ASSERT_EQ(::send(fd, frame.data(), frame.size(), MSG_NOSIGNAL), static_cast<ssize_t>(frame.size()));
}

std::string message(const Value& v) {
  std::string out;
  EXPECT_TRUE(msgpack_codec::encode(v, out));
  return out;
}

std::string hello() { return message(Value(Array{Value(0), Value(0), Value(0), Value(Array{Value(1)}), Value(0)})); }

// True once the daemon has closed the socket (end of file).
bool waitClosed(int fd, std::chrono::milliseconds timeout = 20s) {
  timeval tv{static_cast<long>(timeout.count() / 1000), static_cast<long>((timeout.count() % 1000) * 1000)};
  ::setsockopt(fd, SOL_SOCKET, SO_RCVTIMEO, &tv, sizeof tv);
  char buffer[4096];
  while (true) {
    ssize_t n = ::recv(fd, buffer, sizeof buffer, 0);
    if (n == 0) return true;
    if (n < 0) return errno == ECONNRESET;
  }
}

// A well-behaved client that must get its answers throughout.
void expectServed(const RawSession& good) {
  auto reply = callAndWait(*good.connection, ipc::Operation::FetchDisplayURL, Array{});
  ASSERT_TRUE(reply.has_value()) << "the well-behaved client is still served";
  EXPECT_EQ((*reply)[0].stringOrEmpty(), "URL not available");
}

}  // namespace

TEST(DaemonBadInput, EachBadConnectionEndsWithAnErrorAndOthersAreServed) {
  TempDir dir;
  DaemonOptions options;
  options.environment = {{"TELVANED_HELLO_TIMEOUT_SECONDS", "0.5"}};
  DaemonProcess daemon(dir.str(), options);
  ASSERT_TRUE(daemon.start());
  RawSession good = openRawSession(daemon.socketPath(), sessionInfoFor(12, 100));
  expectServed(good);

  struct Case {
    std::string name;
    std::function<void(int)> send;
    std::string reason;  // what the error line says after the connection's description
  };
  std::vector<Case> cases = {
      {"oversized frame", [](int fd) { sendFrame(fd, hello()); sendFrame(fd, "", 64u * 1024 * 1024); },
       "exceeds the maximum"},
      {"not MessagePack", [](int fd) { sendFrame(fd, hello()); sendFrame(fd, std::string("\xc1\xc1", 2)); },
       "malformed message body"},
      {"unknown operation",
       [](int fd) {
         sendFrame(fd, hello());
         sendFrame(fd, message(Value(Array{Value(1), Value(1), Value(4242), Value(Array{}), Value(0)})));
       },
       "unknown operation 4242"},
      {"wrong argument types",
       [](int fd) {
         sendFrame(fd, hello());
         sendFrame(fd, message(Value(Array{Value(2), Value(1), Value(1),
                                           Value(Array{Value("not a map"), Value(), Value(), Value(false)}),
                                           Value(0)})));
       },
       "wrong arguments for setSessionInfo: argument 1 must be a map"},
      {"close in the middle of a frame",
       [](int fd) {
         sendFrame(fd, hello());
         sendFrame(fd, "partial", 1000);
         ::shutdown(fd, SHUT_WR);
       },
       "the peer closed in the middle of a message"},
  };
  for (const auto& c : cases) {
    SCOPED_TRACE(c.name);
    UniqueFd fd = rawConnect(daemon.socketPath());
    c.send(fd.get());
    EXPECT_TRUE(waitClosed(fd.get()));
    EXPECT_TRUE(daemon.waitForLogContaining(
        "IpcConnection: closing connection pid " + std::to_string(::getpid()) + " uid " + std::to_string(::getuid()) +
            ": ",
        c.reason))
        << c.name << "\n"
        << daemon.log();
    expectServed(good);
  }

  // A flood of connections that never say hello: each is dropped after the hello
  // timeout, and the good client is served meanwhile.
  std::vector<UniqueFd> silent;
  for (int i = 0; i < 50; ++i) silent.push_back(rawConnect(daemon.socketPath()));
  expectServed(good);
  for (auto& fd : silent) EXPECT_TRUE(waitClosed(fd.get()));
  EXPECT_GE(daemon.countLogPrefix("IpcConnection: closing connection pid " + std::to_string(::getpid()) + " uid " +
                                  std::to_string(::getuid()) + ": no hello within 500 ms"),
            50u);
  expectServed(good);

  good.connection->invalidate();
  EXPECT_EQ(daemon.stop(), 0) << "a clean exit (the sanitizers fail it on a leak)\n" << daemon.log();
  EXPECT_EQ(daemon.log().find("LeakSanitizer"), std::string::npos);
  EXPECT_EQ(daemon.log().find("runtime error"), std::string::npos);
}
