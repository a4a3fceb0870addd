#include "client/TelvaneConnection.h"

#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "client/ClientErrors.h"
#include "platform/Log.h"
#include "platform/Paths.h"

namespace telvane {

std::shared_ptr<TelvaneConnection> TelvaneConnection::create(SessionSetup setup,
                                                             std::shared_ptr<SerialQueue> reportingQueue,
                                                             std::shared_ptr<TelvaneAggregationObject> exportedObject) {
  return std::shared_ptr<TelvaneConnection>(
      new TelvaneConnection(std::move(setup), std::move(reportingQueue), std::move(exportedObject)));
}

TelvaneConnection::TelvaneConnection(SessionSetup setup, std::shared_ptr<SerialQueue> reportingQueue,
                                     std::shared_ptr<TelvaneAggregationObject> exportedObject)
    : setup_(std::move(setup)),
      reportingQueue_(std::move(reportingQueue)),
      connectionQueue_(SerialQueue::create("com.zembra.Telvane.connection")),
      exportedObject_(std::move(exportedObject)) {}

int TelvaneConnection::sandboxLookupCheck(const std::string& socketPath) {
  if (::access(socketPath.c_str(), W_OK) == 0) return 0;
  const int error = errno;
  // A socket that does not exist yet is the daemon's business (it may be started on
  // demand); only one we may not use is refused here.
  return error == ENOENT ? 0 : error;
}

Status TelvaneConnection::open() {
  auto connection = connectAndConfigure();
  if (!connection) return statusError(connection.error());
  return statusOk();
}

Result<std::shared_ptr<IpcConnection>> TelvaneConnection::connectAndConfigure() {
  auto connected = IpcConnection::connect(ipcSocketPath(), connectionQueue_);
  if (!connected) return connected;
  std::shared_ptr<IpcConnection> connection = connected.value();
  auto pending = std::make_shared<PendingCalls>();
  std::uint64_t generation = 0;
  {
    std::lock_guard<std::mutex> lock(refusalMutex_);
    generation = ++connectionGeneration_;
    // A new connection is a new try after a daemon that closed without a reason.
    if (!refusalIsFinal_) refusal_.reset();
  }

  connection->setCallHandler([exported = exportedObject_](IpcConnection::IncomingCall& call) {
    if (call.operation != ipc::Operation::SendMessageToClient) return;
    const Array& a = call.arguments;
    exported->sendMessageToClient(a[0], a[1].doubleValue(), a[2].unsignedShortValue(), a[3].unsignedShortValue(),
                                  a[4]);
  });
  connection->setInvalidationHandler([pending] {
    log::info("initWithSessionInfo: IPC connection invalidated");
    {
      std::lock_guard<std::mutex> lock(pending->mutex);
      pending->ended = true;
      pending->lost.clear();
    }
    pending->changed.notify_all();
  });
  connection->setInterruptionHandler([pending, queue = reportingQueue_, weak = weak_from_this(), generation,
                                      weakConnection = std::weak_ptr<IpcConnection>(connection)] {
    log::info("initWithSessionInfo: IPC connection interrupted");
    // Known before the lost actions run, so that a completion told "no reply" can ask why.
    auto self = weak.lock();
    auto ended = weakConnection.lock();
    if (self && ended) self->noteConnectionEnded(generation, *ended);
    std::unordered_map<std::uint64_t, LostHandler> lost;
    {
      std::lock_guard<std::mutex> lock(pending->mutex);
      pending->ended = true;
      pending->interrupted = true;
      lost.swap(pending->lost);
    }
    // In the order the calls were made.
    std::vector<std::pair<std::uint64_t, LostHandler>> ordered(lost.begin(), lost.end());
    std::sort(ordered.begin(), ordered.end(), [](const auto& a, const auto& b) { return a.first < b.first; });
    for (auto& entry : ordered) {
      if (entry.second) queue->async(std::move(entry.second));
    }
    pending->changed.notify_all();
  });
  connection->resume();

  Value userInfo = setup_.userInfo.isDictionary() ? setup_.userInfo : Value();
  connection->call(ipc::Operation::SetSessionInfo,
                   Array{setup_.sessionInfo, userInfo, setup_.frameworksToCheck, Value(setup_.hasAggregationBlock)});
  current_ = connection;
  pending_ = std::move(pending);
  return connected;
}

Result<std::shared_ptr<IpcConnection>> TelvaneConnection::remote(Restore restore) {
  assertOnQueue(reportingQueue_);
  if (closed_) return Result<std::shared_ptr<IpcConnection>>::failure("the connection has been closed");
  // Asking again would only be refused again.
  if (auto refused = finalRefusal()) {
    return Result<std::shared_ptr<IpcConnection>>::failure("the daemon refused the session: " + *refused);
  }
  if (current_ && current_->isValid()) return Result<std::shared_ptr<IpcConnection>>::success(current_);
  auto connection = connectAndConfigure();
  if (!connection) return connection;
  log::info("remote: Reconnected to the daemon, restoring the session");
  restoreSession(connection.value(), restore);
  return connection;
}

void TelvaneConnection::restoreSession(const std::shared_ptr<IpcConnection>& connection, Restore restore) {
  if (digestKey_) send(connection, ipc::Operation::SetDigestKey, Array{Value(*digestKey_), Value(digestAlgorithm_)});
  auto onStates = [weak = weak_from_this()](Array reply) {
    auto self = weak.lock();
    if (self && self->restoredStatesHandler_) self->restoredStatesHandler_(std::move(reply));
  };
  if (started_ && restore != Restore::ExceptStart) {
    call(connection, ipc::Operation::StartConfig, Array{}, onStates, nullptr);
  }
  if (fetchedUserInfo_ && restore != Restore::ExceptFetch) {
    call(connection, ipc::Operation::FetchStates, Array{*fetchedUserInfo_}, onStates, nullptr);
  }
}

void TelvaneConnection::call(const std::shared_ptr<IpcConnection>& connection, ipc::Operation operation,
                             Array arguments, ReplyHandler onReply, LostHandler onLost,
                             std::vector<UniqueFd> descriptors) {
  assertOnQueue(reportingQueue_);
  auto pending = pending_;
  std::uint64_t id = 0;
  {
    std::lock_guard<std::mutex> lock(pending->mutex);
    if (pending->ended) {
      // The daemon went away after remote() handed out this connection.
      if (pending->interrupted && onLost) reportingQueue_->async(std::move(onLost));
      return;
    }
    id = pending->nextId++;
    pending->lost.emplace(id, std::move(onLost));
  }
  connection->call(
      operation, std::move(arguments),
      [pending, id, queue = reportingQueue_, onReply = std::move(onReply)](Array reply) {
        {
          std::lock_guard<std::mutex> lock(pending->mutex);
          if (pending->lost.erase(id) == 0) return;
        }
        if (onReply) queue->async([onReply, reply = std::move(reply)]() mutable { onReply(std::move(reply)); });
        // After the hand-over, so that a teardown that waited for this reply finds it
        // queued.
        pending->changed.notify_all();
      },
      std::move(descriptors));
}

void TelvaneConnection::send(const std::shared_ptr<IpcConnection>& connection, ipc::Operation operation,
                             Array arguments) {
  assertOnQueue(reportingQueue_);
  connection->call(operation, std::move(arguments));
}

void TelvaneConnection::noteStarted() {
  assertOnQueue(reportingQueue_);
  started_ = true;
}

void TelvaneConnection::noteFetchedUserInfo(const Value& userInfo) {
  assertOnQueue(reportingQueue_);
  fetchedUserInfo_ = userInfo.isDictionary() ? userInfo : Value();
}

void TelvaneConnection::noteDigestKey(const Bytes& key, std::int32_t algorithm) {
  assertOnQueue(reportingQueue_);
  digestKey_ = key;
  digestAlgorithm_ = algorithm;
}

void TelvaneConnection::setRestoredStatesHandler(ReplyHandler handler) { restoredStatesHandler_ = std::move(handler); }

void TelvaneConnection::waitForReplies(std::chrono::milliseconds timeout) {
  std::shared_ptr<PendingCalls> pending;
  reportingQueue_->sync([&] { pending = pending_; });
  if (!pending) return;
  std::unique_lock<std::mutex> lock(pending->mutex);
  pending->changed.wait_for(lock, timeout, [&] { return pending->ended || pending->lost.empty(); });
}

void TelvaneConnection::noteConnectionEnded(std::uint64_t generation, const IpcConnection& connection) {
  std::optional<std::string> reason = connection.peerRefusal();
  std::lock_guard<std::mutex> lock(refusalMutex_);
  if (reason) {
    log::info("initWithSessionInfo: The daemon refused the session: %s", *reason);
    refusal_ = std::move(reason);
    refusalIsFinal_ = true;
    return;
  }
  // An older connection ending late says nothing about the current one.
  if (refusalIsFinal_ || generation != connectionGeneration_ || !connection.peerClosedBeforeHello()) return;
  log::info("initWithSessionInfo: The daemon closed the connection before saying hello");
  refusal_ = kClosedBeforeHelloText;
}

std::optional<std::string> TelvaneConnection::finalRefusal() {
  // The refusal may have arrived with the daemon's close still on its way; it counts
  // from now on.
  std::optional<std::string> received = current_ ? current_->peerRefusal() : std::nullopt;
  std::lock_guard<std::mutex> lock(refusalMutex_);
  if (received && !refusalIsFinal_) {
    refusal_ = std::move(received);
    refusalIsFinal_ = true;
  }
  if (refusalIsFinal_) return refusal_;
  return std::nullopt;
}

std::optional<Error> TelvaneConnection::connectionError() const {
  std::lock_guard<std::mutex> lock(refusalMutex_);
  if (!refusal_) return std::nullopt;
  return client::makeError(Error::kCodeRefusedByDaemon, *refusal_);
}

void TelvaneConnection::close() {
  assertOnQueue(reportingQueue_);
  closed_ = true;
  // invalidate() runs on the connection queue after the writes of every call made so
  // far, which were queued there first.
  if (current_) current_->invalidate();
  restoredStatesHandler_ = nullptr;
}

}  // namespace telvane
