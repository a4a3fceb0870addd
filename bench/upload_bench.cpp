// Upload of one file at the maximum upload size: the real telvaned (this build's),
// the client library in this process, and a loopback HTTPS server that serves the
// signed storebag (one "upload_server" backend) and takes the upload.
//
// For each kind of contents (log-like text that compresses well, and random bytes that
// do not) it uploads one file of the size and reports the time from the call to the
// daemon's answer, the daemon's CPU time for it, the bytes that arrived (the server
// inflates the gzip body, so this is the file's size when all of it arrived), and the
// daemon's peak resident memory (VmHWM) before and after. Each kind runs in a
// fresh daemon, so that its peak is its own.
//
//   cmake --build build/rel --target telvane_upload_bench && build/rel/bench/telvane_upload_bench [--size BYTES]
#include <httplib.h>

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <future>
#include <mutex>
#include <random>
#include <string>

#include "BenchCertificate.h"
#include "BenchDaemon.h"
#include "DeliveryStorebag.h"
#include "platform/Log.h"
#include "platform/SqliteSettingsStore.h"
#include "telvane/Telvane.h"
#include "telvane/TelvaneKeys.h"

using namespace telvane;
using namespace telvane::bench;

namespace {

// The daemon's default maximum upload size.
constexpr long long kDefaultSize = 16LL * 1024 * 1024;

struct UploadServer {
  httplib::SSLServer server;
  std::thread thread;
  int port = 0;
  std::mutex mutex;
  std::string envelope;         // guarded by mutex
  std::size_t receivedBytes = 0;  // guarded by mutex

  UploadServer(const std::string& certificate, const std::string& key) : server(certificate.c_str(), key.c_str()) {
    server.Get(R"(/bags/.*)", [this](const httplib::Request&, httplib::Response& response) {
      std::lock_guard<std::mutex> lock(mutex);
      response.set_header("Cache-Control", "max-age=86400");
      response.set_content(envelope, "application/octet-stream");
    });
    server.Post("/upload", [this](const httplib::Request& request, httplib::Response& response) {
      {
        std::lock_guard<std::mutex> lock(mutex);
        receivedBytes = request.body.size();
      }
      response.set_content("success", "text/plain");
    });
    server.set_payload_max_length(1LL << 32);
    port = server.bind_to_any_port("127.0.0.1");
    thread = std::thread([this] { server.listen_after_bind(); });
  }
  ~UploadServer() {
    server.stop();
    if (thread.joinable()) thread.join();
  }
  std::string url(const std::string& path) const { return "https://127.0.0.1:" + std::to_string(port) + path; }
};

std::string makeContents(bool compressible, long long size) {
  std::string contents;
  contents.reserve(static_cast<std::size_t>(size));
  std::mt19937_64 random(42);
  if (compressible) {
    long line = 0;
    while (static_cast<long long>(contents.size()) < size) {
      contents += "2026-11-23 12:" + std::to_string(line % 60) + " media: frame " + std::to_string(line) +
                  " jitter " + std::to_string(random() % 40) + " ms, bitrate " + std::to_string(random() % 4000) +
                  " kbit/s\n";
      ++line;
    }
  } else {
    while (static_cast<long long>(contents.size()) < size) {
      std::uint64_t word = random();
      contents.append(reinterpret_cast<const char*>(&word), sizeof word);
    }
  }
  contents.resize(static_cast<std::size_t>(size));
  return contents;
}

struct Measured {
  bool ok = false;
  double wallSeconds = 0;
  double daemonCpuSeconds = 0;
  long peakBeforeKiB = 0;
  long peakAfterKiB = 0;
  std::size_t receivedBytes = 0;
};

Measured uploadOnce(const std::string& daemonPath, const std::string& scratch, UploadServer& server,
                    const std::string& certificate, const std::string& publicKey, const std::string& file,
                    long long size) {
  Measured measured;
  const std::string directory = scratch + "/daemon-" + std::to_string(std::rand());
  std::filesystem::create_directories(directory);
  BenchDaemon daemon(daemonPath, directory, "error", {});
  {
    auto settings = SqliteSettingsStore::open(daemon.defaultsPath());
    if (!settings || !settings->write("com.zembra.telvane", "telvane_storebag_url", Value(server.url("/bags"))) ||
        (size > kDefaultSize && !settings->write("com.zembra.telvane", "maxUploadFileSize", Value(size)))) {
      std::fprintf(stderr, "cannot write the daemon's settings\n");
      return measured;
    }
  }
  daemon.setEnvironment("TELVANED_CA_FILE", certificate);
  daemon.setEnvironment("TELVANED_PUBLIC_KEY", publicKey);
  if (!daemon.start(std::chrono::seconds(20))) {
    std::fprintf(stderr, "the daemon did not start\n");
    return measured;
  }
  ::setenv("TELVANED_SOCKET", daemon.socketPath().c_str(), 1);
  auto session = Telvane::create(Value(Dictionary{{kTelvaneSessionInfoClientType, Value(7)},
                                                  {kTelvaneSessionInfoSessionID, Value(1)}}),
                                 Value(Dictionary{{kTelvaneUserInfoClientName, Value("com.example.bench")},
                                                  {kTelvaneUserInfoServiceName, Value("uploads")}}),
                                 Value());
  std::promise<bool> started;
  session->startConfigurationWithCompletionHandler([&started](bool ok) { started.set_value(ok); });
  if (!started.get_future().get() || !session->serverSupportsFileUpload()) {
    std::fprintf(stderr, "the session has no upload backend\n");
    return measured;
  }
  measured.peakBeforeKiB = daemon.peakResidentKiB().value_or(0);
  const double cpuBefore = daemon.cpuSeconds().value_or(0);
  std::promise<bool> uploaded;
  const auto begin = std::chrono::steady_clock::now();
  session->uploadFileWithURL(file, [&uploaded](bool ok) { uploaded.set_value(ok); });
  measured.ok = uploaded.get_future().get();
  measured.wallSeconds = std::chrono::duration<double>(std::chrono::steady_clock::now() - begin).count();
  measured.daemonCpuSeconds = daemon.cpuSeconds().value_or(0) - cpuBefore;
  measured.peakAfterKiB = daemon.peakResidentKiB().value_or(0);
  {
    std::lock_guard<std::mutex> lock(server.mutex);
    measured.receivedBytes = server.receivedBytes;
    server.receivedBytes = 0;
  }
  session.reset();
  daemon.stop(std::chrono::seconds(20));
  return measured;
}

}  // namespace

int main(int argc, char** argv) {
  long long size = kDefaultSize;
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--size") == 0 && i + 1 < argc) {
      size = std::atoll(argv[++i]);
    } else {
      std::fprintf(stderr, "usage: %s [--size BYTES]   (default: the maximum upload size, %lld)\n", argv[0],
                   kDefaultSize);
      return 2;
    }
  }
  if (size <= 0) return 2;
  auto prelude = prepareBenchRun(TELVANE_BENCH_DAEMON_PATH, "telvane-upload-bench");
  if (!prelude) return 1;
  log::setLevel(log::Level::Error);
  const std::string& scratch = prelude->scratch;
  const std::string certificate = scratch + "/server-cert.pem";
  const std::string key = scratch + "/server-key.pem";
  std::string problem;
  if (!writeSelfSignedCertificate(certificate, key, &problem)) {
    std::fprintf(stderr, "certificate: %s\n", problem.c_str());
    return 1;
  }
  UploadServer server(certificate, key);
  Value document(Dictionary{{"version", Value("upload-bench")}, {"refresh_cycle", Value(86400)}});
  for (const char* section : {"zembra_internal", "development", "seed", "release"}) {
    document.asDictionary()->set(
        section, Value(Dictionary{{"upload_server", Value(Dictionary{{"post_url", Value(server.url("/upload"))}})}}));
  }
  auto signedStorebag = signDeliveryStorebag(document, &problem);
  if (!signedStorebag) {
    std::fprintf(stderr, "storebag: %s\n", problem.c_str());
    return 1;
  }
  server.envelope.assign(signedStorebag->envelope.begin(), signedStorebag->envelope.end());
  const std::string publicKey = scratch + "/storebag-key.der";
  std::ofstream(publicKey, std::ios::binary)
      .write(reinterpret_cast<const char*>(signedStorebag->publicKeyDer.data()),
             static_cast<std::streamsize>(signedStorebag->publicKeyDer.size()));

  double load[3] = {};
  std::ifstream("/proc/loadavg") >> load[0] >> load[1] >> load[2];
  std::printf("upload of %lld bytes through telvaned (%s); load average %.2f %.2f %.2f\n\n", size,
              TELVANE_BENCH_DAEMON_PATH, load[0], load[1], load[2]);
  std::printf("%-14s %9s %9s %14s %14s %14s\n", "contents", "wall s", "cpu s", "arrived bytes", "peak RSS KiB",
              "before KiB");
  bool allOk = true;
  for (bool compressible : {true, false}) {
    const std::string file = scratch + (compressible ? "/text.log" : "/random.bin");
    std::ofstream(file, std::ios::binary) << makeContents(compressible, size);
    Measured m = uploadOnce(TELVANE_BENCH_DAEMON_PATH, scratch, server, certificate, publicKey, file, size);
    allOk = allOk && m.ok;
    std::printf("%-14s %9.3f %9.3f %14zu %14ld %14ld%s\n", compressible ? "log text" : "random bytes",
                m.wallSeconds, m.daemonCpuSeconds, m.receivedBytes, m.peakAfterKiB, m.peakBeforeKiB,
                m.ok ? "" : "  (upload failed)");
  }
  std::error_code ignored;
  std::filesystem::remove_all(scratch, ignored);
  return allOk ? 0 : 1;
}
