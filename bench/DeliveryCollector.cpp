#include "DeliveryCollector.h"

#include <httplib.h>
#include <string.h>
#include <zlib.h>

#include <chrono>
#include <cstdlib>

#include "BenchClient.h"

namespace telvane::bench {

namespace {

constexpr const char* kRecordKey = "\"_eventNumber\":";
// A kept-alive connection serves this many requests before the server closes it:
// in effect without limit, so that the daemon's connection pool is reused as it would
// be with a real collector.
constexpr std::size_t kKeepAliveRequests = 1'000'000;
// An idle kept-alive connection holds a worker this long.
constexpr time_t kKeepAliveSeconds = 10;
constexpr std::size_t kInflateChunk = 64 * 1024;

std::string quotedKey(const char* key) { return std::string("\"") + key + "\":"; }

// The integers that follow each occurrence of the key.
std::vector<std::int64_t> integersAfter(std::string_view text, std::string_view key) {
  std::vector<std::int64_t> values;
  std::size_t at = 0;
  while ((at = text.find(key, at)) != std::string_view::npos) {
    at += key.size();
    std::int64_t value = 0;
    bool any = false;
    while (at < text.size() && text[at] >= '0' && text[at] <= '9') {
      value = value * 10 + (text[at] - '0');
      any = true;
      ++at;
    }
    if (any) values.push_back(value);
  }
  return values;
}

bool isGzip(std::string_view body) {
  return body.size() >= 2 && static_cast<unsigned char>(body[0]) == 0x1f && static_cast<unsigned char>(body[1]) == 0x8b;
}

}  // namespace

long countOccurrences(std::string_view text, std::string_view needle) {
  long count = 0;
  const char* at = text.data();
  const char* end = text.data() + text.size();
  while (at < end) {
    const void* found = ::memmem(at, static_cast<std::size_t>(end - at), needle.data(), needle.size());
    if (!found) break;
    ++count;
    at = static_cast<const char*>(found) + needle.size();
  }
  return count;
}

bool gunzip(std::string_view compressed, std::string* out) {
  z_stream stream{};
  // 16 + MAX_WBITS: a gzip header and trailer around the deflate stream.
  if (inflateInit2(&stream, 16 + MAX_WBITS) != Z_OK) return false;
  stream.next_in = reinterpret_cast<Bytef*>(const_cast<char*>(compressed.data()));
  stream.avail_in = static_cast<uInt>(compressed.size());
  out->clear();
  int status = Z_OK;
  while (status == Z_OK) {
    const std::size_t used = out->size();
    out->resize(used + kInflateChunk);
    stream.next_out = reinterpret_cast<Bytef*>(out->data() + used);
    stream.avail_out = static_cast<uInt>(kInflateChunk);
    status = inflate(&stream, Z_NO_FLUSH);
    out->resize(used + kInflateChunk - stream.avail_out);
    if (status == Z_BUF_ERROR && stream.avail_in == 0) break;  // truncated input
  }
  inflateEnd(&stream);
  return status == Z_STREAM_END;
}

std::unique_ptr<DeliveryCollector> DeliveryCollector::start(const std::string& certificateFile,
                                                            const std::string& keyFile, int threads,
                                                            std::string* error) {
  std::unique_ptr<DeliveryCollector> collector(new DeliveryCollector());
  collector->server_ = std::make_unique<httplib::SSLServer>(certificateFile.c_str(), keyFile.c_str());
  httplib::SSLServer& server = *collector->server_;
  if (!server.is_valid()) {
    if (error) *error = "the HTTPS server cannot load its certificate";
    return nullptr;
  }
  const std::size_t workers = static_cast<std::size_t>(threads > 0 ? threads : 1);
  server.new_task_queue = [workers] { return new httplib::ThreadPool(workers); };
  server.set_keep_alive_max_count(kKeepAliveRequests);
  server.set_keep_alive_timeout(kKeepAliveSeconds);
  DeliveryCollector* self = collector.get();
  server.Get(R"(/bags/[^/]+)", [self](const httplib::Request&, httplib::Response& response) {
    self->handleStorebag(&response);
  });
  server.Post("/post/batch", [self](const httplib::Request& request, httplib::Response& response) {
    self->handlePost(&request, &response, false);
  });
  server.Post("/post/realtime", [self](const httplib::Request& request, httplib::Response& response) {
    self->handlePost(&request, &response, true);
  });
  collector->port_ = server.bind_to_any_port("127.0.0.1");
  if (collector->port_ <= 0) {
    if (error) *error = "cannot bind 127.0.0.1";
    return nullptr;
  }
  collector->thread_ = std::thread([self] { self->server_->listen_after_bind(); });
  // The socket listens already; wait until the accept loop runs, so that stop() finds
  // it.
  const auto deadline = std::chrono::steady_clock::now() + std::chrono::seconds(10);
  while (!server.is_running() && std::chrono::steady_clock::now() < deadline) {
    std::this_thread::sleep_for(std::chrono::milliseconds(1));
  }
  return collector;
}

DeliveryCollector::~DeliveryCollector() { stop(); }

void DeliveryCollector::stop() {
  if (server_) server_->stop();
  if (thread_.joinable()) thread_.join();
}

std::string DeliveryCollector::url(const std::string& path) const {
  return "https://127.0.0.1:" + std::to_string(port_) + path;
}

void DeliveryCollector::setStorebagEnvelope(std::string envelope) {
  std::lock_guard<std::mutex> lock(mutex_);
  envelope_ = std::move(envelope);
}

void DeliveryCollector::beginRun(long targetEvents, std::size_t keepBytes) {
  std::lock_guard<std::mutex> lock(mutex_);
  const long storebagRequests = counts_.storebagRequests;
  counts_ = Counts{};
  counts_.storebagRequests = storebagRequests;
  targetEvents_ = targetEvents;
  keepBytes_ = keepBytes;
  keptBytes_ = 0;
  kept_ = KeptBodies{};
  latencies_.clear();
  ports_.clear();
}

DeliveryCollector::Counts DeliveryCollector::counts() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return counts_;
}

std::vector<std::int64_t> DeliveryCollector::realtimeLatenciesNs() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return latencies_;
}

DeliveryCollector::KeptBodies DeliveryCollector::takeKeptBodies() {
  std::lock_guard<std::mutex> lock(mutex_);
  KeptBodies taken = std::move(kept_);
  kept_ = KeptBodies{};
  keepBytes_ = 0;
  return taken;
}

void DeliveryCollector::handleStorebag(void* responsePointer) {
  auto& response = *static_cast<httplib::Response*>(responsePointer);
  std::string envelope;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    ++counts_.storebagRequests;
    envelope = envelope_;
  }
  if (envelope.empty()) {
    response.status = 404;
    return;
  }
  response.status = 200;
  response.set_header("Cache-Control", "max-age=86400");
  response.set_content(envelope, "application/octet-stream");
}

void DeliveryCollector::handlePost(const void* requestPointer, void* responsePointer, bool realtime) {
  // The arrival time comes first: decompressing and counting are the collector's own
  // cost, not the delivery's.
  const std::int64_t arrivedNs = monotonicNowNs();
  const auto& request = *static_cast<const httplib::Request*>(requestPointer);
  auto& response = *static_cast<httplib::Response*>(responsePointer);

  // The server's zlib support may have inflated the body already; what the daemon
  // put on the wire is then told by the request's headers.
  const bool sentCompressed = request.get_header_value("Content-Encoding") == "gzip";
  long long wireBytes = static_cast<long long>(request.body.size());
  if (request.has_header("Content-Length")) wireBytes = std::atoll(request.get_header_value("Content-Length").c_str());
  std::string inflated;
  bool bad = false;
  std::string_view json = request.body;
  if (isGzip(request.body)) {
    if (gunzip(request.body, &inflated)) {
      json = inflated;
    } else {
      bad = true;
      json = {};
    }
  }
  static const std::string markerKey = quotedKey(kDeliveryMarkerKey);
  static const std::string sentTimeKey = quotedKey(kDeliverySentTimeKey);
  const long records = countOccurrences(json, kRecordKey);
  const long benchEvents = countOccurrences(json, markerKey);
  std::vector<std::int64_t> sentTimes;
  if (realtime) sentTimes = integersAfter(json, sentTimeKey);

  {
    std::lock_guard<std::mutex> lock(mutex_);
    Counts& c = counts_;
    (realtime ? c.realtimePosts : c.batchPosts) += 1;
    c.gzipPosts += sentCompressed || isGzip(request.body);
    c.records += records;
    c.wireBytes += wireBytes;
    c.jsonBytes += static_cast<long long>(json.size());
    c.badBodies += bad;
    const bool wasShort = c.benchEvents < targetEvents_;
    c.benchEvents += benchEvents;
    c.lastArrivalNs = std::max(c.lastArrivalNs, arrivedNs);
    if (ports_.insert(request.remote_port).second) c.connections = static_cast<long>(ports_.size());
    if (wasShort && c.benchEvents >= targetEvents_) c.targetReachedNs = arrivedNs;
    for (std::int64_t sent : sentTimes) latencies_.push_back(arrivedNs - sent);
    if (!realtime && benchEvents > 0 && keptBytes_ + json.size() <= keepBytes_) {
      kept_.bodies.emplace_back(json);
      kept_.benchEvents += benchEvents;
      kept_.records += records;
      keptBytes_ += json.size();
    }
  }
  response.status = 200;
}

}  // namespace telvane::bench
