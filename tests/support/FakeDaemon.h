// FakeDaemon: a stand-in for telvaned in client tests.
//
// It listens on a socket in a temporary folder, points TELVANED_SOCKET of the test
// process (and so of the processes it starts) at it, records every call a client
// makes (operation, arguments, and what the passed descriptors hold), and answers
// with scripted replies. Tests can drop every connection from the daemon side (the
// client sees the daemon go away), refuse connections as the daemon does (with its
// reason at accept, or when a session makes a given call), and call the client's
// exported object.
//
// Default replies: the three state queries (nil, nil, nil), the display URL
// "URL not available", a send nil, a flush (nil, nil), a file upload true, a log-data
// upload (true, nil), a one-shot send "finished".
//
// Threading: thread-safe; calls are recorded on the connections' queues.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/IpcConnection.h"
#include "platform/IpcListener.h"
#include "support/TempDir.h"

namespace telvane::test {

class FakeDaemon {
 public:
  struct Call {
    std::size_t connection = 0;  // index of the connection, in the order of accepting
    ipc::Operation operation = ipc::Operation::None;
    Array arguments;
    bool expectsReply = false;
    // For each descriptor passed with the call: its contents and whether it was open
    // for reading only.
    std::vector<std::string> descriptorContents;
    std::vector<bool> descriptorReadOnly;
    // The file type bits (S_IFMT) of what each descriptor refers to.
    std::vector<unsigned> descriptorFileTypes;
  };
  // The reply arguments for a call; none to leave the call unanswered.
  using Responder = std::function<std::optional<Array>(const Call&)>;

  FakeDaemon();
  ~FakeDaemon();
  FakeDaemon(const FakeDaemon&) = delete;
  FakeDaemon& operator=(const FakeDaemon&) = delete;

  const std::string& socketPath() const { return socketPath_; }

  void setReply(ipc::Operation operation, Array reply);
  void setResponder(ipc::Operation operation, Responder responder);

  std::vector<Call> calls() const;
  std::vector<Call> calls(ipc::Operation operation) const;
  // Waits until the predicate holds for the recorded calls; false at the deadline.
  bool waitUntil(const std::function<bool(const std::vector<Call>&)>& predicate,
                 std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;
  bool waitForCalls(ipc::Operation operation, std::size_t count,
                    std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

  std::size_t connectionCount() const;
  // Waits until the client of the connection has closed it; the daemon has read all
  // the client sent by then.
  bool waitForDisconnect(std::size_t connection, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;
  // Calls sendMessageToClient on the client of the connection.
  void sendMessageToClient(std::size_t connection, Array arguments);
  // Ends every connection from the daemon side; the listener stays.
  void dropConnections();
  // Refuses the connections accepted from now on, telling the client the reason; with
  // none, closes them before saying hello (a daemon that refuses without a reason).
  // Refused connections count in connectionCount() and make no calls.
  void refuseNewConnections(std::optional<std::string> reason);
  void acceptNewConnections();
  // A connection that makes this call refuses itself with the reason while it handles
  // the call (after recording it, before any reply), as a session over its limit does.
  void refuseOnCall(ipc::Operation operation, std::string reason);

 private:
  void accept(UniqueFd socket);
  void handle(std::size_t index, IpcConnection::IncomingCall& call);

  TempDir dir_;
  std::string socketPath_;
  std::shared_ptr<SerialQueue> listenerQueue_;
  std::optional<std::string> previousSocketVariable_;
  std::shared_ptr<IpcListener> listener_;

  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  std::vector<std::shared_ptr<IpcConnection>> connections_;  // guarded by mutex_
  std::vector<Call> calls_;                                  // guarded by mutex_
  std::vector<bool> ended_;                                  // guarded by mutex_; per connection
  std::map<ipc::Operation, Responder> responders_;           // guarded by mutex_
  // Guarded by mutex_: set while new connections are refused (the reason, or none for
  // a close before hello).
  std::optional<std::optional<std::string>> refuseNew_;
  std::map<ipc::Operation, std::string> refuseOnCall_;  // guarded by mutex_
};

}  // namespace telvane::test
