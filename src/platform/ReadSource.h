// ReadSource: runs a handler on a serial queue whenever a descriptor is readable.
//
// The handler is expected to read what is there (for a datagram socket, typically one
// datagram per call). Readiness is level-triggered: while unread data remains, the
// handler is called again, one call at a time on the queue; a peer that has closed
// its end keeps the descriptor readable, so the handler must then cancel the source.
//
// The descriptor is not owned: the source never closes it. cancel() stops the
// source, takes the descriptor out of the event loop at once, and then runs the cancel
// action exactly once on the queue; that is where the owner closes the descriptor.
// cancel() may be called from any thread and is idempotent; called on the queue, no
// handler call follows it.
//
// Release without cancel: when the last reference goes without cancel(), the source
// stops silently and the cancel action does NOT run, so the descriptor stays open and
// remains the owner's to close. Owners cancel explicitly in their clean-up.
//
// Ownership: held by std::shared_ptr; a pending wait holds only a weak reference, the
// cancel action a strong one until it has run. The queue's executor must outlive it.
//
// Threading: all member functions are thread-safe; handlers run on the queue only.
#pragma once

#include "platform/SerialQueue.h"

#include <asio/posix/stream_descriptor.hpp>

#include <functional>
#include <memory>
#include <mutex>

namespace telvane {

class ReadSource : public std::enable_shared_from_this<ReadSource> {
 public:
  using Handler = std::function<void()>;

  // A suspended source for the descriptor, or nullptr (logged) when the descriptor
  // cannot be watched (negative, or refused by the event loop).
  static std::shared_ptr<ReadSource> create(std::shared_ptr<SerialQueue> queue, int fd, Handler handler);
  ~ReadSource();
  ReadSource(const ReadSource&) = delete;
  ReadSource& operator=(const ReadSource&) = delete;

  // The action run once on the queue after cancel(). Ignored after cancel().
  void setCancelHandler(Handler cancelHandler);
  // Starts watching (first call only; later calls do nothing).
  void resume();
  void cancel();
  bool isCanceled() const;

  int descriptor() const { return fd_; }
  const std::shared_ptr<SerialQueue>& queue() const { return queue_; }

 private:
  ReadSource(std::shared_ptr<SerialQueue> queue, int fd, Handler handler);
  void waitLocked();
  void readable(const std::error_code& error);

  // Constant after construction.
  const std::shared_ptr<SerialQueue> queue_;
  const int fd_;

  mutable std::mutex mutex_;
  // Everything below is guarded by mutex_ (the descriptor object included).
  asio::posix::stream_descriptor stream_;  // released, never closed, by this source
  std::shared_ptr<const Handler> handler_;  // shared so that a running call keeps it
  Handler cancelHandler_;
  bool resumed_ = false;
  bool canceled_ = false;
};

}  // namespace telvane
