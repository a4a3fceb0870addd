// IpcConnection: one end of a client–daemon connection over a Unix stream socket.
//
// It frames MessagePack messages (see IpcProtocol.h), says hello first and expects
// the peer's hello before anything else, checks every incoming call against the
// operation table, matches replies to calls by id, and passes file descriptors with
// calls. Each reply handler runs at most once; replies still pending when the
// connection ends are dropped without being called.
//
// Refusal: refuse() tells the peer why this side ends the connection (a hello carrying
// the reason, see IpcProtocol.h) and then ends it. On the receiving side the reason is
// kept (peerRefusal()) and the connection reads on until the peer closes, so replies
// sent before the refusal's close are still delivered; the owner reads the reason in
// its interruption or invalidation handler.
//
// Anything the peer sends that breaks the protocol (a frame over kMaxMessageBytes, a
// body that is not MessagePack, an unknown operation, wrong argument types, a close
// in the middle of a frame, no hello in time) ends this connection with an
// error-level log line; nothing else is affected.
//
// End of connection: explicit invalidate() on either side, and end of file or an error
// on the daemon side, run the invalidation handler. On the client side a daemon that
// goes away runs the interruption handler; the owner makes a new connection on its next
// call. Either way the connection is finished and never used again; each handler runs
// at most once, on the queue, and both are dropped afterwards (they may capture the
// owner).
//
// Threading: all state lives on the connection's serial queue. Public functions may be
// called from any thread; incoming calls, replies and handlers run on the queue.
#pragma once

#include <sys/types.h>

#include <asio/posix/stream_descriptor.hpp>
#include <asio/steady_timer.hpp>

#include <atomic>
#include <chrono>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <unordered_map>
#include <vector>

#include "platform/IpcProtocol.h"
#include "platform/Result.h"
#include "platform/SerialQueue.h"
#include "platform/UniqueFd.h"
#include "telvane/Value.h"

namespace telvane {

struct PeerCredentials {
  pid_t pid = 0;
  uid_t uid = 0;
  gid_t gid = 0;
  std::vector<gid_t> groups;  // supplementary groups, when the kernel tells them
};

class IpcConnection : public std::enable_shared_from_this<IpcConnection> {
 public:
  using ReplyHandler = std::function<void(Array arguments)>;

  // A call from the peer. `reply` is empty when the peer gave no reply block or the
  // operation has none; otherwise it sends the reply (at most once, from any thread).
  struct IncomingCall {
    ipc::Operation operation = ipc::Operation::None;
    Array arguments;
    std::vector<UniqueFd> descriptors;
    ReplyHandler reply;
  };
  using CallHandler = std::function<void(IncomingCall& call)>;

  enum class Side { Daemon, Client };

  // Takes over a connected socket (the daemon's accepted connections, tests' socket
  // pairs). The connection does nothing until resume().
  static std::shared_ptr<IpcConnection> adopt(UniqueFd socket, std::shared_ptr<SerialQueue> queue, Side side);
  // Connects to the daemon's socket at `path`.
  static Result<std::shared_ptr<IpcConnection>> connect(const std::string& path, std::shared_ptr<SerialQueue> queue);

  ~IpcConnection();
  IpcConnection(const IpcConnection&) = delete;
  IpcConnection& operator=(const IpcConnection&) = delete;

  // Set the handlers before resume().
  void setCallHandler(CallHandler handler);
  void setInvalidationHandler(std::function<void()> handler);
  void setInterruptionHandler(std::function<void()> handler);

  // How long the peer may take to say hello (default ipc::kHelloTimeoutSeconds).
  // Call before resume().
  void setHelloTimeout(std::chrono::milliseconds timeout) { helloTimeout_ = timeout; }

  // Sends the hello and starts reading.
  void resume();

  // Calls an operation of the peer. With a reply handler the peer is asked for a
  // reply, which arrives on the queue; without one it is a call without reply.
  // Descriptors are closed here once sent. Calls on a finished connection are
  // dropped (debug log).
  void call(ipc::Operation operation, Array arguments, ReplyHandler onReply = nullptr,
            std::vector<UniqueFd> descriptors = {});

  // Ends the connection (see above). Idempotent.
  void invalidate();
  // Tells the peer why, then ends the connection like invalidate(). Never resumed: the
  // refusal is the only thing this side says (nothing is read). Resumed: the refusal
  // follows what is already queued, calls from the peer that have not been handled yet
  // are dropped, and a reply given on the queue before the end still goes out (a session
  // that refuses itself answers the call that made it do so). Later calls of refuse()
  // or invalidate() do nothing more.
  void refuse(const std::string& reason);
  // False once the connection has ended (for whatever reason).
  bool isValid() const { return !finished_.load(); }
  // The reason the peer gave when it refused the connection; none when it did not.
  // Set before the handlers run.
  std::optional<std::string> peerRefusal() const;
  // True when the peer closed the connection before it said hello (a peer that ends a
  // connection it never accepted, without saying why). Set before the handlers run.
  bool peerClosedBeforeHello() const { return peerClosedBeforeHello_.load(); }

  const PeerCredentials& peer() const { return peer_; }
  // "pid 123 uid 1000" on the daemon side, the socket path on the client side.
  const std::string& description() const { return description_; }
  const std::shared_ptr<SerialQueue>& queue() const { return queue_; }

 private:
  struct OutgoingFrame {
    std::string bytes;
    std::vector<UniqueFd> descriptors;
    std::size_t offset = 0;
  };

  IpcConnection(UniqueFd socket, std::shared_ptr<SerialQueue> queue, Side side, std::string description);

  static std::string encodeFrame(ipc::MessageKind kind, std::uint64_t id, std::uint16_t operation,
                                 const Array& arguments, std::size_t descriptorCount);
  void enqueueOnQueue(OutgoingFrame frame);
  void waitReadable();
  void onReadable();
  void parseFrames();
  bool handleMessage(const std::uint8_t* body, std::size_t size);
  bool handleCall(ipc::MessageKind kind, std::uint64_t id, std::uint16_t code, Array arguments,
                  std::size_t descriptorCount);
  bool handleReply(std::uint64_t id, std::uint16_t code, Array arguments);
  // Keeps the refusal text of a hello's arguments, when there is one.
  void notePeerRefusal(const Array& helloArguments);
  void flushWrites();
  void waitWritable();
  void sendReply(std::uint64_t id, std::uint16_t code, Array arguments);
  // Ends the connection after a protocol violation or I/O error, logging the reason.
  void fail(const std::string& reason);
  // The peer closed its end (cleanly, when `midFrame` is false).
  void peerClosed(bool midFrame);
  void finish(bool interrupted);

  // Constant after construction.
  const std::shared_ptr<SerialQueue> queue_;
  const Side side_;
  PeerCredentials peer_;
  std::string description_;

  std::chrono::milliseconds helloTimeout_{std::chrono::seconds(ipc::kHelloTimeoutSeconds)};
  std::atomic<bool> finished_{false};
  std::atomic<std::uint64_t> nextId_{1};
  std::atomic<bool> peerClosedBeforeHello_{false};

  mutable std::mutex refusalMutex_;
  std::optional<std::string> peerRefusal_;  // guarded by refusalMutex_

  // Everything below lives on queue_.
  asio::posix::stream_descriptor socket_;
  asio::steady_timer helloTimer_;
  CallHandler callHandler_;
  std::function<void()> invalidationHandler_;
  std::function<void()> interruptionHandler_;
  bool resumed_ = false;
  bool helloReceived_ = false;
  bool writeWaiting_ = false;
  bool finishing_ = false;
  // This side has refused the connection: nothing more from the peer is handled.
  bool refusing_ = false;
  std::string input_;
  std::size_t inputOffset_ = 0;
  std::deque<UniqueFd> receivedDescriptors_;
  std::deque<OutgoingFrame> output_;
  std::unordered_map<std::uint64_t, ReplyHandler> pendingReplies_;
};

// Reads the peer's credentials of a connected Unix socket.
PeerCredentials readPeerCredentials(int socket);

}  // namespace telvane
