#include "devserver/HttpsCollector.h"

#include <httplib.h>

#include <algorithm>
#include <cctype>
#include <chrono>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <iterator>

#include "devserver/Gunzip.h"
#include "platform/Json.h"
#include "platform/PropertyList.h"

namespace telvane::devserver {

namespace {

// Far above anything the daemon sends (a batch, a compressed log file).
constexpr std::size_t kMaxBodyBytes = std::size_t{64} << 20;
// An idle kept-alive connection holds one of the server's worker threads.
constexpr time_t kKeepAliveSeconds = 2;

// The request headers an arrival record keeps.
const char* const kInterestingHeaders[] = {
    "X-TVX-Client-Name", "X-TVX-Service-Name", "X-TVX-Internal-Build", "X-TVX-Client-Version",
    "X-TVX-Sender",      "X-TVX-Event-Map",    "X-TVX-DIGEST",         "User-Agent",
    "Accept",            "Content-Type",       "Content-Length",       "Content-Encoding",
    "If-Modified-Since"};

Value headersOf(const httplib::Request& request) {
  Dictionary headers;
  for (const char* name : kInterestingHeaders) {
    if (request.has_header(name)) headers.set(name, Value(request.get_header_value(name)));
  }
  return Value(std::move(headers));
}

bool startsWith(const std::string& text, const std::string& prefix) { return text.rfind(prefix, 0) == 0; }

// Record keys the backend adds to every record; the readable line leaves them out so
// that what the client sent stands out.
bool isStandardRecordKey(const std::string& key) { return startsWith(key, "_") || key == "eventTime"; }

std::string joinedKeys(const Value& record) {
  std::string keys;
  if (const Dictionary* entries = record.asDictionary()) {
    for (const auto& [key, value] : *entries) {
      if (isStandardRecordKey(key)) continue;
      keys += (keys.empty() ? "" : ",") + key;
    }
  }
  return keys.empty() ? "-" : keys;
}

// A name made only of harmless characters, for files in the uploads folder.
std::string safeFileName(const std::string& name) {
  std::string out;
  for (char c : std::filesystem::path(name).filename().string()) {
    unsigned char u = static_cast<unsigned char>(c);
    out += std::isalnum(u) || c == '.' || c == '-' || c == '_' ? c : '_';
  }
  while (!out.empty() && out.front() == '.') out.erase(out.begin());
  return out.empty() ? "upload" : out;
}

bool writeFile(const std::string& path, const std::string& bytes) {
  std::ofstream out(path, std::ios::binary | std::ios::trunc);
  out.write(bytes.data(), static_cast<std::streamsize>(bytes.size()));
  out.close();
  return static_cast<bool>(out);
}

std::string quotedIfBlank(const std::string& text) {
  return text.find(' ') == std::string::npos && !text.empty() ? text : "\"" + text + "\"";
}

}  // namespace

HttpsCollector::HttpsCollector(ArrivalLog& log, HttpsCollectorFiles files) : log_(log), files_(std::move(files)) {}

HttpsCollector::~HttpsCollector() { stop(); }

Result<std::uint16_t> HttpsCollector::bind(std::uint16_t port) {
  using R = Result<std::uint16_t>;
  server_ = std::make_unique<httplib::SSLServer>(files_.certificate.c_str(), files_.certificateKey.c_str());
  if (!server_->is_valid()) {
    return R::failure("cannot load the TLS certificate " + files_.certificate + " and key " + files_.certificateKey);
  }
  server_->set_payload_max_length(kMaxBodyBytes);
  server_->set_keep_alive_timeout(kKeepAliveSeconds);
  server_->Get("/storebags/.*", [this](const httplib::Request& request, httplib::Response& response) {
    handleStorebag(request, response);
  });
  server_->Get("/uploads/.*", [this](const httplib::Request& request, httplib::Response& response) {
    handleUploadedFile(request, response);
  });
  server_->Get(".*", [this](const httplib::Request& request, httplib::Response& response) {
    handleUnknown(request, response);
  });
  server_->Post(".*", [this](const httplib::Request& request, httplib::Response& response) {
    handlePost(request, response);
  });
  server_->Put(".*", [this](const httplib::Request& request, httplib::Response& response) {
    handleUnknown(request, response);
  });
  server_->Delete(".*", [this](const httplib::Request& request, httplib::Response& response) {
    handleUnknown(request, response);
  });
  if (port == 0) {
    int bound = server_->bind_to_any_port("127.0.0.1");
    if (bound <= 0) return R::failure("cannot bind HTTPS on 127.0.0.1");
    port_ = static_cast<std::uint16_t>(bound);
  } else {
    if (!server_->bind_to_port("127.0.0.1", port)) {
      return R::failure("cannot bind HTTPS on 127.0.0.1:" + std::to_string(port));
    }
    port_ = port;
  }
  return R::success(port_);
}

void HttpsCollector::serve(std::shared_ptr<const StorebagResponder> responder) {
  responder_ = std::move(responder);
  thread_ = std::thread([this] { server_->listen_after_bind(); });
  // Wait until the accept loop runs, so that a stop() right after finds it.
  auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (!server_->is_running() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
}

void HttpsCollector::stop() {
  if (server_) server_->stop();
  if (thread_.joinable()) thread_.join();
}

void HttpsCollector::refuse(const httplib::Request& request, httplib::Response& response, int status,
                            const std::string& problem) {
  response.status = status;
  response.set_content(problem + "\n", "text/plain");
  log_.report("https " + request.method + " " + request.path + " " + std::to_string(status) + ": " + problem,
              Value(Dictionary{{"kind", "refused"},
                               {"method", request.method},
                               {"path", request.path},
                               {"status", status},
                               {"problem", problem},
                               {"headers", headersOf(request)}}));
}

void HttpsCollector::handleUnknown(const httplib::Request& request, httplib::Response& response) {
  if (request.method == "GET" && request.path == "/") {
    const std::string base = "https://127.0.0.1:" + std::to_string(port_);
    response.set_content("telvane-devserver\n"
                         "  storebags: " + base + "/storebags/NAME\n"
                         "  events:    POST " + base + "/events\n"
                         "  uploads:   POST " + base + "/upload\n"
                         "  log data:  POST " + base + "/dashboard/logs\n",
                         "text/plain");
    return;
  }
  refuse(request, response, 404, "nothing here");
}

void HttpsCollector::handleStorebag(const httplib::Request& request, httplib::Response& response) {
  const std::string name = request.path.substr(std::string("/storebags/").size());
  std::optional<std::string> ifModifiedSince;
  if (request.has_header("If-Modified-Since")) ifModifiedSince = request.get_header_value("If-Modified-Since");
  StorebagAnswer answer = responder_->answer(name, ifModifiedSince);
  response.status = answer.status;
  for (const auto& [header, value] : answer.headers) response.set_header(header, value);
  if (answer.status == 200) {
    response.set_content(std::string(answer.body.begin(), answer.body.end()), "application/x-plist");
  } else if (!answer.problem.empty()) {
    response.set_content(answer.problem + "\n", "text/plain");
  }

  std::string line = "storebag " + name + " " + std::to_string(answer.status);
  if (answer.status == 200) {
    line += " (version " + quotedIfBlank(answer.version) + ", " + answer.headers.front().second + ")";
  }
  if (answer.status == 304) line += " (not modified since " + ifModifiedSince.value_or("") + ")";
  if (!answer.problem.empty()) line += ": " + answer.problem;
  if (!request.params.empty()) line += " query " + request.target.substr(request.target.find('?') + 1);
  Dictionary record{{"kind", "storebag"},
                    {"name", name},
                    {"status", answer.status},
                    {"query", Value(request.target.find('?') == std::string::npos
                                        ? std::string()
                                        : request.target.substr(request.target.find('?') + 1))},
                    {"headers", headersOf(request)}};
  if (request.has_param("version")) record.set("daemonVersion", Value(request.get_param_value("version")));
  if (!answer.version.empty()) record.set("version", Value(answer.version));
  if (!answer.file.empty()) record.set("file", Value(answer.file));
  if (!answer.problem.empty()) record.set("problem", Value(answer.problem));
  for (const auto& [header, value] : answer.headers) {
    if (header == "Last-Modified") record.set("lastModified", Value(value));
  }
  log_.report(line, Value(std::move(record)));
}

void HttpsCollector::handleUploadedFile(const httplib::Request& request, httplib::Response& response) {
  const std::string name = request.path.substr(std::string("/uploads/").size());
  if (name.empty() || name != safeFileName(name)) return refuse(request, response, 404, "no such upload");
  std::ifstream in(files_.uploadsDir + "/" + name, std::ios::binary);
  if (!in) return refuse(request, response, 404, "no such upload");
  std::string bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  response.set_content(bytes, "application/octet-stream");
}

void HttpsCollector::handlePost(const httplib::Request& request, httplib::Response& response) {
  // The HTTP library inflates gzip bodies itself when it can; inflate what is still
  // compressed.
  std::string body = request.body;
  if (looksGzipped(body)) {
    std::optional<std::string> inflated = gunzip(body, kMaxBodyBytes);
    if (!inflated) return refuse(request, response, 400, "the gzip body cannot be inflated");
    body = std::move(*inflated);
  }
  if (startsWith(request.path, "/upload")) return handleFileUpload(request, response, body);
  if (startsWith(request.path, "/dashboard")) return handleLogData(request, response, body);
  handleEventPost(request, response, body);
}

void HttpsCollector::handleEventPost(const httplib::Request& request, httplib::Response& response,
                                     const std::string& body) {
  Result<Value> document = json::parse(body);
  if (!document) return refuse(request, response, 400, "the body is not JSON: " + document.error());
  const Array* events = (*document)["events"].asArray();
  if (!document->isDictionary() || !events) {
    return refuse(request, response, 400, "the body is not an event post (no \"events\" array)");
  }
  const bool gzip = request.get_header_value("Content-Encoding") == "gzip" || looksGzipped(request.body);
  const Value headers = headersOf(request);
  const std::string clientHeader = request.get_header_value("X-TVX-Client-Name");
  const std::string serviceHeader = request.get_header_value("X-TVX-Service-Name");

  if (events->empty()) {
    log_.report("https POST " + request.path + " an event post without events",
                Value(Dictionary{{"kind", "event"},
                                 {"path", request.path},
                                 {"count", 0},
                                 {"gzip", gzip},
                                 {"postTime", (*document)["postTime"]},
                                 {"clientId", (*document)["clientId"]},
                                 {"headers", headers}}));
  }
  const std::size_t count = events->size();
  for (std::size_t index = 0; index < count; ++index) {
    const Value& record = (*events)[index];
    Value client = record["_clientName"];
    if (client.isNull() && !clientHeader.empty()) client = Value(clientHeader);
    Value service = record["_serviceName"];
    if (service.isNull() && !serviceHeader.empty()) service = Value(serviceHeader);
    std::string line = "https POST " + request.path + " client=" + readableText(client) +
                       " service=" + readableText(service) + " sender=" + readableText(record["_sender"]) +
                       " category=" + readableText(record["_method"]) + " type=" + readableText(record["_status"]) +
                       " keys=" + joinedKeys(record);
    if (count > 1) line += " (" + std::to_string(index + 1) + "/" + std::to_string(count) + ")";
    if (gzip) line += " gzip";
    log_.report(line, Value(Dictionary{{"kind", "event"},
                                       {"path", request.path},
                                       {"client", client},
                                       {"service", service},
                                       {"sender", record["_sender"]},
                                       {"category", record["_method"]},
                                       {"type", record["_status"]},
                                       {"index", Value(static_cast<unsigned long long>(index))},
                                       {"count", Value(static_cast<unsigned long long>(count))},
                                       {"gzip", gzip},
                                       {"postTime", (*document)["postTime"]},
                                       {"clientId", (*document)["clientId"]},
                                       {"headers", headers},
                                       {"record", record}}));
  }
  response.status = 200;
  response.set_content("{\"status\":\"ok\"}", "application/json");
}

std::string HttpsCollector::nextUploadName(const std::string& suggested) {
  unsigned number = ++uploadCount_;
  char prefix[32];
  std::snprintf(prefix, sizeof prefix, "%04u-", number);
  return prefix + safeFileName(suggested);
}

void HttpsCollector::handleFileUpload(const httplib::Request& request, httplib::Response& response,
                                      const std::string& body) {
  std::string fileName = request.get_param_value("filename");
  // The file arrives compressed; it is kept inflated, without the ".gz" the name says.
  std::string storedName = fileName;
  if (storedName.size() > 3 && storedName.compare(storedName.size() - 3, 3, ".gz") == 0) {
    storedName.resize(storedName.size() - 3);
  }
  const std::string saved = files_.uploadsDir + "/" + nextUploadName(storedName.empty() ? "upload" : storedName);
  if (!writeFile(saved, body)) return refuse(request, response, 500, "cannot save the upload to " + saved);
  const bool gzip = request.get_header_value("Content-Encoding") == "gzip" || looksGzipped(request.body);

  Dictionary query;
  for (const auto& [key, value] : request.params) query.set(key, Value(value));
  log_.report("upload POST " + request.path + " file=" + quotedIfBlank(fileName) + " " + std::to_string(body.size()) +
                  " bytes" + (gzip ? " gzip" : "") + " device=" + request.get_param_value("uuid") +
                  " sequence=" + request.get_param_value("sequence") + " saved as " + saved,
              Value(Dictionary{{"kind", "upload"},
                               {"path", request.path},
                               {"filename", fileName},
                               {"description", Value(request.get_param_value("description"))},
                               {"device", Value(request.get_param_value("uuid"))},
                               {"sequence", Value(request.get_param_value("sequence"))},
                               {"query", Value(std::move(query))},
                               {"bytes", Value(static_cast<unsigned long long>(body.size()))},
                               {"gzip", gzip},
                               {"savedAs", saved},
                               {"headers", headersOf(request)}}));
  // The backend deletes the client's file when the answer says "success".
  response.status = 200;
  Result<std::string> text = json::write(Value(Dictionary{{"status", "success"}, {"savedAs", saved}}));
  response.set_content(text ? *text : std::string("{\"status\":\"success\"}"), "application/json");
}

void HttpsCollector::handleLogData(const httplib::Request& request, httplib::Response& response,
                                   const std::string& body) {
  Result<Value> archive = plist::decode(body);
  const std::string name = nextUploadName("logdata.plist");
  const std::string saved = files_.uploadsDir + "/" + name;
  if (!writeFile(saved, body)) return refuse(request, response, 500, "cannot save the log data to " + saved);
  const std::string location = "https://127.0.0.1:" + std::to_string(port_) + "/uploads/" + name;
  std::string line = "logdata POST " + request.path + " " + std::to_string(body.size()) + " bytes";
  Dictionary record{{"kind", "logdata"},
                    {"path", request.path},
                    {"bytes", Value(static_cast<unsigned long long>(body.size()))},
                    {"savedAs", saved},
                    {"location", location},
                    {"headers", headersOf(request)}};
  if (archive) {
    const Array* entries = archive->asArray();
    std::size_t count = entries ? entries->size() : 1;
    line += ", " + std::to_string(count) + (count == 1 ? " entry" : " entries");
    record.set("entries", Value(static_cast<unsigned long long>(count)));
  } else {
    line += ", not a property list";
    record.set("problem", Value("not a property list: " + archive.error()));
  }
  line += ", saved as " + saved;
  log_.report(line, Value(std::move(record)));
  // The backend reads the answer as the place the data went.
  response.status = 200;
  response.set_content(location, "text/plain");
}

}  // namespace telvane::devserver
