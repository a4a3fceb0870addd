// ConcurrentQueue: a labelled work queue whose items run in parallel.
//
// Work submitted with async() starts on one of the queue's own worker threads as soon
// as one is free, in submission order but without waiting for earlier items to end.
// The pool is elastic: when every worker is busy a new one is started, up to
// maxThreads (then work waits for a worker); a worker that has had nothing to do for
// kIdleThreadLifetime ends. So work that blocks for a long time (or for ever) only
// costs its own thread and never starves other work, neither of this queue nor of the
// process-wide executors, which is why this queue does not run on them.
//
// Priority: the workers run at the process's normal scheduling priority, which is what
// the user-initiated quality-of-service class comes to on Linux.
//
// Ownership: held by std::shared_ptr. Work already submitted still runs after the
// owner released the queue; the workers end once the queue is released and empty.
// The workers are detached, so releasing the queue never waits for them: a worker
// stuck in an item that never returns stays stuck, and ends when the item returns.
// What an item touches must therefore be kept alive by the item itself.
//
// Threading: every member function may be called from any thread, also from an item.
#pragma once

#include <chrono>
#include <cstddef>
#include <functional>
#include <memory>
#include <string>

namespace telvane {

class ConcurrentQueue {
 public:
  static constexpr std::size_t kMaxThreads = 64;
  static constexpr std::chrono::seconds kIdleThreadLifetime{5};

  static std::shared_ptr<ConcurrentQueue> create(std::string label, std::size_t maxThreads = kMaxThreads);
  // Lets the workers end once the work submitted so far has run.
  ~ConcurrentQueue();
  ConcurrentQueue(const ConcurrentQueue&) = delete;
  ConcurrentQueue& operator=(const ConcurrentQueue&) = delete;

  void async(std::function<void()> work);

  const std::string& label() const { return label_; }
  // The workers alive now (busy or idle).
  std::size_t threadCount() const;

 private:
  struct Shared;

  ConcurrentQueue(std::string label, std::size_t maxThreads);
  static void workerMain(std::shared_ptr<Shared> shared);

  // Constant after construction.
  const std::string label_;
  const std::shared_ptr<Shared> shared_;
};

}  // namespace telvane
