#include "support/IpcTestClient.h"

#include <sys/socket.h>

#include <future>

#include "platform/SerialQueue.h"

namespace telvane::test {

std::pair<UniqueFd, UniqueFd> makeSocketPair() {
  int fds[2] = {-1, -1};
  if (::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, fds) != 0) return {};
  return {UniqueFd(fds[0]), UniqueFd(fds[1])};
}

ConnectionPair makeConnectionPair() {
  auto [daemonEnd, clientEnd] = makeSocketPair();
  ConnectionPair pair;
  pair.daemon = IpcConnection::adopt(std::move(daemonEnd), SerialQueue::create("test.session"),
                                     IpcConnection::Side::Daemon);
  pair.client =
      IpcConnection::adopt(std::move(clientEnd), SerialQueue::create("test.client"), IpcConnection::Side::Client);
  return pair;
}

IpcTestClient::IpcTestClient(std::shared_ptr<IpcConnection> connection)
    : connection_(std::move(connection)), shared_(std::make_shared<Shared>()) {
  auto shared = shared_;
  connection_->setCallHandler([shared](IpcConnection::IncomingCall& call) {
    if (call.operation != ipc::Operation::SendMessageToClient) return;
    std::lock_guard<std::mutex> lock(shared->mutex);
    shared->aggregated.push_back(call.arguments);
    shared->changed.notify_all();
  });
  auto ended = [shared] {
    std::lock_guard<std::mutex> lock(shared->mutex);
    shared->disconnected = true;
    shared->changed.notify_all();
  };
  connection_->setInterruptionHandler(ended);
  connection_->setInvalidationHandler(ended);
  connection_->resume();
}

std::unique_ptr<IpcTestClient> IpcTestClient::adopt(UniqueFd socket) {
  return std::make_unique<IpcTestClient>(
      IpcConnection::adopt(std::move(socket), SerialQueue::create("test.client"), IpcConnection::Side::Client));
}

IpcTestClient::~IpcTestClient() { connection_->invalidate(); }

std::optional<Array> IpcTestClient::call(ipc::Operation operation, Array arguments,
                                         std::vector<UniqueFd> descriptors, std::chrono::milliseconds timeout) {
  auto promise = std::make_shared<std::promise<Array>>();
  auto future = promise->get_future();
  connection_->call(
      operation, std::move(arguments), [promise](Array reply) { promise->set_value(std::move(reply)); },
      std::move(descriptors));
  if (future.wait_for(timeout) != std::future_status::ready) return std::nullopt;
  return future.get();
}

void IpcTestClient::send(ipc::Operation operation, Array arguments) {
  connection_->call(operation, std::move(arguments));
}

void IpcTestClient::close() { connection_->invalidate(); }

std::vector<Array> IpcTestClient::aggregatedMessages() const {
  std::lock_guard<std::mutex> lock(shared_->mutex);
  return shared_->aggregated;
}

bool IpcTestClient::waitForAggregatedMessages(std::size_t count, std::chrono::milliseconds timeout) const {
  std::unique_lock<std::mutex> lock(shared_->mutex);
  return shared_->changed.wait_for(lock, timeout, [&] { return shared_->aggregated.size() >= count; });
}

bool IpcTestClient::disconnected() const {
  std::lock_guard<std::mutex> lock(shared_->mutex);
  return shared_->disconnected;
}

bool IpcTestClient::waitUntilDisconnected(std::chrono::milliseconds timeout) const {
  std::unique_lock<std::mutex> lock(shared_->mutex);
  return shared_->changed.wait_for(lock, timeout, [&] { return shared_->disconnected; });
}

}  // namespace telvane::test
