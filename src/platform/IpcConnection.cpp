#include "platform/IpcConnection.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <asio/bind_executor.hpp>

#include <cerrno>
#include <cstring>

#include "platform/Log.h"
#include "platform/MessagePack.h"

namespace telvane {

namespace {

constexpr std::size_t kReadChunkBytes = 64 * 1024;
constexpr std::size_t kHeaderBytes = 4;

std::uint32_t readBigEndian32(const std::uint8_t* p) {
  return (std::uint32_t(p[0]) << 24) | (std::uint32_t(p[1]) << 16) | (std::uint32_t(p[2]) << 8) | std::uint32_t(p[3]);
}

void setNonBlocking(int fd) {
  int flags = ::fcntl(fd, F_GETFL, 0);
  if (flags >= 0) ::fcntl(fd, F_SETFL, flags | O_NONBLOCK);
}

// A non-negative integer field of a message header.
bool headerField(const Value& v, std::uint64_t& out) {
  if (!v.isInteger() || v.integerValue() < 0) return false;
  out = v.unsignedLongLongValue();
  return true;
}

}  // namespace

PeerCredentials readPeerCredentials(int socket) {
  PeerCredentials creds;
  struct ucred uc {};
  socklen_t len = sizeof uc;
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERCRED, &uc, &len) == 0) {
    creds.pid = uc.pid;
    creds.uid = uc.uid;
    creds.gid = uc.gid;
  }
  socklen_t groupsLen = 0;
  // The first call tells the size (ERANGE); a kernel without the option fails otherwise.
  if (::getsockopt(socket, SOL_SOCKET, SO_PEERGROUPS, nullptr, &groupsLen) < 0 && errno == ERANGE && groupsLen > 0) {
    std::vector<gid_t> groups(groupsLen / sizeof(gid_t));
    if (::getsockopt(socket, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &groupsLen) == 0) {
      groups.resize(groupsLen / sizeof(gid_t));
      creds.groups = std::move(groups);
    }
  }
  return creds;
}

std::shared_ptr<IpcConnection> IpcConnection::adopt(UniqueFd socket, std::shared_ptr<SerialQueue> queue, Side side) {
  PeerCredentials creds = readPeerCredentials(socket.get());
  std::string description = side == Side::Daemon
                                ? "pid " + std::to_string(creds.pid) + " uid " + std::to_string(creds.uid)
                                : "peer pid " + std::to_string(creds.pid);
  auto connection = std::shared_ptr<IpcConnection>(
      new IpcConnection(std::move(socket), std::move(queue), side, std::move(description)));
  connection->peer_ = std::move(creds);
  return connection;
}

Result<std::shared_ptr<IpcConnection>> IpcConnection::connect(const std::string& path,
                                                              std::shared_ptr<SerialQueue> queue) {
  sockaddr_un address{};
  if (path.size() >= sizeof address.sun_path) {
    return Result<std::shared_ptr<IpcConnection>>::failure("socket path too long: " + path);
  }
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!fd) return Result<std::shared_ptr<IpcConnection>>::failure(std::string("socket: ") + std::strerror(errno));
  if (::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) < 0) {
    return Result<std::shared_ptr<IpcConnection>>::failure("connect " + path + ": " + std::strerror(errno));
  }
  PeerCredentials creds = readPeerCredentials(fd.get());
  auto connection =
      std::shared_ptr<IpcConnection>(new IpcConnection(std::move(fd), std::move(queue), Side::Client, path));
  connection->peer_ = std::move(creds);
  return Result<std::shared_ptr<IpcConnection>>::success(std::move(connection));
}

IpcConnection::IpcConnection(UniqueFd socket, std::shared_ptr<SerialQueue> queue, Side side, std::string description)
    : queue_(std::move(queue)),
      side_(side),
      description_(std::move(description)),
      socket_(queue_->executor().context()),
      helloTimer_(queue_->executor().context()) {
  setNonBlocking(socket.get());
  socket_.assign(socket.release());
}

IpcConnection::~IpcConnection() {
  std::error_code ignored;
  socket_.close(ignored);
}

void IpcConnection::setCallHandler(CallHandler handler) {
  queue_->async([self = shared_from_this(), handler = std::move(handler)]() mutable {
    if (!self->finished_) self->callHandler_ = std::move(handler);
  });
}

void IpcConnection::setInvalidationHandler(std::function<void()> handler) {
  queue_->async([self = shared_from_this(), handler = std::move(handler)]() mutable {
    if (!self->finished_) self->invalidationHandler_ = std::move(handler);
  });
}

void IpcConnection::setInterruptionHandler(std::function<void()> handler) {
  queue_->async([self = shared_from_this(), handler = std::move(handler)]() mutable {
    if (!self->finished_) self->interruptionHandler_ = std::move(handler);
  });
}

void IpcConnection::resume() {
  std::string hello = encodeFrame(ipc::MessageKind::Hello, 0, 0, Array{Value(ipc::kProtocolVersion)}, 0);
  queue_->async([self = shared_from_this(), hello = std::move(hello)]() mutable {
    if (self->resumed_ || self->finished_) return;
    self->resumed_ = true;
    self->helloTimer_.expires_after(self->helloTimeout_);
    self->helloTimer_.async_wait(asio::bind_executor(
        self->queue_->strand(), [weak = self->weak_from_this()](const std::error_code& error) {
          auto connection = weak.lock();
          if (error || !connection || connection->helloReceived_ || connection->finished_) return;
          connection->fail("no hello within " + std::to_string(connection->helloTimeout_.count()) + " ms");
        }));
    self->enqueueOnQueue(OutgoingFrame{std::move(hello), {}, 0});
    self->waitReadable();
  });
}

std::string IpcConnection::encodeFrame(ipc::MessageKind kind, std::uint64_t id, std::uint16_t operation,
                                       const Array& arguments, std::size_t descriptorCount) {
  std::string frame(kHeaderBytes, '\0');
  frame.reserve(256);
  Array message;
  message.reserve(5);
  message.emplace_back(static_cast<unsigned>(kind));
  message.emplace_back(static_cast<unsigned long long>(id));
  message.emplace_back(static_cast<unsigned>(operation));
  // The arguments are copied into the message array; values share their containers,
  // so this copies handles, not contents.
  message.emplace_back(arguments);
  message.emplace_back(static_cast<unsigned long long>(descriptorCount));
  if (!msgpack_codec::encode(Value(std::move(message)), frame)) return {};
  std::uint32_t length = static_cast<std::uint32_t>(frame.size() - kHeaderBytes);
  frame[0] = static_cast<char>(length >> 24);
  frame[1] = static_cast<char>(length >> 16);
  frame[2] = static_cast<char>(length >> 8);
  frame[3] = static_cast<char>(length);
  return frame;
}

void IpcConnection::call(ipc::Operation operation, Array arguments, ReplyHandler onReply,
                         std::vector<UniqueFd> descriptors) {
  const bool wantsReply = static_cast<bool>(onReply);
  const std::uint64_t id = nextId_.fetch_add(1);
  std::string frame = encodeFrame(wantsReply ? ipc::MessageKind::Call : ipc::MessageKind::CallNoReply, id,
                                  static_cast<std::uint16_t>(operation), arguments, descriptors.size());
  if (frame.empty() || frame.size() - kHeaderBytes > ipc::kMaxMessageBytes) {
    const auto* info = ipc::operationInfo(operation);
    log::error("IpcConnection: %s: cannot send %s: the message cannot be encoded or is too large",
               description_, info ? info->name : "?");
    return;
  }
  // std::function wants a copyable closure: the descriptors travel behind a pointer.
  auto fds = std::make_shared<std::vector<UniqueFd>>(std::move(descriptors));
  queue_->async([self = shared_from_this(), id, frame = std::move(frame), onReply = std::move(onReply),
                 fds]() mutable {
    if (self->finished_) {
      log::debug("IpcConnection: %s: call dropped, the connection has ended", self->description_);
      return;
    }
    if (onReply) self->pendingReplies_.emplace(id, std::move(onReply));
    self->enqueueOnQueue(OutgoingFrame{std::move(frame), std::move(*fds), 0});
  });
}

void IpcConnection::sendReply(std::uint64_t id, std::uint16_t code, Array arguments) {
  std::string frame = encodeFrame(ipc::MessageKind::Reply, id, code, arguments, 0);
  if (frame.empty() || frame.size() - kHeaderBytes > ipc::kMaxMessageBytes) {
    log::error("IpcConnection: %s: cannot send the reply to call %llu: it cannot be encoded or is too large",
               description_, static_cast<unsigned long long>(id));
    return;
  }
  // A reply given on the queue itself goes out at once, so that it keeps its place
  // before an invalidate() made right after it (a session that refuses itself still
  // answers the call that made it do so).
  if (queue_->isCurrent()) {
    if (!finished_) enqueueOnQueue(OutgoingFrame{std::move(frame), {}, 0});
    return;
  }
  queue_->async([self = shared_from_this(), frame = std::move(frame)]() mutable {
    if (!self->finished_) self->enqueueOnQueue(OutgoingFrame{std::move(frame), {}, 0});
  });
}

void IpcConnection::enqueueOnQueue(OutgoingFrame frame) {
  output_.push_back(std::move(frame));
  if (!writeWaiting_) flushWrites();
}

void IpcConnection::flushWrites() {
  while (!output_.empty() && !finished_) {
    OutgoingFrame& frame = output_.front();
    iovec iov{frame.bytes.data() + frame.offset, frame.bytes.size() - frame.offset};
    msghdr msg{};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * ipc::kMaxDescriptorsPerMessage)];
    if (frame.offset == 0 && !frame.descriptors.empty()) {
      std::size_t count = frame.descriptors.size();
      msg.msg_control = control;
      msg.msg_controllen = CMSG_SPACE(sizeof(int) * count);
      cmsghdr* cmsg = CMSG_FIRSTHDR(&msg);
      cmsg->cmsg_level = SOL_SOCKET;
      cmsg->cmsg_type = SCM_RIGHTS;
      cmsg->cmsg_len = CMSG_LEN(sizeof(int) * count);
      int* fds = reinterpret_cast<int*>(CMSG_DATA(cmsg));
      for (std::size_t i = 0; i < count; ++i) fds[i] = frame.descriptors[i].get();
    }
    ssize_t n = ::sendmsg(socket_.native_handle(), &msg, MSG_NOSIGNAL | MSG_DONTWAIT);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) {
        waitWritable();
        return;
      }
      if (errno == EPIPE || errno == ECONNRESET) {
        // The peer has closed its end, but what it sent before closing may still wait
        // to be read (a client's last calls before it exits). Drop what we cannot
        // deliver and let the read side end the connection when it reaches the end.
        output_.clear();
      } else {
        fail(std::string("send failed: ") + std::strerror(errno));
      }
      return;
    }
    // The descriptors went with the first bytes; ours can be closed now.
    frame.descriptors.clear();
    frame.offset += static_cast<std::size_t>(n);
    if (frame.offset == frame.bytes.size()) output_.pop_front();
  }
}

void IpcConnection::waitWritable() {
  writeWaiting_ = true;
  socket_.async_wait(asio::posix::stream_descriptor::wait_write,
                     asio::bind_executor(queue_->strand(), [weak = weak_from_this()](const std::error_code& error) {
                       auto self = weak.lock();
                       if (!self) return;
                       self->writeWaiting_ = false;
                       if (error || self->finished_) return;
                       self->flushWrites();
                     }));
}

void IpcConnection::waitReadable() {
  socket_.async_wait(asio::posix::stream_descriptor::wait_read,
                     asio::bind_executor(queue_->strand(), [weak = weak_from_this()](const std::error_code& error) {
                       auto self = weak.lock();
                       if (!self || error || self->finished_) return;
                       self->onReadable();
                     }));
}

void IpcConnection::onReadable() {
  char buffer[kReadChunkBytes];
  alignas(cmsghdr) char control[CMSG_SPACE(sizeof(int) * ipc::kMaxDescriptorsPerMessage * 4)];
  // Read what is there now, then parse; other connections' queues run meanwhile.
  for (int round = 0; round < 16 && !finished_; ++round) {
    iovec iov{buffer, sizeof buffer};
    msghdr msg{};
    msg.msg_iov = &iov;
    msg.msg_iovlen = 1;
    msg.msg_control = control;
    msg.msg_controllen = sizeof control;
    ssize_t n = ::recvmsg(socket_.native_handle(), &msg, MSG_DONTWAIT | MSG_CMSG_CLOEXEC);
    if (n < 0) {
      if (errno == EINTR) continue;
      if (errno == EAGAIN || errno == EWOULDBLOCK) break;
      if (errno == ECONNRESET) {
        // A peer that closes without reading what we sent resets the connection; what
        // it wrote before (a refusal) has been read and is handled first.
        parseFrames();
        if (!finished_) peerClosed(input_.size() > inputOffset_);
      } else {
        fail(std::string("receive failed: ") + std::strerror(errno));
      }
      return;
    }
    for (cmsghdr* cmsg = CMSG_FIRSTHDR(&msg); cmsg; cmsg = CMSG_NXTHDR(&msg, cmsg)) {
      if (cmsg->cmsg_level == SOL_SOCKET && cmsg->cmsg_type == SCM_RIGHTS) {
        std::size_t count = (cmsg->cmsg_len - CMSG_LEN(0)) / sizeof(int);
        const int* fds = reinterpret_cast<const int*>(CMSG_DATA(cmsg));
        for (std::size_t i = 0; i < count; ++i) receivedDescriptors_.emplace_back(fds[i]);
      }
    }
    if (msg.msg_flags & MSG_CTRUNC) {
      fail("too many descriptors in one message");
      return;
    }
    if (n == 0) {
      parseFrames();
      if (!finished_) peerClosed(input_.size() > inputOffset_);
      return;
    }
    input_.append(buffer, static_cast<std::size_t>(n));
    if (static_cast<std::size_t>(n) < sizeof buffer) break;
  }
  parseFrames();
  if (!finished_) waitReadable();
}

void IpcConnection::parseFrames() {
  while (!finished_ && !refusing_) {
    std::size_t available = input_.size() - inputOffset_;
    if (available < kHeaderBytes) break;
    const auto* data = reinterpret_cast<const std::uint8_t*>(input_.data()) + inputOffset_;
    std::uint32_t length = readBigEndian32(data);
    if (length > ipc::kMaxMessageBytes) {
      fail("message of " + std::to_string(length) + " bytes exceeds the maximum of " +
           std::to_string(ipc::kMaxMessageBytes));
      return;
    }
    if (available < kHeaderBytes + length) break;
    inputOffset_ += kHeaderBytes + length;
    if (!handleMessage(data + kHeaderBytes, length)) return;
  }
  // Compact the buffer once everything read so far is consumed, or when the consumed
  // part dominates.
  if (inputOffset_ == input_.size()) {
    input_.clear();
    inputOffset_ = 0;
    if (input_.capacity() > 4 * kReadChunkBytes) input_.shrink_to_fit();
  } else if (inputOffset_ > kReadChunkBytes) {
    input_.erase(0, inputOffset_);
    inputOffset_ = 0;
  }
}

bool IpcConnection::handleMessage(const std::uint8_t* body, std::size_t size) {
  auto decoded = msgpack_codec::decode(body, size);
  if (!decoded) {
    fail("malformed message body: " + decoded.error());
    return false;
  }
  Array* message = decoded.value().asArray();
  std::uint64_t kind = 0, id = 0, code = 0, descriptorCount = 0;
  if (!message || message->size() != 5 || !headerField((*message)[0], kind) || !headerField((*message)[1], id) ||
      !headerField((*message)[2], code) || !(*message)[3].isArray() || !headerField((*message)[4], descriptorCount) ||
      kind > static_cast<std::uint64_t>(ipc::MessageKind::Reply) || code > 0xffff) {
    fail("malformed message: " + decoded->description().substr(0, 200));
    return false;
  }
  Array arguments = std::move(*(*message)[3].asArray());
  auto messageKind = static_cast<ipc::MessageKind>(kind);
  if (!helloReceived_) {
    if (messageKind != ipc::MessageKind::Hello) {
      fail(std::string("expected hello, got ") + ipc::messageKindName(messageKind));
      return false;
    }
    if (arguments.empty() || !arguments[0].isInteger() ||
        arguments[0].unsignedLongLongValue() != ipc::kProtocolVersion) {
      fail("unsupported protocol version " + (arguments.empty() ? std::string("(none)") : arguments[0].description()));
      return false;
    }
    helloReceived_ = true;
    helloTimer_.cancel();
    notePeerRefusal(arguments);
    return true;
  }
  switch (messageKind) {
    case ipc::MessageKind::Hello:
      // After the first hello only a refusal may come; the peer closes behind it.
      if (arguments.size() >= 2 && arguments[1].isString()) {
        notePeerRefusal(arguments);
        return true;
      }
      fail("second hello");
      return false;
    case ipc::MessageKind::Call:
    case ipc::MessageKind::CallNoReply:
      return handleCall(messageKind, id, static_cast<std::uint16_t>(code), std::move(arguments),
                        static_cast<std::size_t>(descriptorCount));
    case ipc::MessageKind::Reply: return handleReply(id, static_cast<std::uint16_t>(code), std::move(arguments));
  }
  return false;
}

bool IpcConnection::handleCall(ipc::MessageKind kind, std::uint64_t id, std::uint16_t code, Array arguments,
                               std::size_t descriptorCount) {
  const ipc::OperationInfo* info = ipc::operationInfo(code);
  if (!info || info->toDaemon != (side_ == Side::Daemon)) {
    fail("unknown operation " + std::to_string(code));
    return false;
  }
  std::string why;
  if (!ipc::checkArguments(info->arguments, arguments, why)) {
    fail(std::string("wrong arguments for ") + info->name + ": " + why);
    return false;
  }
  if (descriptorCount > info->maxDescriptors || descriptorCount > receivedDescriptors_.size()) {
    fail(std::string("wrong descriptor count for ") + info->name);
    return false;
  }
  IncomingCall call;
  call.operation = info->operation;
  call.arguments = std::move(arguments);
  for (std::size_t i = 0; i < descriptorCount; ++i) {
    call.descriptors.push_back(std::move(receivedDescriptors_.front()));
    receivedDescriptors_.pop_front();
  }
  if (kind == ipc::MessageKind::Call && info->hasReply) {
    auto replied = std::make_shared<std::atomic<bool>>(false);
    call.reply = [weak = weak_from_this(), id, code, replied](Array replyArguments) {
      if (replied->exchange(true)) return;
      if (auto self = weak.lock()) self->sendReply(id, code, std::move(replyArguments));
    };
  }
  if (callHandler_) callHandler_(call);
  return !finished_ && !refusing_;
}

bool IpcConnection::handleReply(std::uint64_t id, std::uint16_t code, Array arguments) {
  auto it = pendingReplies_.find(id);
  if (it == pendingReplies_.end()) {
    fail("reply to unknown call " + std::to_string(id));
    return false;
  }
  const ipc::OperationInfo* info = ipc::operationInfo(code);
  std::string why;
  if (!info || !ipc::checkArguments(info->replyArguments, arguments, why)) {
    fail("wrong reply for operation " + std::to_string(code) + (why.empty() ? "" : ": " + why));
    return false;
  }
  ReplyHandler handler = std::move(it->second);
  pendingReplies_.erase(it);
  handler(std::move(arguments));
  return !finished_ && !refusing_;
}

void IpcConnection::fail(const std::string& reason) {
  if (finished_) return;
  log::error("IpcConnection: closing connection %s: %s", description_, reason);
  finish(side_ == Side::Client);
}

void IpcConnection::peerClosed(bool midFrame) {
  if (finished_) return;
  if (!helloReceived_) peerClosedBeforeHello_ = true;
  // After a refusal what the peer still sent is left unread on purpose.
  if (midFrame && !refusing_) {
    log::error("IpcConnection: closing connection %s: the peer closed in the middle of a message", description_);
  } else {
    log::debug("IpcConnection: connection %s closed by the peer", description_);
  }
  finish(side_ == Side::Client);
}

void IpcConnection::invalidate() {
  queue_->async([self = shared_from_this()] { self->finish(false); });
}

void IpcConnection::refuse(const std::string& reason) {
  std::string hello =
      encodeFrame(ipc::MessageKind::Hello, 0, 0, Array{Value(ipc::kProtocolVersion), Value(reason)}, 0);
  auto refuseOnQueue = [self = shared_from_this(), hello = std::move(hello)]() mutable {
    if (self->finished_ || self->finishing_ || self->refusing_) return;
    self->refusing_ = true;
    // A connection that was never resumed stays unread: the refusal stands in for its
    // hello, and a later resume() does nothing.
    self->resumed_ = true;
    self->enqueueOnQueue(OutgoingFrame{std::move(hello), {}, 0});
    // The end comes after the task that refused, so that the reply it may still give
    // goes out behind the refusal.
    self->queue_->async([self] { self->finish(false); });
  };
  if (queue_->isCurrent()) {
    refuseOnQueue();
  } else {
    queue_->async(std::move(refuseOnQueue));
  }
}

std::optional<std::string> IpcConnection::peerRefusal() const {
  std::lock_guard<std::mutex> lock(refusalMutex_);
  return peerRefusal_;
}

void IpcConnection::notePeerRefusal(const Array& helloArguments) {
  if (helloArguments.size() < 2 || !helloArguments[1].isString()) return;
  std::string reason = *helloArguments[1].asString();
  log::info("IpcConnection: %s: the peer refuses the connection: %s", description_, reason);
  std::lock_guard<std::mutex> lock(refusalMutex_);
  peerRefusal_ = std::move(reason);
}

void IpcConnection::finish(bool interrupted) {
  if (finished_ || finishing_) return;
  finishing_ = true;
  // An explicit end still delivers what is already queued, as far as the socket takes
  // it without waiting (a failed write ends up here again and returns above).
  if (!interrupted && !writeWaiting_ && !output_.empty()) flushWrites();
  if (finished_.exchange(true)) return;
  std::error_code ignored;
  helloTimer_.cancel();
  socket_.close(ignored);
  pendingReplies_.clear();
  output_.clear();
  receivedDescriptors_.clear();
  input_.clear();
  inputOffset_ = 0;
  callHandler_ = nullptr;
  auto invalidation = std::move(invalidationHandler_);
  auto interruption = std::move(interruptionHandler_);
  invalidationHandler_ = nullptr;
  interruptionHandler_ = nullptr;
  if (interrupted) {
    if (interruption) interruption();
  } else if (invalidation) {
    invalidation();
  }
}

}  // namespace telvane
