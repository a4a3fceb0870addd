// TlsTestServer: an HTTPS server on 127.0.0.1 (ephemeral port) for tests, with
// scripted answers per path and a record of every request it received.
//
// It uses the certificates of TestCertificates, so clients trust it through
// TestCertificates::shared().caFile() (for the daemon's HTTP engine: $TELVANED_CA_FILE).
// Each path answers with its script (status, headers, body, an optional delay before
// answering, or closing the connection without any answer); a path without a script
// answers 404. Scripts may be changed while the server runs. stop() (also run by the
// destructor) cuts every delay short.
//
// Threading: all member functions are thread-safe; requests are served on the
// server's own threads.
#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <utility>
#include <vector>

namespace httplib {
class SSLServer;
}

namespace telvane::test {

struct ScriptedAnswer {
  int status = 200;
  std::vector<std::pair<std::string, std::string>> headers;
  std::string body;
  std::string contentType = "application/octet-stream";
  // Waits this long before answering (cut short by stop()).
  std::chrono::milliseconds delay{0};
  // Closes the connection without sending anything.
  bool closeWithoutAnswer = false;
};

struct ReceivedRequest {
  std::string method;
  std::string path;
  std::string query;  // the text after '?', without it; empty when none
  std::vector<std::pair<std::string, std::string>> headers;
  std::string body;

  // The first header of that name, compared without regard to case; empty when none.
  std::string header(const std::string& name) const;
};

class TlsTestServer {
 public:
  // Starts listening at once; the server is ready when the constructor returns.
  TlsTestServer();
  ~TlsTestServer();
  TlsTestServer(const TlsTestServer&) = delete;
  TlsTestServer& operator=(const TlsTestServer&) = delete;

  int port() const { return port_; }
  // "https://127.0.0.1:<port>" + path.
  std::string url(const std::string& path) const;

  void setAnswer(const std::string& path, ScriptedAnswer answer);
  // Every request received so far, in arrival order.
  std::vector<ReceivedRequest> requests() const;
  std::vector<ReceivedRequest> requestsForPath(const std::string& path) const;
  std::size_t requestCount() const;
  // Waits (with the deadline) until at least `count` requests have arrived.
  bool waitForRequests(std::size_t count, std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

  void stop();

 private:
  void serve(const void* request, void* response);

  std::unique_ptr<httplib::SSLServer> server_;
  std::thread thread_;
  int port_ = 0;

  mutable std::mutex mutex_;
  mutable std::condition_variable changed_;
  std::map<std::string, ScriptedAnswer> answers_;  // guarded by mutex_
  std::vector<ReceivedRequest> requests_;          // guarded by mutex_
  bool stopping_ = false;                          // guarded by mutex_
};

}  // namespace telvane::test
