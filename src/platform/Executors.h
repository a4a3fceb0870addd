// Executor and Executors: the thread pools that run all of the daemon's work.
//
// An Executor is one asio::io_context with a fixed number of worker threads that run
// it until stop(). Serial queues (SerialQueue) schedule their work on an Executor, and
// timer sources, read sources and sockets are asio I/O objects of its io_context;
// nothing in the daemon runs work on a thread it made itself.
//
// The process has two executors, created on first use:
// - Executors::main(): connections, sessions, backends and the agent. Its size is
//   max(2, hardware threads), or TELVANED_WORKER_THREADS when that is a number from 1
//   to kMaxWorkerThreads.
// - Executors::network(): the connectivity helpers and the HTTP engine, two threads.
//   Several session operations block their queue until an HTTP completion arrives;
//   because those completions run here and never need a thread of the main pool, a
//   main pool full of blocked sessions cannot starve them. (Waiting in sync() for
//   another queue needs no second thread at all: see SerialQueue.) Queues that deliver
//   such completions belong on this executor, not on the main one.
//
// Lifetime: the two process-wide executors are never destroyed, so queues and
// sources that outlive static destruction stay valid. At exit (or at stopAll()) their
// workers are stopped; work that has not started by then never runs. A private
// Executor (tests, tools) must outlive every queue, timer source and read source made
// on it; its destructor stops it and drops the work that has not run.
//
// Threading: all member functions are thread-safe. stop() must not be called from a
// task that another worker is waiting on.
#pragma once

#include <asio/io_context.hpp>
#include <asio/executor_work_guard.hpp>

#include <chrono>
#include <condition_variable>
#include <cstddef>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

namespace telvane {

class Executor {
 public:
  // Starts `threadCount` workers at once (at least one). The name labels the threads
  // ("<name>-<index>", cut to the kernel's 15 characters).
  Executor(std::string name, std::size_t threadCount);
  // Stops the workers and waits for them; work not yet started is destroyed.
  ~Executor();
  Executor(const Executor&) = delete;
  Executor& operator=(const Executor&) = delete;

  const std::string& name() const { return name_; }
  std::size_t threadCount() const { return threadCount_; }

  asio::io_context& context() { return context_; }
  asio::io_context::executor_type executor() { return context_.get_executor(); }

  // Runs the work on some worker, in no particular order with other work. Ordered work
  // goes through a SerialQueue.
  void post(std::function<void()> work);

  // True on one of this executor's worker threads.
  bool runsInThisThread() const;

  // Makes the workers return after the work they are running, and waits for them.
  // Idempotent. Work posted afterwards is kept but never runs. Called from one of the
  // workers, it does not wait for that worker.
  void stop();
  // Like stop(), but gives up waiting after the timeout and detaches the workers that
  // are still busy; returns false then. Only for executors that are never destroyed,
  // since a detached worker still touches the io_context when its task returns.
  bool stopWithin(std::chrono::milliseconds timeout);
  bool stopped() const;

 private:
  bool stopUntil(std::optional<std::chrono::steady_clock::time_point> deadline);
  void workerMain(std::size_t index);

  // Constant after construction.
  const std::string name_;
  const std::size_t threadCount_;

  mutable asio::io_context context_;  // mutable: asio's get_executor() is not const

  mutable std::mutex mutex_;
  std::condition_variable workerFinished_;
  std::optional<asio::executor_work_guard<asio::io_context::executor_type>> guard_;  // guarded by mutex_
  std::vector<std::thread> threads_;  // guarded by mutex_
  std::vector<bool> finished_;        // guarded by mutex_; one flag per worker
  bool stopped_ = false;              // guarded by mutex_
};

class Executors {
 public:
  static constexpr std::size_t kMaxWorkerThreads = 256;
  static constexpr std::size_t kNetworkThreads = 2;
  // How long stopAll() waits for a busy worker before leaving it behind.
  static constexpr std::chrono::milliseconds kStopTimeoutMs{2000};

  // The process-wide executors, created on first use (thread-safe).
  static Executor& main();
  static Executor& network();

  // The main pool's size: TELVANED_WORKER_THREADS when it is a whole number from 1 to
  // kMaxWorkerThreads, else max(2, hardware threads). Read each time it is called.
  static std::size_t mainThreadCount();

  // Stops the process-wide executors that exist (main first, then network), waiting
  // at most kStopTimeoutMs for each. Runs by itself at exit; the daemon may call it
  // earlier. Idempotent.
  static void stopAll();
};

}  // namespace telvane
