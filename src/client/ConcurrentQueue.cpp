#include "client/ConcurrentQueue.h"

#include <pthread.h>

#include <algorithm>
#include <condition_variable>
#include <deque>
#include <exception>
#include <mutex>
#include <thread>
#include <utility>

#include "platform/Log.h"

namespace telvane {

// What the queue shares with its workers; a worker holds it until it ends, so it
// outlives the queue object while work is left or a worker is still busy.
struct ConcurrentQueue::Shared {
  Shared(std::string threadName, std::size_t maxThreads) : threadName(std::move(threadName)), maxThreads(maxThreads) {}

  // Constant after construction.
  const std::string threadName;
  const std::size_t maxThreads;

  std::mutex mutex;
  std::condition_variable changed;        // work arrived or the queue was released
  std::deque<std::function<void()>> work;  // guarded by mutex
  std::size_t threads = 0;                 // guarded by mutex
  std::size_t idle = 0;                    // guarded by mutex; workers waiting for work
  bool released = false;                   // guarded by mutex
};

namespace {

// The last part of the label, cut to the kernel's 15 characters for thread names.
std::string threadNameFor(const std::string& label) {
  const auto dot = label.rfind('.');
  std::string name = dot == std::string::npos ? label : label.substr(dot + 1);
  if (name.empty()) name = "concurrent";
  if (name.size() > 15) name.resize(15);
  return name;
}

}  // namespace

std::shared_ptr<ConcurrentQueue> ConcurrentQueue::create(std::string label, std::size_t maxThreads) {
  return std::shared_ptr<ConcurrentQueue>(new ConcurrentQueue(std::move(label), maxThreads));
}

ConcurrentQueue::ConcurrentQueue(std::string label, std::size_t maxThreads)
    : label_(std::move(label)),
      shared_(std::make_shared<Shared>(threadNameFor(label_), std::max<std::size_t>(1, maxThreads))) {}

ConcurrentQueue::~ConcurrentQueue() {
  std::lock_guard<std::mutex> lock(shared_->mutex);
  shared_->released = true;
  shared_->changed.notify_all();
}

void ConcurrentQueue::async(std::function<void()> work) {
  bool startWorker = false;
  {
    std::lock_guard<std::mutex> lock(shared_->mutex);
    shared_->work.push_back(std::move(work));
    // Every idle worker that is already woken takes one item; start a worker for what
    // is left over, as long as the pool may grow.
    if (shared_->idle >= shared_->work.size()) {
      shared_->changed.notify_one();
    } else if (shared_->threads < shared_->maxThreads) {
      ++shared_->threads;
      startWorker = true;
    }
  }
  if (startWorker) std::thread(&ConcurrentQueue::workerMain, shared_).detach();
}

std::size_t ConcurrentQueue::threadCount() const {
  std::lock_guard<std::mutex> lock(shared_->mutex);
  return shared_->threads;
}

void ConcurrentQueue::workerMain(std::shared_ptr<Shared> shared) {
  pthread_setname_np(pthread_self(), shared->threadName.c_str());
  std::unique_lock<std::mutex> lock(shared->mutex);
  for (;;) {
    if (shared->work.empty()) {
      ++shared->idle;
      const bool woken = shared->changed.wait_for(lock, kIdleThreadLifetime,
                                                  [&] { return !shared->work.empty() || shared->released; });
      --shared->idle;
      if (!woken || shared->work.empty()) break;  // idle for too long, or released and drained
    }
    std::function<void()> item = std::move(shared->work.front());
    shared->work.pop_front();
    lock.unlock();
    try {
      item();
    } catch (const std::exception& exception) {
      log::error("%s: work item threw: %s", shared->threadName, exception.what());
    } catch (...) {
      log::error("%s: work item threw", shared->threadName);
    }
    // Whatever the item captured goes here, outside the lock.
    item = nullptr;
    lock.lock();
  }
  --shared->threads;
}

}  // namespace telvane
