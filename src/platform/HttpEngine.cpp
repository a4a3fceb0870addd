#include "platform/HttpEngine.h"

#include <curl/curl.h>
#include <openssl/err.h>
#include <openssl/pem.h>
#include <openssl/ssl.h>
#include <openssl/x509.h>
#include <pthread.h>
#include <sys/epoll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <map>
#include <set>
#include <thread>

#include "platform/Log.h"

namespace telvane {
namespace {

using SteadyTime = std::chrono::steady_clock::time_point;
constexpr const char* kIdleTimeoutError = "The request timed out.";
constexpr std::chrono::milliseconds kLongestWaitMs{1000};
constexpr long kMaxConnectionsPerHost = 4;

// Certificates of $TELVANED_CA_FILE, freed with the last request that uses them.
struct ExtraCertificates {
  std::vector<X509*> certificates;
  ~ExtraCertificates() {
    for (X509* certificate : certificates) X509_free(certificate);
  }
};

std::shared_ptr<ExtraCertificates> readExtraCertificates(const char* path) {
  BIO* bio = BIO_new_file(path, "r");
  if (!bio) {
    ERR_clear_error();
    log::error("HttpEngine: cannot read the CA file %s", path);
    return nullptr;
  }
  auto extra = std::make_shared<ExtraCertificates>();
  while (X509* certificate = PEM_read_bio_X509(bio, nullptr, nullptr, nullptr)) {
    extra->certificates.push_back(certificate);
  }
  ERR_clear_error();  // the end of the file reads as an error
  BIO_free(bio);
  if (extra->certificates.empty()) {
    log::error("HttpEngine: no certificate in the CA file %s", path);
    return nullptr;
  }
  return extra;
}

// The certificates of $TELVANED_CA_FILE, read once per path: parsing them (and the
// system bundle) for every connection would cost more than the request itself.
std::shared_ptr<ExtraCertificates> loadExtraCertificates() {
  static std::mutex mutex;
  static std::string loadedPath;
  static std::shared_ptr<ExtraCertificates> loaded;
  const char* path = std::getenv("TELVANED_CA_FILE");
  if (!path || !*path) return nullptr;
  std::lock_guard<std::mutex> lock(mutex);
  if (path != loadedPath) {
    loaded = readExtraCertificates(path);
    loadedPath = path;
  }
  return loaded;
}

}  // namespace

namespace detail {
// What the caller's thread and the engine thread share about one request.
struct HttpTaskShared {
  std::atomic<bool> cancelled{false};
  HttpTaskCallbacks callbacks;
  std::shared_ptr<SerialQueue> queue;

  // Runs the callback on the delegate queue unless the request is cancelled by then.
  template <typename F>
  static void post(const std::shared_ptr<HttpTaskShared>& shared, F&& call) {
    shared->queue->async([shared, call = std::forward<F>(call)]() mutable {
      if (!shared->cancelled.load()) call(shared->callbacks);
    });
  }
};
}  // namespace detail

namespace {
using TaskShared = detail::HttpTaskShared;

// A request as the engine thread runs it.
struct Task {
  std::uint64_t id = 0;
  CURL* easy = nullptr;
  curl_slist* headerList = nullptr;
  std::string body;
  FILE* upload = nullptr;
  std::shared_ptr<ExtraCertificates> extraCertificates;
  HttpResponse response;
  bool headDelivered = false;
  SteadyTime lastActivity;
  std::chrono::milliseconds idleTimeout{0};
  curl_off_t lastSent = 0;
  curl_off_t lastReceived = 0;
  char errorBuffer[CURL_ERROR_SIZE] = {};
  std::shared_ptr<TaskShared> shared;

  ~Task() {
    if (easy) curl_easy_cleanup(easy);
    if (headerList) curl_slist_free_all(headerList);
    if (upload) std::fclose(upload);
  }
};

struct Pool {
  std::uint64_t id = 0;
  CURLM* multi = nullptr;
  std::shared_ptr<SerialQueue> queue;
  std::map<std::uint64_t, std::unique_ptr<Task>> tasks;
  std::optional<SteadyTime> curlDeadline;
  std::set<int> fds;
  bool finishing = false;
  std::function<void()> didBecomeInvalid;
  class Engine* engine = nullptr;
};

// The process-wide network thread and the pools it drives. Everything below runs on
// that thread, except submit() and the identifier counters.
class Engine {
 public:
  static Engine& instance() {
    // Never destroyed: requests may still be completing while the process exits.
    static Engine* engine = new Engine();
    return *engine;
  }

  std::uint64_t nextPoolId() { return ++poolCounter_; }
  std::uint64_t nextTaskId() { return ++taskCounter_; }

  void submit(std::function<void()> command) {
    {
      std::lock_guard<std::mutex> lock(mutex_);
      commands_.push_back(std::move(command));
    }
    std::uint64_t one = 1;
    ssize_t written = ::write(wakeFd_, &one, sizeof one);
    (void)written;
  }

  void createPool(std::uint64_t id, std::shared_ptr<SerialQueue> queue);
  void addTask(std::uint64_t poolId, std::unique_ptr<Task> task);
  void cancelTask(std::uint64_t poolId, std::uint64_t taskId);
  void finishPool(std::uint64_t poolId, std::function<void()> didBecomeInvalid);
  void destroyPool(std::uint64_t poolId);

  static int socketCallback(CURL* easy, curl_socket_t fd, int what, void* userp, void* socketp);
  static int timerCallback(CURLM* multi, long timeoutMs, void* userp);

 private:
  Engine() {
    curl_global_init(CURL_GLOBAL_DEFAULT);
    epollFd_ = epoll_create1(EPOLL_CLOEXEC);
    wakeFd_ = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
    epoll_event event{};
    event.events = EPOLLIN;
    event.data.fd = wakeFd_;
    epoll_ctl(epollFd_, EPOLL_CTL_ADD, wakeFd_, &event);
    thread_ = std::thread([this] { run(); });
    // OpenSSL frees its global locks in an exit handler registered when it was first
    // initialised, at the latest by curl_global_init above. Exit handlers run in
    // reverse order, so this one stops the network thread before that happens: a
    // connection pool torn down during exit must not take a lock that is gone.
    std::atexit([] { Engine::instance().stopAtExit(); });
  }

  void stopAtExit() {
    stopping_ = true;
    std::uint64_t one = 1;
    ssize_t written = ::write(wakeFd_, &one, sizeof one);
    (void)written;
    if (thread_.joinable()) thread_.join();
  }

  void run();
  void runCommands();
  std::chrono::milliseconds nextWait(SteadyTime now) const;
  void processDone(Pool& pool);
  void complete(Pool& pool, Task& task, const std::string& error);
  void checkIdleTimeouts(SteadyTime now);
  void finalizeFinishedPools();
  void releasePool(std::map<std::uint64_t, std::unique_ptr<Pool>>::iterator it);

  int epollFd_ = -1;
  int wakeFd_ = -1;
  std::thread thread_;
  std::atomic<bool> stopping_{false};
  std::atomic<std::uint64_t> poolCounter_{0};
  std::atomic<std::uint64_t> taskCounter_{0};
  std::mutex mutex_;
  std::deque<std::function<void()>> commands_;  // guarded by mutex_

  // Engine thread only.
  std::map<std::uint64_t, std::unique_ptr<Pool>> pools_;
  std::map<int, Pool*> fdOwners_;
};

int Engine::socketCallback(CURL* /*easy*/, curl_socket_t fd, int what, void* userp, void* /*socketp*/) {
  auto* pool = static_cast<Pool*>(userp);
  Engine& engine = *pool->engine;
  if (what == CURL_POLL_REMOVE) {
    epoll_ctl(engine.epollFd_, EPOLL_CTL_DEL, fd, nullptr);
    engine.fdOwners_.erase(fd);
    pool->fds.erase(fd);
    return 0;
  }
  epoll_event event{};
  event.events = ((what & CURL_POLL_IN) ? EPOLLIN : 0u) | ((what & CURL_POLL_OUT) ? EPOLLOUT : 0u);
  event.data.fd = fd;
  if (pool->fds.count(fd)) {
    epoll_ctl(engine.epollFd_, EPOLL_CTL_MOD, fd, &event);
  } else {
    epoll_ctl(engine.epollFd_, EPOLL_CTL_ADD, fd, &event);
    pool->fds.insert(fd);
  }
  engine.fdOwners_[fd] = pool;
  return 0;
}

int Engine::timerCallback(CURLM* /*multi*/, long timeoutMs, void* userp) {
  auto* pool = static_cast<Pool*>(userp);
  if (timeoutMs < 0) {
    pool->curlDeadline.reset();
  } else {
    pool->curlDeadline = std::chrono::steady_clock::now() + std::chrono::milliseconds(timeoutMs);
  }
  return 0;
}

void Engine::createPool(std::uint64_t id, std::shared_ptr<SerialQueue> queue) {
  auto pool = std::make_unique<Pool>();
  pool->id = id;
  pool->queue = std::move(queue);
  pool->engine = this;
  pool->multi = curl_multi_init();
  curl_multi_setopt(pool->multi, CURLMOPT_SOCKETFUNCTION, &Engine::socketCallback);
  curl_multi_setopt(pool->multi, CURLMOPT_SOCKETDATA, pool.get());
  curl_multi_setopt(pool->multi, CURLMOPT_TIMERFUNCTION, &Engine::timerCallback);
  curl_multi_setopt(pool->multi, CURLMOPT_TIMERDATA, pool.get());
  curl_multi_setopt(pool->multi, CURLMOPT_PIPELINING, CURLPIPE_MULTIPLEX);
  // Requests beyond this many per host wait for a free connection instead of opening
  // (and paying the TLS handshake of) a new one each; under load this keeps a few warm
  // connections busy rather than churning through new ones.
  curl_multi_setopt(pool->multi, CURLMOPT_MAX_HOST_CONNECTIONS, kMaxConnectionsPerHost);
  pools_[id] = std::move(pool);
}

void Engine::addTask(std::uint64_t poolId, std::unique_ptr<Task> task) {
  auto it = pools_.find(poolId);
  if (it == pools_.end()) return;  // invalidated and cancelled meanwhile
  Pool& pool = *it->second;
  task->lastActivity = std::chrono::steady_clock::now();
  CURLMcode code = curl_multi_add_handle(pool.multi, task->easy);
  if (code != CURLM_OK) {
    auto shared = task->shared;
    HttpResponse response;
    response.error = curl_multi_strerror(code);
    TaskShared::post(shared, [response = std::move(response)](HttpTaskCallbacks& callbacks) mutable {
      if (callbacks.didComplete) callbacks.didComplete(std::move(response));
    });
    return;
  }
  std::uint64_t id = task->id;
  pool.tasks[id] = std::move(task);
}

void Engine::cancelTask(std::uint64_t poolId, std::uint64_t taskId) {
  auto it = pools_.find(poolId);
  if (it == pools_.end()) return;
  Pool& pool = *it->second;
  auto task = pool.tasks.find(taskId);
  if (task == pool.tasks.end()) return;
  curl_multi_remove_handle(pool.multi, task->second->easy);
  pool.tasks.erase(task);
}

void Engine::finishPool(std::uint64_t poolId, std::function<void()> didBecomeInvalid) {
  auto it = pools_.find(poolId);
  if (it == pools_.end()) return;
  it->second->finishing = true;
  it->second->didBecomeInvalid = std::move(didBecomeInvalid);
}

void Engine::destroyPool(std::uint64_t poolId) {
  auto it = pools_.find(poolId);
  if (it == pools_.end()) return;
  Pool& pool = *it->second;
  if (pool.finishing && pool.didBecomeInvalid) pool.queue->async(std::move(pool.didBecomeInvalid));
  releasePool(it);
}

void Engine::releasePool(std::map<std::uint64_t, std::unique_ptr<Pool>>::iterator it) {
  Pool& pool = *it->second;
  for (auto& [id, task] : pool.tasks) curl_multi_remove_handle(pool.multi, task->easy);
  pool.tasks.clear();
  // Closing the cached connections may still call the socket callback for this pool.
  curl_multi_cleanup(pool.multi);
  for (int fd : pool.fds) {
    epoll_ctl(epollFd_, EPOLL_CTL_DEL, fd, nullptr);
    fdOwners_.erase(fd);
  }
  pools_.erase(it);
}

void Engine::run() {
  pthread_setname_np(pthread_self(), "telvane-http");
  std::vector<epoll_event> events(64);
  while (!stopping_) {
    auto wait = nextWait(std::chrono::steady_clock::now());
    int count = epoll_wait(epollFd_, events.data(), static_cast<int>(events.size()), static_cast<int>(wait.count()));
    for (int i = 0; i < count; ++i) {
      int fd = events[i].data.fd;
      if (fd == wakeFd_) {
        std::uint64_t value;
        while (::read(wakeFd_, &value, sizeof value) > 0) {
        }
        continue;
      }
      auto owner = fdOwners_.find(fd);
      if (owner == fdOwners_.end()) continue;
      Pool* pool = owner->second;
      int flags = 0;
      if (events[i].events & (EPOLLIN | EPOLLHUP)) flags |= CURL_CSELECT_IN;
      if (events[i].events & EPOLLOUT) flags |= CURL_CSELECT_OUT;
      if (events[i].events & EPOLLERR) flags |= CURL_CSELECT_ERR;
      int running = 0;
      curl_multi_socket_action(pool->multi, fd, flags, &running);
      processDone(*pool);
    }
    runCommands();
    auto now = std::chrono::steady_clock::now();
    for (auto& [id, pool] : pools_) {
      if (pool->curlDeadline && *pool->curlDeadline <= now) {
        pool->curlDeadline.reset();
        int running = 0;
        curl_multi_socket_action(pool->multi, CURL_SOCKET_TIMEOUT, 0, &running);
        processDone(*pool);
      }
    }
    checkIdleTimeouts(std::chrono::steady_clock::now());
    finalizeFinishedPools();
  }
}

void Engine::runCommands() {
  std::deque<std::function<void()>> commands;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    commands.swap(commands_);
  }
  for (auto& command : commands) command();
}

std::chrono::milliseconds Engine::nextWait(SteadyTime now) const {
  SteadyTime next = now + kLongestWaitMs;
  for (const auto& [id, pool] : pools_) {
    if (pool->curlDeadline) next = std::min(next, *pool->curlDeadline);
    for (const auto& [taskId, task] : pool->tasks) next = std::min(next, task->lastActivity + task->idleTimeout);
  }
  if (next <= now) return std::chrono::milliseconds(0);
  // Round up, so that a deadline is never polled for a millisecond early in a loop.
  return std::chrono::ceil<std::chrono::milliseconds>(next - now);
}

void Engine::processDone(Pool& pool) {
  int left = 0;
  while (CURLMsg* message = curl_multi_info_read(pool.multi, &left)) {
    if (message->msg != CURLMSG_DONE) continue;
    Task* task = nullptr;
    curl_easy_getinfo(message->easy_handle, CURLINFO_PRIVATE, &task);
    if (!task) continue;
    CURLcode result = message->data.result;
    std::string error;
    if (result != CURLE_OK) error = task->errorBuffer[0] ? task->errorBuffer : curl_easy_strerror(result);
    complete(pool, *task, error);
  }
}

void Engine::complete(Pool& pool, Task& task, const std::string& error) {
  long status = 0;
  curl_easy_getinfo(task.easy, CURLINFO_RESPONSE_CODE, &status);
  HttpResponse response = std::move(task.response);
  response.statusCode = status;
  response.error = error;
  auto shared = task.shared;
  curl_multi_remove_handle(pool.multi, task.easy);
  pool.tasks.erase(task.id);  // destroys the task
  TaskShared::post(shared, [response = std::move(response)](HttpTaskCallbacks& callbacks) mutable {
    if (callbacks.didComplete) callbacks.didComplete(std::move(response));
  });
}

void Engine::checkIdleTimeouts(SteadyTime now) {
  for (auto& [id, pool] : pools_) {
    std::vector<Task*> expired;
    for (auto& [taskId, task] : pool->tasks) {
      if (task->lastActivity + task->idleTimeout <= now) expired.push_back(task.get());
    }
    for (Task* task : expired) complete(*pool, *task, kIdleTimeoutError);
  }
}

void Engine::finalizeFinishedPools() {
  for (auto it = pools_.begin(); it != pools_.end();) {
    auto next = std::next(it);
    Pool& pool = *it->second;
    if (pool.finishing && pool.tasks.empty()) {
      if (pool.didBecomeInvalid) pool.queue->async(std::move(pool.didBecomeInvalid));
      releasePool(it);
    }
    it = next;
  }
}

// ---- curl callbacks of one request (engine thread) ----

std::size_t writeCallback(char* data, std::size_t size, std::size_t count, void* userp) {
  auto* task = static_cast<Task*>(userp);
  std::size_t length = size * count;
  task->response.body.append(data, length);
  task->lastActivity = std::chrono::steady_clock::now();
  if (task->shared->callbacks.didReceiveData) {
    TaskShared::post(task->shared, [chunk = std::string(data, length)](HttpTaskCallbacks& callbacks) {
      callbacks.didReceiveData(chunk);
    });
  }
  return length;
}

std::string trimmed(std::string_view text) {
  auto begin = text.find_first_not_of(" \t\r\n");
  if (begin == std::string_view::npos) return {};
  auto end = text.find_last_not_of(" \t\r\n");
  return std::string(text.substr(begin, end - begin + 1));
}

std::size_t headerCallback(char* data, std::size_t size, std::size_t count, void* userp) {
  auto* task = static_cast<Task*>(userp);
  std::size_t length = size * count;
  task->lastActivity = std::chrono::steady_clock::now();
  std::string line = trimmed(std::string_view(data, length));
  if (line.rfind("HTTP/", 0) == 0) {
    // A new head: after an informational answer or a redirect, only the last counts.
    task->response.headers.clear();
    task->headDelivered = false;
    auto space = line.find(' ');
    task->response.statusCode = space == std::string::npos ? 0 : std::strtol(line.c_str() + space + 1, nullptr, 10);
  } else if (line.empty()) {
    if (task->response.statusCode >= 200 && !task->headDelivered) {
      task->headDelivered = true;
      if (task->shared->callbacks.didReceiveResponse) {
        HttpResponse head;
        head.statusCode = task->response.statusCode;
        head.headers = task->response.headers;
        TaskShared::post(task->shared, [head = std::move(head)](HttpTaskCallbacks& callbacks) {
          callbacks.didReceiveResponse(head);
        });
      }
    }
  } else if (auto colon = line.find(':'); colon != std::string::npos) {
    task->response.headers.emplace_back(trimmed(std::string_view(line).substr(0, colon)),
                                        trimmed(std::string_view(line).substr(colon + 1)));
  }
  return length;
}

std::size_t readCallback(char* buffer, std::size_t size, std::size_t count, void* userp) {
  auto* task = static_cast<Task*>(userp);
  task->lastActivity = std::chrono::steady_clock::now();
  return std::fread(buffer, size, count, task->upload);
}

int progressCallback(void* userp, curl_off_t /*dltotal*/, curl_off_t dlnow, curl_off_t ultotal, curl_off_t ulnow) {
  auto* task = static_cast<Task*>(userp);
  if (dlnow != task->lastReceived) {
    task->lastReceived = dlnow;
    task->lastActivity = std::chrono::steady_clock::now();
  }
  if (ulnow != task->lastSent) {
    task->lastSent = ulnow;
    task->lastActivity = std::chrono::steady_clock::now();
    if (task->shared->callbacks.didSendBodyData) {
      std::int64_t sent = ulnow;
      std::int64_t total = ultotal;
      TaskShared::post(task->shared,
                       [sent, total](HttpTaskCallbacks& callbacks) { callbacks.didSendBodyData(sent, total); });
    }
  }
  return 0;
}

CURLcode sslContextCallback(CURL* /*easy*/, void* sslContext, void* userp) {
  auto* task = static_cast<Task*>(userp);
  X509_STORE* store = SSL_CTX_get_cert_store(static_cast<SSL_CTX*>(sslContext));
  for (X509* certificate : task->extraCertificates->certificates) X509_STORE_add_cert(store, certificate);
  ERR_clear_error();  // a certificate already in the store is not an error here
  return CURLE_OK;
}

// Sets up the easy handle; returns an error text when the request cannot start.
std::string configure(Task& task, HttpRequest& request) {
  CURL* easy = task.easy;
  curl_easy_setopt(easy, CURLOPT_PRIVATE, &task);
  curl_easy_setopt(easy, CURLOPT_ERRORBUFFER, task.errorBuffer);
  curl_easy_setopt(easy, CURLOPT_NOSIGNAL, 1L);
  if (curl_easy_setopt(easy, CURLOPT_URL, request.url.c_str()) != CURLE_OK) return "unsupported URL";
  curl_easy_setopt(easy, CURLOPT_WRITEFUNCTION, &writeCallback);
  curl_easy_setopt(easy, CURLOPT_WRITEDATA, &task);
  curl_easy_setopt(easy, CURLOPT_HEADERFUNCTION, &headerCallback);
  curl_easy_setopt(easy, CURLOPT_HEADERDATA, &task);
  curl_easy_setopt(easy, CURLOPT_XFERINFOFUNCTION, &progressCallback);
  curl_easy_setopt(easy, CURLOPT_XFERINFODATA, &task);
  curl_easy_setopt(easy, CURLOPT_NOPROGRESS, 0L);
  curl_easy_setopt(easy, CURLOPT_SUPPRESS_CONNECT_HEADERS, 1L);
  curl_easy_setopt(easy, CURLOPT_FOLLOWLOCATION, 1L);
  curl_easy_setopt(easy, CURLOPT_MAXREDIRS, 16L);
  curl_easy_setopt(easy, CURLOPT_HTTP_VERSION, static_cast<long>(CURL_HTTP_VERSION_2TLS));
  auto connectTimeout = request.connectTimeout.value_or(HttpSession::kDefaultConnectTimeoutMs);
  curl_easy_setopt(easy, CURLOPT_CONNECTTIMEOUT_MS, static_cast<long>(connectTimeout.count()));
  task.idleTimeout = request.idleTimeout.value_or(HttpSession::kDefaultIdleTimeoutMs);

  // No "Expect: 100-continue" round trip before a body.
  task.headerList = curl_slist_append(task.headerList, "Expect:");
  for (const auto& [name, value] : request.headers) {
    task.headerList = curl_slist_append(task.headerList, (name + ": " + value).c_str());
  }
  curl_easy_setopt(easy, CURLOPT_HTTPHEADER, task.headerList);

  if (request.method == "GET") {
    curl_easy_setopt(easy, CURLOPT_HTTPGET, 1L);
  } else {
    if (request.method == "POST") {
      curl_easy_setopt(easy, CURLOPT_POST, 1L);
    } else {
      curl_easy_setopt(easy, CURLOPT_CUSTOMREQUEST, request.method.c_str());
    }
    if (!request.uploadFilePath.empty()) {
      task.upload = std::fopen(request.uploadFilePath.c_str(), "rb");
      if (!task.upload) return "cannot open " + request.uploadFilePath + ": " + std::strerror(errno);
      std::fseek(task.upload, 0, SEEK_END);
      long size = std::ftell(task.upload);
      std::rewind(task.upload);
      curl_easy_setopt(easy, CURLOPT_READFUNCTION, &readCallback);
      curl_easy_setopt(easy, CURLOPT_READDATA, &task);
      curl_easy_setopt(easy, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(size < 0 ? 0 : size));
    } else {
      task.body = std::move(request.body);
      curl_easy_setopt(easy, CURLOPT_POSTFIELDS, task.body.data());
      curl_easy_setopt(easy, CURLOPT_POSTFIELDSIZE_LARGE, static_cast<curl_off_t>(task.body.size()));
    }
  }

  task.extraCertificates = loadExtraCertificates();
  if (task.extraCertificates) {
    curl_easy_setopt(easy, CURLOPT_SSL_CTX_FUNCTION, &sslContextCallback);
    curl_easy_setopt(easy, CURLOPT_SSL_CTX_DATA, &task);
    // The store may be the pool's cached one, shared by later connections; they trust
    // the same extra certificates, and adding one twice is harmless.
  }
  return {};
}

}  // namespace

std::optional<std::string> HttpResponse::header(std::string_view name) const {
  for (const auto& [key, value] : headers) {
    if (key.size() == name.size() &&
        std::equal(key.begin(), key.end(), name.begin(),
                   [](char a, char b) { return std::tolower(static_cast<unsigned char>(a)) ==
                                               std::tolower(static_cast<unsigned char>(b)); })) {
      return value;
    }
  }
  return std::nullopt;
}

// ---- HttpSession ----

std::shared_ptr<HttpSession> HttpSession::create(std::shared_ptr<SerialQueue> delegateQueue) {
  return std::shared_ptr<HttpSession>(new HttpSession(std::move(delegateQueue)));
}

HttpSession::HttpSession(std::shared_ptr<SerialQueue> delegateQueue)
    : delegateQueue_(std::move(delegateQueue)), engineId_(Engine::instance().nextPoolId()) {
  Engine::instance().submit([id = engineId_, queue = delegateQueue_] { Engine::instance().createPool(id, queue); });
}

HttpSession::~HttpSession() {
  bool finishing;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    finishing = finishRequested_;
  }
  // A finishing pool belongs to the engine until its requests are done.
  if (!finishing) invalidateAndCancel();
}

std::uint64_t HttpSession::startTask(HttpRequest request, HttpTaskCallbacks callbacks) {
  auto task = std::make_unique<Task>();
  task->shared = std::make_shared<TaskShared>();
  task->shared->callbacks = std::move(callbacks);
  task->shared->queue = delegateQueue_;
  task->easy = curl_easy_init();
  std::string error = task->easy ? configure(*task, request) : "cannot create a request";

  std::lock_guard<std::mutex> lock(mutex_);
  if (invalidated_) return 0;
  task->id = Engine::instance().nextTaskId();
  std::uint64_t id = task->id;
  tasks_[id] = task->shared;
  for (auto it = tasks_.begin(); it != tasks_.end();) it = it->second.expired() ? tasks_.erase(it) : std::next(it);
  if (!error.empty()) {
    HttpResponse response;
    response.error = error;
    TaskShared::post(task->shared, [response = std::move(response)](HttpTaskCallbacks& calls) mutable {
      if (calls.didComplete) calls.didComplete(std::move(response));
    });
    return id;
  }
  // The command owns the task until the engine thread takes it.
  auto* raw = task.release();
  Engine::instance().submit([poolId = engineId_, raw] { Engine::instance().addTask(poolId, std::unique_ptr<Task>(raw)); });
  return id;
}

void HttpSession::cancelTask(std::uint64_t taskId) {
  std::lock_guard<std::mutex> lock(mutex_);
  auto it = tasks_.find(taskId);
  if (it == tasks_.end()) return;
  if (auto shared = it->second.lock()) shared->cancelled = true;
  tasks_.erase(it);
  Engine::instance().submit([poolId = engineId_, taskId] { Engine::instance().cancelTask(poolId, taskId); });
}

void HttpSession::finishTasksAndInvalidate(std::function<void()> didBecomeInvalid) {
  std::lock_guard<std::mutex> lock(mutex_);
  if (invalidated_) return;
  invalidated_ = true;
  finishRequested_ = true;
  Engine::instance().submit([poolId = engineId_, block = std::move(didBecomeInvalid)]() mutable {
    Engine::instance().finishPool(poolId, std::move(block));
  });
}

void HttpSession::invalidateAndCancel() {
  std::lock_guard<std::mutex> lock(mutex_);
  invalidated_ = true;
  for (auto& [id, weak] : tasks_) {
    if (auto shared = weak.lock()) shared->cancelled = true;
  }
  tasks_.clear();
  Engine::instance().submit([poolId = engineId_] { Engine::instance().destroyPool(poolId); });
}

bool HttpSession::isInvalidated() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return invalidated_;
}

}  // namespace telvane
