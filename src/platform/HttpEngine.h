// HttpEngine: HTTP(S) requests on libcurl's multi interface.
//
// An HttpSession is one private connection pool (one curl multi handle): the
// connections it opens are reused only by its own requests. All sessions of the
// process are driven by one network thread owned by the engine, which waits on every
// session's sockets at once (epoll) and runs curl there; nothing of curl is touched
// on any other thread. What a request produces is handed to the session's delegate
// queue, in order: the response head (status and headers), body chunks, upload
// progress and finally the completion, which carries the status, the headers, the
// whole body and, when the exchange failed, an error text.
//
// Defaults: a connect timeout and an idle-transfer timeout of 60 seconds (idle: no
// byte sent or received for that long, counted from the start of the request), each
// overridable per request. Proxies come from the usual environment variables (curl's
// own behaviour). HTTP/2 is used where the server offers it over TLS.
//
// Trust: the system CA bundle always stands. When $TELVANED_CA_FILE names a PEM file,
// its certificates are added to the TLS context's trust store of each request (through
// curl's SSL context callback), so that an extra CA is trusted besides the system ones
// rather than instead of them. The file is read when a request starts.
//
// Cancellation: cancelTask() and invalidateAndCancel() drop the request at once; no
// callback of a cancelled request runs after the call returns when it is made on the
// delegate queue (from another thread, a callback that is already running may
// finish). Destroying the last reference to a session cancels everything it runs.
//
// Threading: every member function may be called from any thread.
#pragma once

#include <chrono>
#include <cstdint>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "platform/SerialQueue.h"

namespace telvane {

namespace detail {
struct HttpTaskShared;
}

struct HttpRequest {
  std::string method = "GET";
  std::string url;
  std::vector<std::pair<std::string, std::string>> headers;
  // The body sent with a POST (or any method but GET), unless uploadFilePath is set.
  std::string body;
  // When set, the body is read from this file. The file is opened when the request
  // starts, so the caller may remove it right after startTask() returns.
  std::string uploadFilePath;
  // Unset: the defaults below.
  std::optional<std::chrono::milliseconds> connectTimeout;
  std::optional<std::chrono::milliseconds> idleTimeout;
};

struct HttpResponse {
  // 0 when no response arrived.
  long statusCode = 0;
  // In the order received; names as the server spelt them.
  std::vector<std::pair<std::string, std::string>> headers;
  std::string body;
  // Empty when the exchange completed (whatever the status); else what went wrong.
  std::string error;

  bool failed() const { return !error.empty(); }
  // The first header of that name, compared without regard to case.
  std::optional<std::string> header(std::string_view name) const;
};

// What a request reports, each on the session's delegate queue. All are optional.
struct HttpTaskCallbacks {
  // The final response head (status and headers; informational 1xx heads are skipped).
  std::function<void(const HttpResponse& head)> didReceiveResponse;
  std::function<void(const std::string& chunk)> didReceiveData;
  // Body bytes sent so far, of the total.
  std::function<void(std::int64_t sent, std::int64_t total)> didSendBodyData;
  // Called once, last, unless the request was cancelled.
  std::function<void(HttpResponse response)> didComplete;
};

class HttpSession {
 public:
  static constexpr std::chrono::milliseconds kDefaultConnectTimeoutMs{60000};
  static constexpr std::chrono::milliseconds kDefaultIdleTimeoutMs{60000};
  // The error text of a request that could not start because the session was
  // invalidated.
  static constexpr const char* kInvalidatedError = "Task created in a session that has been invalidated";

  // A new connection pool whose callbacks run on the given queue.
  static std::shared_ptr<HttpSession> create(std::shared_ptr<SerialQueue> delegateQueue);
  ~HttpSession();
  HttpSession(const HttpSession&) = delete;
  HttpSession& operator=(const HttpSession&) = delete;

  // Starts the request; returns its task identifier (above 0), or 0 when the session
  // has been invalidated. A request whose upload file cannot be opened, or whose URL
  // curl refuses, starts and completes at once with an error.
  std::uint64_t startTask(HttpRequest request, HttpTaskCallbacks callbacks);
  void cancelTask(std::uint64_t taskId);
  // Refuses new requests; when the running ones have completed, calls the block on the
  // delegate queue and closes the connections. The requests run to their end (and the
  // block is called) also when the session object goes away meanwhile.
  void finishTasksAndInvalidate(std::function<void()> didBecomeInvalid);
  // Refuses new requests and cancels the running ones; no callback of a request
  // follows. A block given to an earlier finishTasksAndInvalidate() is still called.
  void invalidateAndCancel();
  bool isInvalidated() const;

  const std::shared_ptr<SerialQueue>& delegateQueue() const { return delegateQueue_; }

 private:
  explicit HttpSession(std::shared_ptr<SerialQueue> delegateQueue);

  // Constant after construction.
  const std::shared_ptr<SerialQueue> delegateQueue_;
  const std::uint64_t engineId_;  // the session's pool inside the engine

  mutable std::mutex mutex_;
  // Guarded by mutex_.
  bool invalidated_ = false;
  bool finishRequested_ = false;
  std::map<std::uint64_t, std::weak_ptr<detail::HttpTaskShared>> tasks_;  // requests that may still call back
};

}  // namespace telvane
