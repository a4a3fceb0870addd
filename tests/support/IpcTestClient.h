// IpcTestClient: the client end of an in-process connection pair, standing in for a
// client process. It calls the daemon's operations and waits for their replies with a
// deadline, and records what the daemon sends back (aggregated messages) and whether
// the daemon closed the connection.
//
// makeSocketPair() gives two connected Unix stream sockets; makeConnectionPair() wraps
// them in a daemon-side and a client-side IpcConnection, each on its own queue.
#pragma once

#include <chrono>
#include <condition_variable>
#include <memory>
#include <mutex>
#include <optional>
#include <utility>
#include <vector>

#include "platform/IpcConnection.h"
#include "platform/UniqueFd.h"
#include "telvane/Value.h"

namespace telvane::test {

std::pair<UniqueFd, UniqueFd> makeSocketPair();

struct ConnectionPair {
  std::shared_ptr<IpcConnection> daemon;
  std::shared_ptr<IpcConnection> client;
};
ConnectionPair makeConnectionPair();

class IpcTestClient {
 public:
  // Takes the client end (not resumed yet), installs its handlers and resumes it.
  explicit IpcTestClient(std::shared_ptr<IpcConnection> connection);
  // A client over one end of a socket pair.
  static std::unique_ptr<IpcTestClient> adopt(UniqueFd socket);
  ~IpcTestClient();

  // Calls an operation that replies and waits for the reply; nothing on timeout or
  // when the connection ends first.
  std::optional<Array> call(ipc::Operation operation, Array arguments, std::vector<UniqueFd> descriptors = {},
                            std::chrono::milliseconds timeout = std::chrono::seconds(10));
  // Calls an operation without reply.
  void send(ipc::Operation operation, Array arguments);
  // Closes the client's end (the daemon sees its connection invalidated).
  void close();

  // The arguments of every sendMessageToClient received so far.
  std::vector<Array> aggregatedMessages() const;
  bool waitForAggregatedMessages(std::size_t count, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;
  // True once the daemon ended the connection.
  bool disconnected() const;
  bool waitUntilDisconnected(std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

  const std::shared_ptr<IpcConnection>& connection() const { return connection_; }

 private:
  struct Shared {
    mutable std::mutex mutex;
    mutable std::condition_variable changed;
    std::vector<Array> aggregated;
    bool disconnected = false;
  };

  std::shared_ptr<IpcConnection> connection_;
  std::shared_ptr<Shared> shared_;
};

}  // namespace telvane::test
