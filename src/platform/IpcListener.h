// IpcListener: the daemon's listening Unix socket for the service "com.zembra.telvaned".
//
// Under socket activation (a descriptor handed over by the service manager through
// LISTEN_FDS/LISTEN_PID) the listener uses that socket; otherwise it binds the path
// itself, replacing a stale socket file left by an earlier run, and makes it
// accessible to every local user (the entitlement policy decides who may stay).
// Each accepted connection is handed to the accept handler on the listener's queue.
//
// Threading: state lives on the listener's queue; listen() and cancel() may be called
// from any thread.
#pragma once

#include <asio/posix/stream_descriptor.hpp>

#include <functional>
#include <memory>
#include <string>

#include "platform/Result.h"
#include "platform/SerialQueue.h"
#include "platform/UniqueFd.h"

namespace telvane {

class IpcListener : public std::enable_shared_from_this<IpcListener> {
 public:
  using AcceptHandler = std::function<void(UniqueFd connection)>;

  static std::shared_ptr<IpcListener> create(std::shared_ptr<SerialQueue> queue, AcceptHandler handler);
  ~IpcListener();
  IpcListener(const IpcListener&) = delete;
  IpcListener& operator=(const IpcListener&) = delete;

  // Takes the activation socket when there is one, else binds `path`. Does not accept
  // yet.
  Status listen(const std::string& path);
  // Starts accepting.
  void resume();
  // Stops accepting and closes the socket (and removes the socket file it bound).
  void cancel();

  bool socketActivated() const { return socketActivated_; }
  const std::string& path() const { return path_; }

 private:
  IpcListener(std::shared_ptr<SerialQueue> queue, AcceptHandler handler);
  void waitForConnections();
  void acceptPending();

  const std::shared_ptr<SerialQueue> queue_;
  const AcceptHandler handler_;
  // Set by listen(), before resume(); then read only.
  std::string path_;
  bool socketActivated_ = false;
  bool boundPath_ = false;
  // On the queue.
  asio::posix::stream_descriptor socket_;
  bool canceled_ = false;
};

}  // namespace telvane
