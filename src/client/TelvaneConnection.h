// TelvaneConnection: a Telvane object's link to the daemon, across daemon restarts.
//
// It owns the current IPC connection, exports the client's aggregation object on it,
// and tracks the calls that wait for a reply. A daemon that goes away interrupts the
// connection: the calls still waiting are answered with their "lost" action instead
// of a reply, and the next call makes a new connection. A new connection first tells
// the new daemon-side session what the old one knew: setSessionInfo with the same
// maps, the digest key, the start and the latest fetched user information (the
// replies of these restoring calls refresh the cached lists through the restored-states
// handler; they never call a client's completion).
//
// Refusal: a daemon that refuses the session says why before it closes (see
// IpcConnection::refuse). The reason is kept and the calls still waiting are lost at
// once; after such a refusal no new connection is made. A daemon that closes a
// connection before saying hello (one that refuses without a reason) counts as a
// refusal too, but the next call tries a new connection.
//
// Threading: open() runs once on the creating thread before any other use;
// connectionError() may be called from any thread; every other member function runs on
// the reporting queue (asserted in debug builds).
// Replies and lost actions are handed to the reporting queue. The IPC connection
// itself runs on the connection queue, which also runs the aggregation object.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "client/TelvaneAggregationObject.h"
#include "platform/IpcConnection.h"
#include "platform/Result.h"
#include "platform/SerialQueue.h"
#include "platform/UniqueFd.h"
#include "telvane/Error.h"
#include "telvane/Value.h"

namespace telvane {

class TelvaneConnection : public std::enable_shared_from_this<TelvaneConnection> {
 public:
  // What setSessionInfo tells the daemon; sent again on every new connection.
  struct SessionSetup {
    Value sessionInfo;
    Value userInfo;
    Value frameworksToCheck;
    bool hasAggregationBlock = false;
  };
  using ReplyHandler = std::function<void(Array arguments)>;
  using LostHandler = std::function<void()>;
  // The description of the refusal by a daemon that closed before saying hello.
  static constexpr const char* kClosedBeforeHelloText = "the daemon closed the connection";

  // Which part of the session state the call that triggers a reconnection restores
  // itself, so that it is not sent twice.
  enum class Restore { All, ExceptStart, ExceptFetch };

  static std::shared_ptr<TelvaneConnection> create(SessionSetup setup, std::shared_ptr<SerialQueue> reportingQueue,
                                                   std::shared_ptr<TelvaneAggregationObject> exportedObject);

  // The sandbox look-up check for the service socket: 0 when the process may use it
  // (also when it does not exist yet), else the errno of access(2).
  static int sandboxLookupCheck(const std::string& socketPath);

  // Connects to the daemon's socket and says setSessionInfo. Creation thread only.
  Status open();

  // The live connection, reconnecting and restoring the session when the daemon went
  // away. Fails when no connection can be made or after close().
  Result<std::shared_ptr<IpcConnection>> remote(Restore restore = Restore::All);

  // A call that expects a reply: exactly one of onReply (with the reply's arguments)
  // and onLost (the daemon went away first) runs later on the reporting queue; neither
  // runs once close() ended the connection.
  void call(const std::shared_ptr<IpcConnection>& connection, ipc::Operation operation, Array arguments,
            ReplyHandler onReply, LostHandler onLost, std::vector<UniqueFd> descriptors = {});
  // A call without reply.
  void send(const std::shared_ptr<IpcConnection>& connection, ipc::Operation operation, Array arguments);

  // Session state to restore on a new connection.
  void noteStarted();
  void noteFetchedUserInfo(const Value& userInfo);
  void noteDigestKey(const Bytes& key, std::int32_t algorithm);
  // Receives the reply arguments of restoring start and fetch calls (on the reporting
  // queue). Set before the first call.
  void setRestoredStatesHandler(ReplyHandler handler);

  // Waits until every call made so far has had its reply (or the connection ended),
  // at most for the timeout. Not on the reporting or the connection queue.
  void waitForReplies(std::chrono::milliseconds timeout);

  // Ends the connection once the calls made so far are written; no reconnection
  // afterwards.
  void close();

  // Why the daemon refused the session: an error of code Error::kCodeRefusedByDaemon
  // with the daemon's reason, or kClosedBeforeHelloText, as soon as the connection has
  // ended that way (before the lost actions of its calls run). None otherwise, and
  // again once a new connection follows a close before hello. Any thread.
  std::optional<Error> connectionError() const;

  const std::shared_ptr<SerialQueue>& connectionQueue() const { return connectionQueue_; }

 private:
  // The calls of one IPC connection that wait for their reply.
  struct PendingCalls {
    std::mutex mutex;
    std::condition_variable changed;  // a reply came or the connection ended
    std::unordered_map<std::uint64_t, LostHandler> lost;  // guarded by mutex
    std::uint64_t nextId = 1;                             // guarded by mutex
    bool interrupted = false;                             // guarded by mutex
    bool ended = false;                                   // guarded by mutex
  };

  TelvaneConnection(SessionSetup setup, std::shared_ptr<SerialQueue> reportingQueue,
                    std::shared_ptr<TelvaneAggregationObject> exportedObject);

  // Makes and resumes a new IPC connection with the handlers, then says setSessionInfo.
  Result<std::shared_ptr<IpcConnection>> connectAndConfigure();
  void restoreSession(const std::shared_ptr<IpcConnection>& connection, Restore restore);
  // Keeps what the end of the connection of the generation says about a refusal
  // (connection queue, before the lost actions are handed over).
  void noteConnectionEnded(std::uint64_t generation, const IpcConnection& connection);
  // The daemon's reason when it refused for good: kept from an ended connection, or
  // already received on the current one, which is kept from then on (reporting queue).
  std::optional<std::string> finalRefusal();

  // Constant after construction.
  const SessionSetup setup_;
  const std::shared_ptr<SerialQueue> reportingQueue_;
  const std::shared_ptr<SerialQueue> connectionQueue_;
  const std::shared_ptr<TelvaneAggregationObject> exportedObject_;

  // On the reporting queue (and in open(), before the queue is used).
  std::shared_ptr<IpcConnection> current_;
  std::shared_ptr<PendingCalls> pending_;
  bool closed_ = false;
  bool started_ = false;
  std::optional<Value> fetchedUserInfo_;
  std::optional<Bytes> digestKey_;
  std::int32_t digestAlgorithm_ = 0;
  ReplyHandler restoredStatesHandler_;

  // Written when a connection is made (reporting queue) and when it ends (connection
  // queue); read from any thread.
  mutable std::mutex refusalMutex_;
  std::uint64_t connectionGeneration_ = 0;  // guarded by refusalMutex_; the latest connection's
  std::optional<std::string> refusal_;      // guarded by refusalMutex_
  bool refusalIsFinal_ = false;             // guarded by refusalMutex_; the daemon gave a reason
};

}  // namespace telvane
