#include "client/OneShotSender.h"

#include <atomic>

#include "client/ClientErrors.h"
#include "platform/IpcConnection.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "telvane/TelvaneKeys.h"

namespace telvane {

namespace {

// The outcome of one send: the reply handler runs once, with the reply or with none.
class OneShotOutcome {
 public:
  explicit OneShotOutcome(Telvane::OneShotReply handler) : handler_(std::move(handler)) {}
  void complete(const std::optional<std::string>& reply) {
    if (done_.exchange(true)) return;
    if (handler_) handler_(reply);
    handler_ = nullptr;
  }

 private:
  std::atomic<bool> done_{false};
  Telvane::OneShotReply handler_;  // used once, by whoever sets done_ first
};

}  // namespace

const std::shared_ptr<SerialQueue>& OneShotSender::queue() {
  static const std::shared_ptr<SerialQueue> kQueue = SerialQueue::create("com.zembra.Telvane.sendOneMessageQueue");
  return kQueue;
}

bool OneShotSender::send(const Value& sessionInfo, const Value& userInfo, std::uint16_t category, std::uint16_t type,
                         const Value& payload, Error* error, Telvane::OneShotReply replyHandler) {
  if (auto refused = client::validateSessionInfo(sessionInfo)) {
    if (error) *error = *refused;
    return false;
  }
  if (category == 0) {
    if (error) *error = client::makeError(Error::kCodeCategoryZero, "category 0 is reserved");
    return false;
  }
  // A single event is never batched.
  Value info = sessionInfo.deepCopy();
  info.asDictionary()->set(kTelvaneSessionInfoBatchEvent, Value(false));
  Value user = userInfo.isDictionary() ? userInfo.deepCopy() : Value();
  Value body = payload.isDictionary() ? payload.deepCopy() : Value();
  auto outcome = std::make_shared<OneShotOutcome>(std::move(replyHandler));

  queue()->async([info, user, body, category, type, outcome] {
    log::info("startLogging: Client starts logging...");
    auto connected = IpcConnection::connect(ipcSocketPath(), queue());
    if (!connected) {
      log::info("sendOneMessageWithSessionInfo: Failed to connect to daemon");
      log::debug("sendOneMessageWithSessionInfo: %s", connected.error());
      outcome->complete(std::nullopt);
      return;
    }
    std::shared_ptr<IpcConnection> connection = connected.value();
    // A daemon that refuses says why before it closes; without a reply that reason is
    // all the caller can learn.
    auto logRefusal = [weak = std::weak_ptr<IpcConnection>(connection)] {
      if (auto ended = weak.lock()) {
        if (auto reason = ended->peerRefusal()) {
          log::error("sendOneMessageWithSessionInfo: The daemon refused the session: %s", *reason);
        }
      }
    };
    connection->setInvalidationHandler([outcome, logRefusal] {
      log::info("sendOneMessageWithSessionInfo: IPC connection invalidated");
      logRefusal();
      outcome->complete(std::nullopt);
    });
    connection->setInterruptionHandler([outcome, logRefusal] {
      log::info("sendOneMessageWithSessionInfo: IPC connection interrupted");
      logRefusal();
      outcome->complete(std::nullopt);
    });
    connection->resume();
    // The reply handler holds the connection until the reply arrives or the connection
    // ends (which drops the handler); the timer bounds the wait.
    connection->call(ipc::Operation::SendMessageWithSessionInfo,
                     Array{info, user, Value(static_cast<unsigned>(category)), Value(static_cast<unsigned>(type)), body},
                     [connection, outcome](Array reply) {
                       outcome->complete(!reply.empty() && reply[0].isString()
                                             ? std::optional<std::string>(*reply[0].asString())
                                             : std::nullopt);
                       connection->invalidate();
                     });
    queue()->after(kReplyTimeout, [weak = std::weak_ptr<IpcConnection>(connection)] {
      if (auto expired = weak.lock()) expired->invalidate();
    });
  });
  return true;
}

}  // namespace telvane
