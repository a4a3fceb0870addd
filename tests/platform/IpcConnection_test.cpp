#include "platform/IpcConnection.h"

#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <chrono>
#include <condition_variable>
#include <future>
#include <mutex>
#include <thread>

#include "platform/Executors.h"
#include "platform/Log.h"
#include "platform/MessagePack.h"
#include "support/TempDir.h"

using namespace telvane;
using namespace std::chrono_literals;

namespace {

// A pair of connected connections: a daemon end and a client end.
struct Pair {
  std::shared_ptr<IpcConnection> daemon;
  std::shared_ptr<IpcConnection> client;
};

Pair makePair() {
  int fds[2];
  EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
  Pair p;
  p.daemon = IpcConnection::adopt(UniqueFd(fds[0]), SerialQueue::create("test.daemon"), IpcConnection::Side::Daemon);
  p.client = IpcConnection::adopt(UniqueFd(fds[1]), SerialQueue::create("test.client"), IpcConnection::Side::Client);
  return p;
}

template <typename T>
T waitFor(std::future<T>& f) {
  EXPECT_EQ(f.wait_for(10s), std::future_status::ready);
  return f.get();
}

// Writes one raw frame (length prefix + body) on a socket.
void writeFrame(int fd, const std::string& body, std::optional<std::uint32_t> declared = std::nullopt) {
  std::uint32_t n = declared.value_or(static_cast<std::uint32_t>(body.size()));
  unsigned char header[4] = {static_cast<unsigned char>(n >> 24), static_cast<unsigned char>(n >> 16),
                             static_cast<unsigned char>(n >> 8), static_cast<unsigned char>(n)};
  ASSERT_EQ(::write(fd, header, 4), 4);
  if (!body.empty()) {
    ASSERT_EQ(::write(fd, body.data(), body.size()), static_cast<ssize_t>(body.size()));
  }
}

std::string encode(const Value& v) {
  std::string out;
  EXPECT_TRUE(msgpack_codec::encode(v, out));
  return out;
}

std::string helloBody() { return encode(Value(Array{Value(0), Value(0), Value(0), Value(Array{Value(1)}), Value(0)})); }

// A daemon end on one side of a socket pair; the test drives the other side raw.
struct RawPeer {
  std::shared_ptr<IpcConnection> daemon;
  UniqueFd raw;
  std::promise<void> invalidated;
};

std::unique_ptr<RawPeer> makeRawPeer() {
  int fds[2];
  EXPECT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
  auto peer = std::make_unique<RawPeer>();
  peer->raw.reset(fds[1]);
  peer->daemon =
      IpcConnection::adopt(UniqueFd(fds[0]), SerialQueue::create("test.raw"), IpcConnection::Side::Daemon);
  auto* promise = &peer->invalidated;
  peer->daemon->setInvalidationHandler([promise] { promise->set_value(); });
  peer->daemon->resume();
  return peer;
}

void expectClosedWithError(RawPeer& peer, log::LogCapture& capture, const std::string& reasonPrefix) {
  auto f = peer.invalidated.get_future();
  ASSERT_EQ(f.wait_for(10s), std::future_status::ready);
  EXPECT_FALSE(peer.daemon->isValid());
  bool found = false;
  for (const auto& line : capture.lines()) {
    if (line.level == log::Level::Error && line.text.find("IpcConnection: closing connection") == 0 &&
        line.text.find(reasonPrefix) != std::string::npos) {
      found = true;
    }
  }
  EXPECT_TRUE(found) << "no error line containing: " << reasonPrefix;
}

}  // namespace

TEST(IpcConnection, CallAndReplyAreMatchedById) {
  Pair p = makePair();
  p.daemon->setCallHandler([](IpcConnection::IncomingCall& call) {
    ASSERT_EQ(call.operation, ipc::Operation::SendMessageWithDictionary);
    ASSERT_TRUE(call.reply);
    auto category = call.arguments[0]["ParametersCategory"].integerValue();
    call.reply(Array{Value("got " + std::to_string(category))});
    call.reply(Array{Value("second reply is never sent")});
  });
  p.daemon->resume();
  p.client->resume();

  std::promise<std::string> first, second;
  p.client->call(ipc::Operation::SendMessageWithDictionary,
                 Array{Value(Dictionary{{"ParametersCategory", Value(7)}})},
                 [&](Array reply) { first.set_value(reply[0].stringOrEmpty()); });
  p.client->call(ipc::Operation::SendMessageWithDictionary,
                 Array{Value(Dictionary{{"ParametersCategory", Value(9)}})},
                 [&](Array reply) { second.set_value(reply[0].stringOrEmpty()); });
  auto f1 = first.get_future();
  auto f2 = second.get_future();
  EXPECT_EQ(waitFor(f1), "got 7");
  EXPECT_EQ(waitFor(f2), "got 9");
}

TEST(IpcConnection, CallWithoutReplyBlockGivesTheHandlerNoReply) {
  Pair p = makePair();
  std::promise<bool> hadReply;
  p.daemon->setCallHandler([&](IpcConnection::IncomingCall& call) { hadReply.set_value(bool(call.reply)); });
  p.daemon->resume();
  p.client->resume();
  p.client->call(ipc::Operation::StartConfig, Array{});
  auto f = hadReply.get_future();
  EXPECT_FALSE(waitFor(f));
}

TEST(IpcConnection, DaemonCallsTheClientsReplyInterface) {
  Pair p = makePair();
  std::promise<double> timestamp;
  p.client->setCallHandler([&](IpcConnection::IncomingCall& call) {
    EXPECT_EQ(call.operation, ipc::Operation::SendMessageToClient);
    timestamp.set_value(call.arguments[1].doubleValue());
  });
  p.daemon->resume();
  p.client->resume();
  p.daemon->call(ipc::Operation::SendMessageToClient,
                 Array{Value(), Value(12.5), Value(1), Value(2), Value()});
  auto f = timestamp.get_future();
  EXPECT_DOUBLE_EQ(waitFor(f), 12.5);
}

TEST(IpcConnection, DescriptorTravelsWithTheCall) {
  test::TempDir dir;
  test::writeFile(dir / "upload.txt", "file body");
  Pair p = makePair();
  std::promise<std::string> content;
  p.daemon->setCallHandler([&](IpcConnection::IncomingCall& call) {
    ASSERT_EQ(call.descriptors.size(), 1u);
    char buf[64] = {};
    ssize_t n = ::pread(call.descriptors[0].get(), buf, sizeof buf, 0);
    content.set_value(std::string(buf, n > 0 ? static_cast<std::size_t>(n) : 0));
    call.reply(Array{Value(true), Value(false)});
  });
  p.daemon->resume();
  p.client->resume();
  std::vector<UniqueFd> fds;
  fds.emplace_back(::open((dir / "upload.txt").c_str(), O_RDONLY | O_CLOEXEC));
  std::promise<bool> replied;
  p.client->call(ipc::Operation::UploadFileAtPath, Array{Value((dir / "upload.txt").string()), Value()},
                 [&](Array reply) { replied.set_value(reply[0].boolValue()); }, std::move(fds));
  auto f = content.get_future();
  EXPECT_EQ(waitFor(f), "file body");
  auto r = replied.get_future();
  EXPECT_TRUE(waitFor(r));
}

TEST(IpcConnection, PendingRepliesAreDroppedWhenTheConnectionEnds) {
  Pair p = makePair();
  std::promise<void> daemonGotCall;
  p.daemon->setCallHandler([&](IpcConnection::IncomingCall&) { daemonGotCall.set_value(); });
  std::promise<void> interrupted;
  p.client->setInterruptionHandler([&] { interrupted.set_value(); });
  bool replyCalled = false;
  p.daemon->resume();
  p.client->resume();
  p.client->call(ipc::Operation::FetchDisplayURL, Array{}, [&](Array) { replyCalled = true; });
  auto g = daemonGotCall.get_future();
  waitFor(g);
  p.daemon->invalidate();
  auto f = interrupted.get_future();
  waitFor(f);
  EXPECT_FALSE(replyCalled);
  EXPECT_FALSE(p.client->isValid());
}

TEST(IpcConnection, ExplicitInvalidateRunsTheInvalidationHandlerOnce) {
  Pair p = makePair();
  std::atomic<int> count{0};
  std::promise<void> done;
  p.daemon->setInvalidationHandler([&] {
    if (++count == 1) done.set_value();
  });
  p.daemon->resume();
  p.daemon->invalidate();
  p.daemon->invalidate();
  auto f = done.get_future();
  waitFor(f);
  // A later task on the same queue runs after any second handler call would have.
  std::promise<void> flushed;
  p.daemon->queue()->async([&] { flushed.set_value(); });
  auto g = flushed.get_future();
  waitFor(g);
  EXPECT_EQ(count.load(), 1);
}

TEST(IpcConnection, OversizedFrameEndsTheConnection) {
  log::LogCapture capture;
  auto peer = makeRawPeer();
  writeFrame(peer->raw.get(), helloBody());
  writeFrame(peer->raw.get(), "", static_cast<std::uint32_t>(ipc::kMaxMessageBytes + 1));
  expectClosedWithError(*peer, capture, "exceeds the maximum");
}

TEST(IpcConnection, BodyThatIsNotMessagePackEndsTheConnection) {
  log::LogCapture capture;
  auto peer = makeRawPeer();
  writeFrame(peer->raw.get(), helloBody());
  writeFrame(peer->raw.get(), std::string("\xc1\xc1\xc1", 3));
  expectClosedWithError(*peer, capture, "malformed message body");
}

TEST(IpcConnection, UnknownOperationEndsTheConnection) {
  log::LogCapture capture;
  auto peer = makeRawPeer();
  writeFrame(peer->raw.get(), helloBody());
  writeFrame(peer->raw.get(), encode(Value(Array{Value(1), Value(1), Value(999), Value(Array{}), Value(0)})));
  expectClosedWithError(*peer, capture, "unknown operation 999");
}

TEST(IpcConnection, ClientOnlyOperationSentToTheDaemonEndsTheConnection) {
  log::LogCapture capture;
  auto peer = makeRawPeer();
  writeFrame(peer->raw.get(), helloBody());
  writeFrame(peer->raw.get(), encode(Value(Array{Value(2), Value(1), Value(64),
                                                 Value(Array{Value(), Value(1.0), Value(1), Value(1), Value()}),
                                                 Value(0)})));
  expectClosedWithError(*peer, capture, "unknown operation 64");
}

TEST(IpcConnection, WrongArgumentTypesEndTheConnection) {
  log::LogCapture capture;
  auto peer = makeRawPeer();
  writeFrame(peer->raw.get(), helloBody());
  // sendMessageWithDictionary with a string where the message map belongs.
  writeFrame(peer->raw.get(), encode(Value(Array{Value(1), Value(1), Value(5), Value(Array{Value("x")}), Value(0)})));
  expectClosedWithError(*peer, capture, "wrong arguments for sendMessageWithDictionary: argument 1 must be a map");
}

TEST(IpcConnection, CloseInTheMiddleOfAFrameIsLoggedAsAnError) {
  log::LogCapture capture;
  auto peer = makeRawPeer();
  writeFrame(peer->raw.get(), helloBody());
  writeFrame(peer->raw.get(), "", 100);  // promises 100 bytes, sends none
  ASSERT_EQ(::write(peer->raw.get(), "abc", 3), 3);
  peer->raw.reset();
  expectClosedWithError(*peer, capture, "the peer closed in the middle of a message");
}

TEST(IpcConnection, FirstMessageMustBeHello) {
  log::LogCapture capture;
  auto peer = makeRawPeer();
  writeFrame(peer->raw.get(), encode(Value(Array{Value(1), Value(1), Value(4), Value(Array{}), Value(0)})));
  expectClosedWithError(*peer, capture, "expected hello, got call");
}

TEST(IpcConnection, WrongProtocolVersionEndsTheConnection) {
  log::LogCapture capture;
  auto peer = makeRawPeer();
  writeFrame(peer->raw.get(), encode(Value(Array{Value(0), Value(0), Value(0), Value(Array{Value(99)}), Value(0)})));
  expectClosedWithError(*peer, capture, "unsupported protocol version 99");
}

TEST(IpcConnection, CleanCloseOnTheDaemonSideIsAnInvalidationWithoutError) {
  log::LogCapture capture;
  auto peer = makeRawPeer();
  writeFrame(peer->raw.get(), helloBody());
  peer->raw.reset();
  auto f = peer->invalidated.get_future();
  ASSERT_EQ(f.wait_for(10s), std::future_status::ready);
  for (const auto& line : capture.lines()) EXPECT_NE(line.level, log::Level::Error) << line.text;
}

TEST(IpcConnection, PeerThatNeverSaysHelloIsDisconnected) {
  log::LogCapture capture;
  int fds[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
  UniqueFd raw(fds[1]);
  auto daemon = IpcConnection::adopt(UniqueFd(fds[0]), SerialQueue::create("test.silent"), IpcConnection::Side::Daemon);
  std::promise<void> invalidated;
  daemon->setInvalidationHandler([&] { invalidated.set_value(); });
  daemon->setHelloTimeout(50ms);
  daemon->resume();
  auto f = invalidated.get_future();
  ASSERT_EQ(f.wait_for(10s), std::future_status::ready);
  EXPECT_TRUE(capture.contains(log::Level::Error, "IpcConnection: closing connection " + daemon->description() +
                                                      ": no hello within 50 ms"));
}

TEST(IpcConnection, ReplyGivenOnTheQueueBeforeInvalidateIsStillDelivered) {
  Pair p = makePair();
  p.daemon->setCallHandler([&](IpcConnection::IncomingCall& call) {
    call.reply(Array{Value("refused")});
    p.daemon->invalidate();
  });
  std::promise<std::string> reply;
  std::promise<void> interrupted;
  p.client->setInterruptionHandler([&] { interrupted.set_value(); });
  p.daemon->resume();
  p.client->resume();
  p.client->call(ipc::Operation::FetchDisplayURL, Array{}, [&](Array r) { reply.set_value(r[0].stringOrEmpty()); });
  auto f = reply.get_future();
  EXPECT_EQ(waitFor(f), "refused");
  auto g = interrupted.get_future();
  waitFor(g);
}

namespace {

// Reads one frame from a raw socket and decodes its body; none at the end or on error.
std::optional<Value> readFrame(int fd) {
  auto readExactly = [fd](void* buffer, std::size_t size) {
    auto* bytes = static_cast<char*>(buffer);
    std::size_t done = 0;
    while (done < size) {
      ssize_t n = ::read(fd, bytes + done, size - done);
      if (n <= 0) return false;
      done += static_cast<std::size_t>(n);
    }
    return true;
  };
  unsigned char header[4];
  if (!readExactly(header, 4)) return std::nullopt;
  std::uint32_t length = (std::uint32_t(header[0]) << 24) | (std::uint32_t(header[1]) << 16) |
                         (std::uint32_t(header[2]) << 8) | std::uint32_t(header[3]);
  std::string body(length, '\0');
  if (!readExactly(body.data(), length)) return std::nullopt;
  auto decoded = msgpack_codec::decode(reinterpret_cast<const std::uint8_t*>(body.data()), body.size());
  if (!decoded) return std::nullopt;
  return decoded.value();
}

// What a client end saw when its connection ended.
struct EndSeen {
  std::optional<std::string> refusal;
  bool closedBeforeHello = false;
};

}  // namespace

TEST(IpcConnection, RefusalOfAConnectionNeverResumedIsItsOnlyHello) {
  log::LogCapture capture;
  int fds[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
  UniqueFd raw(fds[1]);
  auto daemon = IpcConnection::adopt(UniqueFd(fds[0]), SerialQueue::create("test.refusing"), IpcConnection::Side::Daemon);
  std::promise<void> invalidated;
  daemon->setInvalidationHandler([&] { invalidated.set_value(); });
  // The caller has said hello and made a call that the refusing side never reads.
  writeFrame(raw.get(), helloBody());
  writeFrame(raw.get(), encode(Value(Array{Value(1), Value(1), Value(4), Value(Array{}), Value(0)})));
  daemon->refuse("missing the entitlement com.zembra.private.telvaned");
  daemon->resume();  // too late: nothing more is said or read

  auto hello = readFrame(raw.get());
  ASSERT_TRUE(hello.has_value());
  EXPECT_EQ(*hello, Value(Array{Value(0), Value(0), Value(0),
                                Value(Array{Value(1), Value("missing the entitlement com.zembra.private.telvaned")}),
                                Value(0)}));
  EXPECT_FALSE(readFrame(raw.get()).has_value()) << "the connection ends behind the refusal";
  auto f = invalidated.get_future();
  waitFor(f);
  for (const auto& line : capture.lines()) EXPECT_NE(line.level, log::Level::Error) << line.text;
}

TEST(IpcConnection, ClientKeepsTheRefusalOfADaemonThatClosesWithoutReadingItsHello) {
  log::LogCapture capture;
  int fds[2];
  ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
  UniqueFd raw(fds[0]);
  auto client = IpcConnection::adopt(UniqueFd(fds[1]), SerialQueue::create("test.refused"), IpcConnection::Side::Client);
  std::promise<EndSeen> ended;
  client->setInterruptionHandler([&] { ended.set_value({client->peerRefusal(), client->peerClosedBeforeHello()}); });
  client->resume();
  // Wait until the client's hello waits unread on the daemon's side, so that closing
  // resets the connection behind the refusal.
  pollfd readable{raw.get(), POLLIN, 0};
  ASSERT_EQ(::poll(&readable, 1, 10000), 1);
  writeFrame(raw.get(), encode(Value(Array{Value(0), Value(0), Value(0),
                                           Value(Array{Value(1), Value("missing the entitlement x")}), Value(0)})));
  raw.reset();

  auto f = ended.get_future();
  EndSeen seen = waitFor(f);
  EXPECT_EQ(seen.refusal, std::optional<std::string>("missing the entitlement x"));
  EXPECT_FALSE(seen.closedBeforeHello);
  EXPECT_TRUE(capture.contains(log::Level::Info, "IpcConnection: " + client->description() +
                                                     ": the peer refuses the connection: missing the entitlement x"));
  for (const auto& line : capture.lines()) EXPECT_NE(line.level, log::Level::Error) << line.text;
}

TEST(IpcConnection, RefusalAfterHelloLetsTheReplyThroughAndHandlesNothingMore) {
  log::LogCapture capture;
  Pair p = makePair();
  std::atomic<int> handled{0};
  p.daemon->setCallHandler([&](IpcConnection::IncomingCall& call) {
    ++handled;
    p.daemon->refuse("too many active sessions for client type 7 (at most 5)");
    if (call.reply) call.reply(Array{Value("Exceeded maximum active reporting session limit")});
  });
  std::promise<void> invalidated;
  p.daemon->setInvalidationHandler([&] { invalidated.set_value(); });
  std::promise<EndSeen> ended;
  p.client->setInterruptionHandler(
      [&] { ended.set_value({p.client->peerRefusal(), p.client->peerClosedBeforeHello()}); });
  p.daemon->resume();
  p.client->resume();
  std::promise<std::string> reply;
  std::atomic<bool> secondReplied{false};
  p.client->call(ipc::Operation::FetchDisplayURL, Array{}, [&](Array r) { reply.set_value(r[0].stringOrEmpty()); });
  p.client->call(ipc::Operation::FetchDisplayURL, Array{}, [&](Array) { secondReplied = true; });

  auto r = reply.get_future();
  EXPECT_EQ(waitFor(r), "Exceeded maximum active reporting session limit");
  auto f = ended.get_future();
  EndSeen seen = waitFor(f);
  EXPECT_EQ(seen.refusal, std::optional<std::string>("too many active sessions for client type 7 (at most 5)"));
  EXPECT_FALSE(seen.closedBeforeHello);
  auto g = invalidated.get_future();
  waitFor(g);
  EXPECT_EQ(handled.load(), 1) << "the call behind the refused one is not handled";
  EXPECT_FALSE(secondReplied.load());
  EXPECT_EQ(p.daemon->peerRefusal(), std::nullopt);
  for (const auto& line : capture.lines()) EXPECT_NE(line.level, log::Level::Error) << line.text;
}

TEST(IpcConnection, PeerThatClosesBeforeItsHelloIsToldApartFromOneThatSaidHello) {
  {
    log::LogCapture capture;
    int fds[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds), 0);
    UniqueFd raw(fds[0]);
    auto client =
        IpcConnection::adopt(UniqueFd(fds[1]), SerialQueue::create("test.early"), IpcConnection::Side::Client);
    std::promise<EndSeen> ended;
    client->setInterruptionHandler([&] { ended.set_value({client->peerRefusal(), client->peerClosedBeforeHello()}); });
    client->resume();
    raw.reset();
    auto f = ended.get_future();
    EndSeen seen = waitFor(f);
    EXPECT_TRUE(seen.closedBeforeHello);
    EXPECT_EQ(seen.refusal, std::nullopt);
  }
  Pair p = makePair();
  std::promise<EndSeen> ended;
  p.client->setInterruptionHandler(
      [&] { ended.set_value({p.client->peerRefusal(), p.client->peerClosedBeforeHello()}); });
  std::promise<std::string> answered;
  p.daemon->setCallHandler([](IpcConnection::IncomingCall& call) { call.reply(Array{Value("URL not available")}); });
  p.daemon->resume();
  p.client->resume();
  p.client->call(ipc::Operation::FetchDisplayURL, Array{}, [&](Array r) { answered.set_value(r[0].stringOrEmpty()); });
  auto a = answered.get_future();
  EXPECT_EQ(waitFor(a), "URL not available");
  p.daemon->invalidate();
  auto f = ended.get_future();
  EndSeen seen = waitFor(f);
  EXPECT_FALSE(seen.closedBeforeHello);
  EXPECT_EQ(seen.refusal, std::nullopt);
}
