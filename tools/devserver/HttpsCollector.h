// HttpsCollector: the development server's HTTPS side on 127.0.0.1, with the state
// folder's self-signed certificate. It answers storebag requests through the
// StorebagResponder and receives what the daemon's backends post:
//
//   GET  /storebags/NAME   the signed envelope (conditional; see StorebagResponder)
//   GET  /uploads/FILE     a file received earlier (where log-data uploads point)
//   POST /upload...        a gzip-compressed file upload, saved under the uploads folder
//   POST /dashboard...     a log-data archive (a binary property list), saved likewise;
//                          the answer is the URL where it can be fetched
//   POST anything else     an event post: JSON {postTime, clientId, events}, gzip or not
//
// Every request is reported to the arrival log: one arrival per event record of a
// post, one per upload, one per storebag request, and one for anything refused.
//
// Threading: start() and stop() are called from the owning thread; requests are
// served on the HTTP server's worker threads, which share only the arrival log (itself
// thread-safe), the immutable responder and an atomic upload counter.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <thread>

#include "devserver/ArrivalLog.h"
#include "devserver/StorebagResponder.h"
#include "platform/Result.h"

namespace httplib {
class SSLServer;
struct Request;
struct Response;
}  // namespace httplib

namespace telvane::devserver {

struct HttpsCollectorFiles {
  std::string certificate;
  std::string certificateKey;
  std::string uploadsDir;
};

class HttpsCollector {
 public:
  HttpsCollector(ArrivalLog& log, HttpsCollectorFiles files);
  ~HttpsCollector();
  HttpsCollector(const HttpsCollector&) = delete;
  HttpsCollector& operator=(const HttpsCollector&) = delete;

  // Binds 127.0.0.1:port (0: any free port); the bound port. Requests are not served
  // before serve() (the storebag responder needs the port first).
  Result<std::uint16_t> bind(std::uint16_t port);
  // Starts answering, with the responder made for the bound port.
  void serve(std::shared_ptr<const StorebagResponder> responder);
  void stop();

 private:
  void handleStorebag(const httplib::Request& request, httplib::Response& response);
  void handleUploadedFile(const httplib::Request& request, httplib::Response& response);
  void handlePost(const httplib::Request& request, httplib::Response& response);
  void handleEventPost(const httplib::Request& request, httplib::Response& response, const std::string& body);
  void handleFileUpload(const httplib::Request& request, httplib::Response& response, const std::string& body);
  void handleLogData(const httplib::Request& request, httplib::Response& response, const std::string& body);
  void handleUnknown(const httplib::Request& request, httplib::Response& response);
  void refuse(const httplib::Request& request, httplib::Response& response, int status, const std::string& problem);
  // A file name in the uploads folder that no earlier arrival used.
  std::string nextUploadName(const std::string& suggested);

  ArrivalLog& log_;
  const HttpsCollectorFiles files_;
  std::unique_ptr<httplib::SSLServer> server_;
  std::thread thread_;
  std::uint16_t port_ = 0;
  std::shared_ptr<const StorebagResponder> responder_;  // set before serving starts
  std::atomic<unsigned> uploadCount_{0};
};

}  // namespace telvane::devserver
