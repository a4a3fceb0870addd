#include "support/StorebagTestServer.h"

#include <utility>

#include "support/SignedEnvelope.h"
#include "support/WaitUntil.h"

namespace telvane::test {

namespace {

std::string textOf(const Bytes& bytes) { return std::string(bytes.begin(), bytes.end()); }

}  // namespace

StorebagTestServer::StorebagTestServer(std::string basePath) : basePath_(std::move(basePath)) {}

std::string StorebagTestServer::baseURL() const { return server_.url(basePath_); }

std::string StorebagTestServer::pathFor(const std::string& name) const { return basePath_ + "/" + name; }

std::string StorebagTestServer::requestURL(const std::string& name, const std::string& version) const {
  return baseURL() + "/" + name + "?version=" + version;
}

std::vector<std::pair<std::string, std::string>> StorebagTestServer::headerList(const StorebagHeaders& headers) {
  std::vector<std::pair<std::string, std::string>> list;
  if (headers.cacheControl) list.emplace_back("Cache-Control", *headers.cacheControl);
  if (headers.lastModified) list.emplace_back("Last-Modified", *headers.lastModified);
  return list;
}

void StorebagTestServer::serveEnvelope(const std::string& name, const Bytes& envelope, const StorebagHeaders& headers,
                                       std::chrono::milliseconds delay) {
  ScriptedAnswer answer;
  answer.status = 200;
  answer.headers = headerList(headers);
  answer.body = textOf(envelope);
  answer.delay = delay;
  server_.setAnswer(pathFor(name), std::move(answer));
}

Bytes StorebagTestServer::serveDocument(const std::string& name, const Value& document,
                                        const StorebagHeaders& headers) {
  Bytes envelope = SignedEnvelopeBuilder().sign(document);
  serveEnvelope(name, envelope, headers);
  return envelope;
}

Bytes StorebagTestServer::serveTampered(const std::string& name, const Value& document,
                                        const StorebagHeaders& headers) {
  Bytes envelope = tamper::changeBagByte(SignedEnvelopeBuilder().sign(document), 10);
  serveEnvelope(name, envelope, headers);
  return envelope;
}

void StorebagTestServer::serveNotModified(const std::string& name, const StorebagHeaders& headers) {
  ScriptedAnswer answer;
  answer.status = 304;
  answer.headers = headerList(headers);
  server_.setAnswer(pathFor(name), std::move(answer));
}

void StorebagTestServer::serveEmpty(const std::string& name, const StorebagHeaders& headers) {
  ScriptedAnswer answer;
  answer.status = 200;
  answer.headers = headerList(headers);
  server_.setAnswer(pathFor(name), std::move(answer));
}

void StorebagTestServer::serveStatus(const std::string& name, int status) {
  ScriptedAnswer answer;
  answer.status = status;
  answer.body = "status " + std::to_string(status);
  answer.contentType = "text/plain";
  server_.setAnswer(pathFor(name), std::move(answer));
}

void StorebagTestServer::serveGarbage(const std::string& name, const StorebagHeaders& headers) {
  ScriptedAnswer answer;
  answer.status = 200;
  answer.headers = headerList(headers);
  answer.body = garbageBody();
  server_.setAnswer(pathFor(name), std::move(answer));
}

void StorebagTestServer::serveNoAnswerFor(const std::string& name, std::chrono::milliseconds delay) {
  ScriptedAnswer answer;
  answer.delay = delay;
  answer.closeWithoutAnswer = true;
  server_.setAnswer(pathFor(name), std::move(answer));
}

void StorebagTestServer::serveCloseWithoutAnswer(const std::string& name) {
  ScriptedAnswer answer;
  answer.closeWithoutAnswer = true;
  server_.setAnswer(pathFor(name), std::move(answer));
}

std::vector<ReceivedRequest> StorebagTestServer::requestsFor(const std::string& name) const {
  return server_.requestsForPath(pathFor(name));
}

std::size_t StorebagTestServer::requestCountFor(const std::string& name) const { return requestsFor(name).size(); }

bool StorebagTestServer::waitForRequestsFor(const std::string& name, std::size_t count,
                                            std::chrono::milliseconds timeout) const {
  return waitUntil([&] { return requestCountFor(name) >= count; }, timeout);
}

const std::string& StorebagTestServer::garbageBody() {
  // Binary noise, a NUL byte and the start of an XML tag: no decoder takes it.
  static const char raw[] = "\x01\xfe garbage \x00\x7f not a storebag <plist";
  static const std::string body(raw, sizeof raw - 1);
  return body;
}

}  // namespace telvane::test
