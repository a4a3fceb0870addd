#include "platform/Executors.h"

#include "platform/Log.h"

#include <asio/post.hpp>

#include <pthread.h>

#include <algorithm>
#include <atomic>
#include <cassert>
#include <charconv>
#include <cstdlib>
#include <string_view>

namespace telvane {

namespace {

// The process-wide executors, once made. Never deleted (see the header).
std::atomic<Executor*> gMain{nullptr};
std::atomic<Executor*> gNetwork{nullptr};

void registerExitHookOnce() {
  static const bool registered = [] {
    std::atexit([] { Executors::stopAll(); });
    return true;
  }();
  (void)registered;
}

std::size_t defaultMainThreadCount() {
  unsigned hardware = std::thread::hardware_concurrency();
  return std::max<std::size_t>(2, hardware);
}

}  // namespace

// ---- Executor ----

Executor::Executor(std::string name, std::size_t threadCount)
    : name_(std::move(name)), threadCount_(std::max<std::size_t>(1, threadCount)) {
  std::lock_guard<std::mutex> lock(mutex_);
  guard_.emplace(asio::make_work_guard(context_));
  finished_.assign(threadCount_, false);
  threads_.reserve(threadCount_);
  for (std::size_t i = 0; i < threadCount_; ++i) threads_.emplace_back([this, i] { workerMain(i); });
}

Executor::~Executor() {
  // A worker cannot wait for itself to end, and would return into a destroyed context.
  assert(!runsInThisThread() && "an Executor must not be destroyed by one of its own tasks");
  stop();
}

void Executor::workerMain(std::size_t index) {
  std::string threadName = name_ + "-" + std::to_string(index);
  if (threadName.size() > 15) threadName.resize(15);
  pthread_setname_np(pthread_self(), threadName.c_str());

  context_.run();

  std::lock_guard<std::mutex> lock(mutex_);
  finished_[index] = true;
  workerFinished_.notify_all();
}

void Executor::post(std::function<void()> work) { asio::post(context_, std::move(work)); }

bool Executor::runsInThisThread() const { return context_.get_executor().running_in_this_thread(); }

void Executor::stop() { stopUntil(std::nullopt); }

bool Executor::stopWithin(std::chrono::milliseconds timeout) {
  return stopUntil(std::chrono::steady_clock::now() + timeout);
}

bool Executor::stopped() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return stopped_;
}

bool Executor::stopUntil(std::optional<std::chrono::steady_clock::time_point> deadline) {
  std::unique_lock<std::mutex> lock(mutex_);
  if (stopped_) return true;
  stopped_ = true;
  guard_.reset();
  context_.stop();

  const auto self = std::this_thread::get_id();
  auto othersFinished = [&] {
    for (std::size_t i = 0; i < threads_.size(); ++i) {
      if (!finished_[i] && threads_[i].get_id() != self) return false;
    }
    return true;
  };
  bool complete = true;
  if (deadline) {
    complete = workerFinished_.wait_until(lock, *deadline, othersFinished);
  } else {
    workerFinished_.wait(lock, othersFinished);
  }
  for (std::size_t i = 0; i < threads_.size(); ++i) {
    // A finished worker only has to return from its thread function, which needs no
    // lock, so joining here cannot deadlock.
    if (finished_[i] && threads_[i].get_id() != self) {
      threads_[i].join();
    } else {
      threads_[i].detach();
    }
  }
  threads_.clear();
  if (!complete) log::error("Executor %s: workers still busy after stop; leaving them behind", name_);
  return complete;
}

// ---- Executors ----

std::size_t Executors::mainThreadCount() {
  const char* text = std::getenv("TELVANED_WORKER_THREADS");
  if (!text || !*text) return defaultMainThreadCount();
  std::string_view view(text);
  std::size_t count = 0;
  auto [end, error] = std::from_chars(view.data(), view.data() + view.size(), count);
  if (error != std::errc() || end != view.data() + view.size() || count < 1 || count > kMaxWorkerThreads) {
    log::error("Executors: ignoring TELVANED_WORKER_THREADS=%s (expected 1 to %d)", view,
               static_cast<int>(kMaxWorkerThreads));
    return defaultMainThreadCount();
  }
  return count;
}

Executor& Executors::main() {
  static Executor* const executor = [] {
    registerExitHookOnce();
    auto* e = new Executor("telvane-main", mainThreadCount());
    gMain.store(e, std::memory_order_release);
    return e;
  }();
  return *executor;
}

Executor& Executors::network() {
  static Executor* const executor = [] {
    registerExitHookOnce();
    auto* e = new Executor("telvane-net", kNetworkThreads);
    gNetwork.store(e, std::memory_order_release);
    return e;
  }();
  return *executor;
}

void Executors::stopAll() {
  // Main first: its tasks may be waiting for completions that the network pool brings.
  if (Executor* e = gMain.load(std::memory_order_acquire)) e->stopWithin(kStopTimeoutMs);
  if (Executor* e = gNetwork.load(std::memory_order_acquire)) e->stopWithin(kStopTimeoutMs);
}

}  // namespace telvane
