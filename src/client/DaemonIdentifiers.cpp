#include "client/DaemonIdentifiers.h"

#include <future>
#include <memory>
#include <optional>

#include "platform/IpcConnection.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/SerialQueue.h"

namespace telvane {

namespace {

const std::shared_ptr<SerialQueue>& identifierQueue() {
  static const std::shared_ptr<SerialQueue> kQueue = SerialQueue::create("com.zembra.Telvane.identifierQueue");
  return kQueue;
}

// Asks the daemon on a fresh connection; `name` is the operation's name in log lines.
std::string askDaemon(ipc::Operation operation, const char* name, bool respect) {
  auto answer = std::make_shared<std::promise<std::optional<std::string>>>();
  auto answered = std::make_shared<bool>(false);  // on the identifier queue
  std::future<std::optional<std::string>> result = answer->get_future();
  auto complete = [answer, answered](std::optional<std::string> value) {
    if (*answered) return;
    *answered = true;
    answer->set_value(std::move(value));
  };

  identifierQueue()->async([operation, name, respect, complete] {
    auto connected = IpcConnection::connect(ipcSocketPath(), identifierQueue());
    if (!connected) {
      log::error("%s: Failed to connect to daemon: %s", name, connected.error());
      complete(std::nullopt);
      return;
    }
    std::shared_ptr<IpcConnection> connection = connected.value();
    connection->setInvalidationHandler([complete] { complete(std::nullopt); });
    connection->setInterruptionHandler([complete] { complete(std::nullopt); });
    connection->resume();
    connection->call(operation, Array{Value(respect)}, [connection, complete](Array reply) {
      complete(!reply.empty() && reply[0].isString() ? std::optional<std::string>(*reply[0].asString())
                                                     : std::nullopt);
      connection->invalidate();
    });
    identifierQueue()->after(DaemonIdentifiers::kReplyTimeout, [weak = std::weak_ptr<IpcConnection>(connection)] {
      if (auto expired = weak.lock()) expired->invalidate();
    });
  });

  // The queue's own timer ends the connection after the time-out, which completes the
  // promise; the extra second only guards against a queue that no longer runs.
  if (result.wait_for(DaemonIdentifiers::kReplyTimeout + std::chrono::seconds(1)) != std::future_status::ready) {
    log::error("%s: The daemon did not answer", name);
    return {};
  }
  std::optional<std::string> value = result.get();
  if (!value) {
    log::error("%s: The daemon did not answer", name);
    return {};
  }
  return *value;
}

}  // namespace

std::string DaemonIdentifiers::get(bool respect) {
  return askDaemon(ipc::Operation::GetPersistentIdentifierForDNU, "getPersistentIdentifierForDNU", respect);
}

std::string DaemonIdentifiers::regenerate(bool respect) {
  return askDaemon(ipc::Operation::RegeneratePersistentIdentifierForDNU, "regeneratePersistentIdentifierForDNU",
                   respect);
}

}  // namespace telvane
