// DeliveryCollector: the delivery benchmark's loopback HTTPS server (127.0.0.1, an
// ephemeral port, the benchmark's self-signed certificate). It plays two servers:
//
// - the storebag server: GET /bags/<name> answers the signed envelope for every
//   storebag name, with a max age of a day;
// - the event collector: POST /post/batch and POST /post/realtime take the daemon's
//   JSON posts, decompress gzip bodies and count, cheaply (a byte search, no JSON
//   parse), the event records ("_eventNumber" keys) and the benchmark's own events
//   (the marker key its clients put into every payload). Realtime posts also yield
//   latencies: the client writes its send time (CLOCK_MONOTONIC nanoseconds) into the
//   payload, and the collector subtracts it from the moment the request reached it.
//
// The server gives each connection a worker thread for as long as the connection is
// kept alive, so it needs more workers than the daemon opens connections; it counts
// the connections of a run so that the report can tell when the pool was too small.
//
// For the gzip comparison it keeps the decompressed batch bodies of a run, up to a
// byte budget, with the number of benchmark events in them.
//
// Threading: every member function is thread-safe; requests are handled on the
// server's worker threads, counters are guarded by mutex_.
#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <set>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

namespace httplib {
class SSLServer;
}

namespace telvane::bench {

// The payload key every benchmark event carries (its value is the client's index).
inline constexpr const char* kDeliveryMarkerKey = "clientIndex";
// The payload key of a realtime event's send time (CLOCK_MONOTONIC nanoseconds).
inline constexpr const char* kDeliverySentTimeKey = "sentNs";

class DeliveryCollector {
 public:
  struct Counts {
    long batchPosts = 0;
    long realtimePosts = 0;
    long gzipPosts = 0;          // bodies that came gzip-compressed
    long records = 0;            // "_eventNumber" keys in all posts
    long benchEvents = 0;        // marker keys in all posts
    long long wireBytes = 0;     // bodies as posted
    long long jsonBytes = 0;     // bodies decompressed
    long badBodies = 0;          // bodies that did not decompress
    long storebagRequests = 0;
    long connections = 0;        // distinct client ports the posts came from
    std::int64_t lastArrivalNs = 0;    // the latest post of the run
    std::int64_t targetReachedNs = 0;  // when benchEvents reached the run's target; 0 before
  };

  struct KeptBodies {
    std::vector<std::string> bodies;  // decompressed JSON documents, as posted
    long benchEvents = 0;             // marker keys in them
    long records = 0;
  };

  // Listens at once with `threads` workers; nothing (and the reason in `error`) when
  // the certificate does not load or the port cannot be bound.
  static std::unique_ptr<DeliveryCollector> start(const std::string& certificateFile, const std::string& keyFile,
                                                  int threads, std::string* error);
  ~DeliveryCollector();
  DeliveryCollector(const DeliveryCollector&) = delete;
  DeliveryCollector& operator=(const DeliveryCollector&) = delete;

  // "https://127.0.0.1:<port>" + path.
  std::string url(const std::string& path) const;

  void setStorebagEnvelope(std::string envelope);

  // Starts a run: zero counts, no latencies, no kept bodies. The run's target is the
  // number of benchmark events whose arrival completes it; batch bodies are kept up to
  // `keepBytes` decompressed bytes.
  void beginRun(long targetEvents, std::size_t keepBytes);
  Counts counts() const;
  // Send-to-arrival times of the realtime events of the run, in arrival order.
  std::vector<std::int64_t> realtimeLatenciesNs() const;
  // Hands the kept bodies over (and keeps no more of them).
  KeptBodies takeKeptBodies();

  void stop();

 private:
  DeliveryCollector() = default;
  void handlePost(const void* request, void* response, bool realtime);
  void handleStorebag(void* response);

  std::unique_ptr<httplib::SSLServer> server_;
  std::thread thread_;
  int port_ = 0;

  mutable std::mutex mutex_;
  std::string envelope_;                // guarded by mutex_
  Counts counts_;                       // guarded by mutex_
  long targetEvents_ = 0;               // guarded by mutex_
  std::size_t keepBytes_ = 0;           // guarded by mutex_
  std::size_t keptBytes_ = 0;           // guarded by mutex_
  KeptBodies kept_;                     // guarded by mutex_
  std::vector<std::int64_t> latencies_;  // guarded by mutex_
  std::set<int> ports_;                  // guarded by mutex_
};

// Occurrences of `needle` in `text`.
long countOccurrences(std::string_view text, std::string_view needle);
// Decompresses a gzip stream; false when it is not one.
bool gunzip(std::string_view compressed, std::string* out);

}  // namespace telvane::bench
