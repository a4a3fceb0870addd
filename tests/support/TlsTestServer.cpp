#include "support/TlsTestServer.h"

#include <httplib.h>
#include <openssl/ssl.h>
#include <sys/socket.h>

#include <algorithm>
#include <cctype>
#include <cstdio>
#include <cstdlib>

#include "support/TestCertificates.h"

namespace telvane::test {

std::string ReceivedRequest::header(const std::string& name) const {
  auto same = [&name](const std::string& key) {
    return key.size() == name.size() && std::equal(key.begin(), key.end(), name.begin(), [](char a, char b) {
             return std::tolower(static_cast<unsigned char>(a)) == std::tolower(static_cast<unsigned char>(b));
           });
  };
  for (const auto& [key, value] : headers) {
    if (same(key)) return value;
  }
  return {};
}

TlsTestServer::TlsTestServer() {
  const auto& certificates = TestCertificates::shared();
  server_ = std::make_unique<httplib::SSLServer>(certificates.serverCertFile().c_str(),
                                                 certificates.serverKeyFile().c_str());
  if (!server_->is_valid()) {
    std::fprintf(stderr, "TlsTestServer: cannot load the test certificates\n");
    std::abort();
  }
  auto handler = [this](const httplib::Request& request, httplib::Response& response) { serve(&request, &response); };
  // One request per connection: a kept-alive connection would hold one of the
  // server's few threads while idle.
  server_->set_keep_alive_max_count(1);
  server_->Get(".*", handler);
  server_->Post(".*", handler);
  server_->Put(".*", handler);
  server_->Delete(".*", handler);
  port_ = server_->bind_to_any_port("127.0.0.1");
  if (port_ <= 0) {
    std::fprintf(stderr, "TlsTestServer: cannot bind 127.0.0.1\n");
    std::abort();
  }
  thread_ = std::thread([this] { server_->listen_after_bind(); });
  // The socket already listens; wait until the accept loop runs, so that stop() finds
  // it.
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (!server_->is_running() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
}

TlsTestServer::~TlsTestServer() { stop(); }

std::string TlsTestServer::url(const std::string& path) const {
  return "https://127.0.0.1:" + std::to_string(port_) + path;
}

void TlsTestServer::setAnswer(const std::string& path, ScriptedAnswer answer) {
  std::lock_guard<std::mutex> lock(mutex_);
  answers_[path] = std::move(answer);
}

std::vector<ReceivedRequest> TlsTestServer::requests() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return requests_;
}

std::vector<ReceivedRequest> TlsTestServer::requestsForPath(const std::string& path) const {
  std::lock_guard<std::mutex> lock(mutex_);
  std::vector<ReceivedRequest> result;
  for (const auto& request : requests_) {
    if (request.path == path) result.push_back(request);
  }
  return result;
}

std::size_t TlsTestServer::requestCount() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return requests_.size();
}

bool TlsTestServer::waitForRequests(std::size_t count, std::chrono::milliseconds timeout) const {
  std::unique_lock<std::mutex> lock(mutex_);
  return changed_.wait_for(lock, timeout, [&] { return requests_.size() >= count; });
}

void TlsTestServer::stop() {
  {
    std::lock_guard<std::mutex> lock(mutex_);
    if (stopping_) return;
    stopping_ = true;
  }
  changed_.notify_all();
  server_->stop();
  if (thread_.joinable()) thread_.join();
}

void TlsTestServer::serve(const void* rawRequest, void* rawResponse) {
  const auto& request = *static_cast<const httplib::Request*>(rawRequest);
  auto& response = *static_cast<httplib::Response*>(rawResponse);
  ReceivedRequest received;
  received.method = request.method;
  received.path = request.path;
  if (auto mark = request.target.find('?'); mark != std::string::npos) received.query = request.target.substr(mark + 1);
  for (const auto& [name, value] : request.headers) received.headers.emplace_back(name, value);
  received.body = request.body;

  ScriptedAnswer answer;
  bool scripted = false;
  {
    std::unique_lock<std::mutex> lock(mutex_);
    requests_.push_back(std::move(received));
    changed_.notify_all();
    auto it = answers_.find(request.path);
    if (it != answers_.end()) {
      answer = it->second;
      scripted = true;
    }
    if (answer.delay.count() > 0) changed_.wait_for(lock, answer.delay, [this] { return stopping_; });
  }
  if (!scripted) {
    response.status = 404;
    return;
  }
  if (answer.closeWithoutAnswer) {
    // Shut the socket down under the server: it can send nothing and gives up.
    if (request.ssl) ::shutdown(SSL_get_fd(request.ssl), SHUT_RDWR);
    return;
  }
  response.status = answer.status;
  for (const auto& [name, value] : answer.headers) response.set_header(name, value);
  response.set_content(answer.body, answer.contentType.c_str());
}

}  // namespace telvane::test
