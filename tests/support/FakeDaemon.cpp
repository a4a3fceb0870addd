#include "support/FakeDaemon.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <stdexcept>

namespace telvane::test {

namespace {

constexpr const char* kSocketVariable = "TELVANED_SOCKET";

std::optional<Array> defaultReply(ipc::Operation operation) {
  switch (operation) {
    case ipc::Operation::StartConfig:
    case ipc::Operation::FetchStates: return Array{Value(), Value(), Value()};
    case ipc::Operation::FetchDisplayURL: return Array{Value("URL not available")};
    case ipc::Operation::SendMessageWithDictionary: return Array{Value()};
    case ipc::Operation::FlushMessages: return Array{Value(), Value()};
    case ipc::Operation::UploadFileAtPath: return Array{Value(true), Value(false)};
    case ipc::Operation::UploadLogData: return Array{Value(true), Value()};
    case ipc::Operation::SendMessageWithSessionInfo: return Array{Value("finished")};
    default: return std::nullopt;
  }
}

std::string readAll(int fd) {
  std::string contents;
  char buffer[4096];
  off_t offset = 0;
  for (;;) {
    ssize_t n = ::pread(fd, buffer, sizeof buffer, offset);
    if (n <= 0) break;
    contents.append(buffer, static_cast<std::size_t>(n));
    offset += n;
  }
  return contents;
}

}  // namespace

FakeDaemon::FakeDaemon()
    : socketPath_((dir_ / "telvaned.sock").string()), listenerQueue_(SerialQueue::create("fake.daemon.listener")) {
  if (const char* previous = std::getenv(kSocketVariable)) previousSocketVariable_ = previous;
  ::setenv(kSocketVariable, socketPath_.c_str(), 1);
  listener_ = IpcListener::create(listenerQueue_,
                                  [this](UniqueFd socket) { accept(std::move(socket)); });
  Status listening = listener_->listen(socketPath_);
  if (!listening) throw std::runtime_error("FakeDaemon: " + listening.error());
  listener_->resume();
}

FakeDaemon::~FakeDaemon() {
  // Stop accepting first, and wait until the listener's queue has passed that, so that
  // accept() never runs on a daemon that is gone.
  listener_->cancel();
  listenerQueue_->sync([] {});
  std::vector<std::shared_ptr<IpcConnection>> connections;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    connections.swap(connections_);
    responders_.clear();
  }
  for (auto& connection : connections) {
    connection->setCallHandler(nullptr);
    connection->setInvalidationHandler(nullptr);
    connection->invalidate();
  }
  for (auto& connection : connections) connection->queue()->sync([] {});
  listener_.reset();
  if (previousSocketVariable_) {
    ::setenv(kSocketVariable, previousSocketVariable_->c_str(), 1);
  } else {
    ::unsetenv(kSocketVariable);
  }
}

void FakeDaemon::accept(UniqueFd socket) {
  auto connection =
      IpcConnection::adopt(std::move(socket), SerialQueue::create("fake.daemon.connection"), IpcConnection::Side::Daemon);
  std::size_t index;
  std::optional<std::optional<std::string>> refusal;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    index = connections_.size();
    connections_.push_back(connection);
    ended_.push_back(refuseNew_.has_value());
    refusal = refuseNew_;
  }
  if (refusal) {
    if (*refusal) {
      connection->refuse(**refusal);
    } else {
      connection->invalidate();
    }
    changed_.notify_all();
    return;
  }
  connection->setCallHandler([this, index](IpcConnection::IncomingCall& call) { handle(index, call); });
  connection->setInvalidationHandler([this, index] {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      if (index < ended_.size()) ended_[index] = true;
    }
    changed_.notify_all();
  });
  connection->resume();
  changed_.notify_all();
}

void FakeDaemon::handle(std::size_t index, IpcConnection::IncomingCall& call) {
  Call recorded;
  recorded.connection = index;
  recorded.operation = call.operation;
  recorded.arguments = call.arguments;
  recorded.expectsReply = static_cast<bool>(call.reply);
  for (const UniqueFd& fd : call.descriptors) {
    recorded.descriptorContents.push_back(readAll(fd.get()));
    recorded.descriptorReadOnly.push_back((::fcntl(fd.get(), F_GETFL) & O_ACCMODE) == O_RDONLY);
    struct stat attributes {};
    recorded.descriptorFileTypes.push_back(::fstat(fd.get(), &attributes) == 0 ? (attributes.st_mode & S_IFMT) : 0u);
  }
  Responder responder;
  std::optional<std::string> refusal;
  std::shared_ptr<IpcConnection> connection;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    calls_.push_back(recorded);
    auto it = responders_.find(call.operation);
    if (it != responders_.end()) responder = it->second;
    auto refusing = refuseOnCall_.find(call.operation);
    if (refusing != refuseOnCall_.end()) {
      refusal = refusing->second;
      connection = connections_[index];
    }
  }
  changed_.notify_all();
  if (refusal) connection->refuse(*refusal);
  if (!call.reply) return;
  std::optional<Array> reply = responder ? responder(recorded) : defaultReply(call.operation);
  if (reply) call.reply(std::move(*reply));
}

void FakeDaemon::setReply(ipc::Operation operation, Array reply) {
  setResponder(operation, [reply](const Call&) { return std::optional<Array>(reply); });
}

void FakeDaemon::setResponder(ipc::Operation operation, Responder responder) {
  std::lock_guard<std::mutex> lock(mutex_);
  responders_[operation] = std::move(responder);
}

std::vector<FakeDaemon::Call> FakeDaemon::calls() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return calls_;
}

std::vector<FakeDaemon::Call> FakeDaemon::calls(ipc::Operation operation) const {
  std::vector<Call> matching;
  std::lock_guard<std::mutex> lock(mutex_);
  for (const Call& call : calls_) {
    if (call.operation == operation) matching.push_back(call);
  }
  return matching;
}

bool FakeDaemon::waitUntil(const std::function<bool(const std::vector<Call>&)>& predicate,
                           std::chrono::milliseconds timeout) const {
  std::unique_lock<std::mutex> lock(mutex_);
  return changed_.wait_for(lock, timeout, [&] { return predicate(calls_); });
}

bool FakeDaemon::waitForCalls(ipc::Operation operation, std::size_t count, std::chrono::milliseconds timeout) const {
  return waitUntil(
      [operation, count](const std::vector<Call>& calls) {
        std::size_t n = 0;
        for (const Call& call : calls) n += call.operation == operation ? 1 : 0;
        return n >= count;
      },
      timeout);
}

std::size_t FakeDaemon::connectionCount() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return connections_.size();
}

bool FakeDaemon::waitForDisconnect(std::size_t connection, std::chrono::milliseconds timeout) const {
  std::unique_lock<std::mutex> lock(mutex_);
  return changed_.wait_for(lock, timeout, [&] { return connection < ended_.size() && ended_[connection]; });
}

void FakeDaemon::sendMessageToClient(std::size_t connection, Array arguments) {
  std::shared_ptr<IpcConnection> target;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (connection < connections_.size()) target = connections_[connection];
  }
  if (target) target->call(ipc::Operation::SendMessageToClient, std::move(arguments));
}

void FakeDaemon::refuseNewConnections(std::optional<std::string> reason) {
  std::lock_guard<std::mutex> lock(mutex_);
  refuseNew_ = std::move(reason);
}

void FakeDaemon::acceptNewConnections() {
  std::lock_guard<std::mutex> lock(mutex_);
  refuseNew_.reset();
}

void FakeDaemon::refuseOnCall(ipc::Operation operation, std::string reason) {
  std::lock_guard<std::mutex> lock(mutex_);
  refuseOnCall_[operation] = std::move(reason);
}

void FakeDaemon::dropConnections() {
  std::vector<std::shared_ptr<IpcConnection>> open;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    open = connections_;
  }
  for (auto& connection : open) connection->invalidate();
  // Each connection's end has run once its queue has passed the invalidation.
  for (auto& connection : open) connection->queue()->sync([] {});
}

}  // namespace telvane::test
