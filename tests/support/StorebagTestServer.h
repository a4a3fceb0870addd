// StorebagTestServer: the storebag server of the tests, a thin layer over TlsTestServer.
//
// Each storebag name is served at "<base path>/<name>", the path of the request URL
// the retrieval builds from the base URL (baseURL() is what tests put under
// "telvane_storebag_url"). The answers are the ones a storebag server gives or fails
// to give: a signed envelope with its caching headers, 304, an empty 200, an error
// status, a tampered envelope, a slow answer, a connection closed without answer and
// a body that is no envelope at all. The requests received for a name can be read
// back (If-Modified-Since, the "version=..." query).
//
// Envelopes are signed with TestKeyPair::shared() unless the test signs its own.
//
// Threading: as TlsTestServer, every member function is thread-safe.
#pragma once

#include <chrono>
#include <cstddef>
#include <optional>
#include <string>
#include <vector>

#include "support/TlsTestServer.h"
#include "telvane/Value.h"

namespace telvane::test {

// The caching headers of an answer; an unset one is not sent.
struct StorebagHeaders {
  std::optional<std::string> cacheControl;
  std::optional<std::string> lastModified;
};

class StorebagTestServer {
 public:
  // `basePath` is the path part of baseURL(), without a trailing slash.
  explicit StorebagTestServer(std::string basePath = "/bags");

  TlsTestServer& tls() { return server_; }
  // "https://127.0.0.1:<port><base path>".
  std::string baseURL() const;
  // "<base path>/<name>".
  std::string pathFor(const std::string& name) const;
  // The URL the retrieval asks for: "<base URL>/<name>?version=<version>".
  std::string requestURL(const std::string& name, const std::string& version) const;

  // 200 with these envelope bytes (as they are: signed, tampered or anything else).
  void serveEnvelope(const std::string& name, const Bytes& envelope, const StorebagHeaders& headers = {},
                     std::chrono::milliseconds delay = std::chrono::milliseconds(0));
  // 200 with the document signed by the shared test key; returns the envelope sent.
  Bytes serveDocument(const std::string& name, const Value& document, const StorebagHeaders& headers = {});
  // 200 with the document signed, then one byte of the decoded bag changed; returns
  // the envelope sent.
  Bytes serveTampered(const std::string& name, const Value& document, const StorebagHeaders& headers = {});
  // 304 Not Modified, no body.
  void serveNotModified(const std::string& name, const StorebagHeaders& headers = {});
  // 200 with an empty body.
  void serveEmpty(const std::string& name, const StorebagHeaders& headers = {});
  // Any status (500 and the like), with a short text body.
  void serveStatus(const std::string& name, int status);
  // 200 with a body that is not a property list.
  void serveGarbage(const std::string& name, const StorebagHeaders& headers = {});
  // Waits `delay` (cut short by stop()), then closes the connection without
  // answering: a server that never answers within a shorter wait.
  void serveNoAnswerFor(const std::string& name, std::chrono::milliseconds delay);
  // Closes the connection at once, without any answer.
  void serveCloseWithoutAnswer(const std::string& name);

  std::vector<ReceivedRequest> requestsFor(const std::string& name) const;
  std::size_t requestCountFor(const std::string& name) const;
  // Waits (with the deadline) until `count` requests for the name have arrived.
  bool waitForRequestsFor(const std::string& name, std::size_t count,
                          std::chrono::milliseconds timeout = std::chrono::seconds(10)) const;

  // Stops serving; cuts every delay short.
  void stop() { server_.stop(); }

  // The body serveGarbage() sends.
  static const std::string& garbageBody();

 private:
  static std::vector<std::pair<std::string, std::string>> headerList(const StorebagHeaders& headers);

  std::string basePath_;
  TlsTestServer server_;
};

}  // namespace telvane::test
