// telvane-devserver: a development server for telvaned on loopback. It serves signed
// storebags made on the fly from a folder of documents, receives the daemon's HTTPS
// event posts, file uploads and log-data uploads and the dashboard's UDP datagrams
// (acknowledging each), and shows every arrival as one line (`--help` for the
// details). Scripts and tests start it with `--port 0 --udp-port 0
// --once-ready-file FILE` and read the ports from that file.
//
// The main thread only starts the servers and then waits for SIGINT or SIGTERM; the
// HTTPS workers and the UDP reader do the work on their own threads.
#include <signal.h>
#include <sys/prctl.h>
#include <unistd.h>

#include <algorithm>
#include <cstdio>
#include <ctime>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include "devserver/ArrivalLog.h"
#include "devserver/DashboardCollector.h"
#include "devserver/DevServerOptions.h"
#include "devserver/DevServerState.h"
#include "devserver/HttpsCollector.h"
#include "devserver/StorebagResponder.h"
#include "platform/Log.h"

namespace {

using namespace telvane::devserver;

constexpr int kExitOk = 0;
constexpr int kExitFailure = 1;
constexpr int kExitUsage = 2;

int fail(const std::string& message) {
  std::fprintf(stderr, "telvane-devserver: %s\n", message.c_str());
  return kExitFailure;
}

// A value a POSIX shell reads back as it is: bare when harmless, else single-quoted.
std::string shellWord(const std::string& text) {
  bool plain = !text.empty() && text.find_first_not_of("abcdefghijklmnopqrstuvwxyzABCDEFGHIJKLMNOPQRSTUVWXYZ"
                                                       "0123456789_-./:,+=@%") == std::string::npos;
  if (plain) return text;
  std::string quoted = "'";
  for (char c : text) quoted += c == '\'' ? std::string("'\\''") : std::string(1, c);
  return quoted + "'";
}

// Writes through a temporary file and a rename: whoever waits for the file sees it
// complete or not at all.
bool writeReadyFile(const std::string& path, const std::vector<std::pair<std::string, std::string>>& entries) {
  std::string temporary = path + ".tmp." + std::to_string(::getpid());
  std::FILE* file = std::fopen(temporary.c_str(), "w");
  if (!file) return false;
  for (const auto& [name, value] : entries) std::fprintf(file, "%s=%s\n", name.c_str(), shellWord(value).c_str());
  bool ok = std::fclose(file) == 0;
  if (!ok || std::rename(temporary.c_str(), path.c_str()) != 0) {
    std::remove(temporary.c_str());
    return false;
  }
  return true;
}

// The storebag names the folder serves, for the start-up lines.
std::string servedNames(const std::string& folder) {
  std::vector<std::string> names;
  std::error_code error;
  for (const auto& entry : std::filesystem::directory_iterator(folder, error)) {
    if (!entry.is_regular_file(error)) continue;
    std::filesystem::path path = entry.path();
    std::string extension = path.extension().string();
    if (extension == ".json" || extension == ".plist") names.push_back(path.stem().string());
    else if (extension.empty()) names.push_back(path.filename().string());
  }
  std::sort(names.begin(), names.end());
  std::string text;
  for (const auto& name : names) text += (text.empty() ? "" : ", ") + name;
  return text.empty() ? "nothing yet" : text;
}

}  // namespace

int main(int argc, char** argv) {
  std::vector<std::string> arguments(argv + 1, argv + argc);
  auto parsed = parseDevServerOptions(arguments);
  if (!parsed) {
    std::fprintf(stderr, "telvane-devserver: %s\n%s", parsed.error().c_str(), kDevServerUsage);
    return kExitUsage;
  }
  const DevServerOptions& options = parsed.value();
  if (options.help) {
    std::fputs(kDevServerUsage, stdout);
    return kExitOk;
  }
  if (options.version) {
    std::printf("telvane-devserver %s\n", TELVANE_VERSION);
    return kExitOk;
  }
  telvane::log::useStandardError();

  // Signals are taken by the main thread; block them before any other thread exists.
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGTERM);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  ::signal(SIGPIPE, SIG_IGN);
  if (options.exitWithParent) {
    // The parent's end arrives as SIGTERM, a normal stop. A parent that ended before
    // this line leaves us adopted already.
    const pid_t parent = ::getppid();
    ::prctl(PR_SET_PDEATHSIG, SIGTERM);
    if (::getppid() != parent) return fail("the starting process has already ended");
  }

  auto state = DevServerState::prepare(options.stateDir);
  if (!state) return fail(state.error());
  std::error_code error;
  if (!std::filesystem::is_directory(options.storebagsDir, error)) {
    return fail("the storebag folder " + options.storebagsDir + " does not exist");
  }
  const std::string storebagsDir = std::filesystem::absolute(options.storebagsDir, error).lexically_normal().string();
  auto log = ArrivalLog::open(options.eventsFile, options.quiet);
  if (!log) return fail(log.error());
  std::unique_ptr<ArrivalLog> arrivals = std::move(log).value();

  HttpsCollector https(*arrivals, {state->certificatePath(), state->certificateKeyPath(), state->uploadsDir()});
  auto httpsPort = https.bind(options.httpsPort);
  if (!httpsPort) return fail(httpsPort.error());
  DashboardCollector dashboard(*arrivals);
  auto udpPort = dashboard.start(options.udpPort);
  if (!udpPort) return fail(udpPort.error());

  const std::string base = "https://127.0.0.1:" + std::to_string(*httpsPort);
  Placeholders placeholders{base, "127.0.0.1", *udpPort};
  https.serve(std::make_shared<StorebagResponder>(storebagsDir, state->signer(), placeholders, std::time(nullptr),
                                                  options.maxAgeSeconds));

  std::printf(
      "telvane-devserver ready\n"
      "  storebag URL:   %s/storebags   (serving %s from %s)\n"
      "  event posts:    %s/events\n"
      "  uploads:        %s/upload\n"
      "  dashboard UDP:  127.0.0.1:%u\n"
      "  state:          %s%s%s\n"
      "the daemon needs:\n"
      "  TELVANED_CA_FILE=%s\n"
      "  TELVANED_PUBLIC_KEY=%s\n"
      "  telvane-defaults write com.zembra.telvane telvane_storebag_url -string %s/storebags\n",
      base.c_str(), servedNames(storebagsDir).c_str(), storebagsDir.c_str(), base.c_str(), base.c_str(),
      static_cast<unsigned>(*udpPort), state->folder().c_str(),
      state->madeSigningKey() ? " (new storebag signing key)" : "",
      state->madeCertificate() ? " (new TLS certificate)" : "", state->certificatePath().c_str(),
      state->publicKeyPath().c_str(), base.c_str());
  std::fflush(stdout);

  if (!options.readyFile.empty()) {
    std::string eventsFile;
    if (!options.eventsFile.empty()) {
      eventsFile = std::filesystem::absolute(options.eventsFile, error).lexically_normal().string();
    }
    bool written = writeReadyFile(options.readyFile,
                                  {{"TELVANE_DEVSERVER_PID", std::to_string(::getpid())},
                                   {"TELVANE_DEVSERVER_HTTPS_PORT", std::to_string(*httpsPort)},
                                   {"TELVANE_DEVSERVER_UDP_PORT", std::to_string(*udpPort)},
                                   {"TELVANE_DEVSERVER_URL", base},
                                   {"TELVANE_DEVSERVER_STOREBAG_URL", base + "/storebags"},
                                   {"TELVANE_DEVSERVER_EVENTS_FILE", eventsFile},
                                   {"TELVANE_DEVSERVER_STATE_DIR", state->folder()},
                                   {"TELVANED_CA_FILE", state->certificatePath()},
                                   {"TELVANED_PUBLIC_KEY", state->publicKeyPath()}});
    if (!written) {
      https.stop();
      dashboard.stop();
      return fail("could not write " + options.readyFile);
    }
  }

  int signal = 0;
  while (sigwait(&signals, &signal) != 0) {
  }
  https.stop();
  dashboard.stop();
  // A stale ready file would send the next waiter to a server that is gone.
  if (!options.readyFile.empty()) std::remove(options.readyFile.c_str());
  std::printf("telvane-devserver stopped on signal %d\n", signal);
  return kExitOk;
}
