// telvaned: the telemetry-reporting daemon's entry point.
//
// Sets the main thread's priority class, opens the listener for the service
// "com.zembra.telvaned" (a socket handed over by the service manager, else the path
// of $TELVANED_SOCKET or /run/telvaned/com.zembra.telvaned), makes one TelvanedAgent
// its delegate and then waits for ever: all work runs on the executors. The daemon
// ends on SIGTERM or SIGINT, or by itself when no keep-alive transaction has been open
// for the idle period (socket activation brings it back on the next connection).
#include <signal.h>
#include <systemd/sd-daemon.h>

#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <memory>
#include <string>

#include "backends/TelvaneBackendFactory.h"
#include "daemon/TelvanedAgent.h"
#include "platform/Executors.h"
#include "platform/IpcListener.h"
#include "platform/KeepAlive.h"
#include "platform/Log.h"
#include "platform/LogOutput.h"
#include "platform/Paths.h"
#include "platform/SerialQueue.h"
#include "platform/SystemInfo.h"
#include "storebag/StorebagBackends.h"
#include "storebag/StorebagDocument.h"
#include "storebag/StorebagRetrieval.h"

namespace {

std::atomic<bool> gIdle{false};

void printUsage() {
  std::printf(
      "usage: telvaned [--version]\n"
      "\n"
      "The telemetry-reporting daemon. It is configured through its environment:\n"
      "  TELVANED_SOCKET              listening socket path (default /run/telvaned/com.zembra.telvaned)\n"
      "  TELVANED_ENTITLEMENTS_DIR    entitlement policy (default /etc/telvaned/entitlements.d)\n"
      "  TELVANED_IDLE_EXIT_SECONDS   exit after this long without sessions (0: never)\n"
      "  TELVANED_HELLO_TIMEOUT_SECONDS  how long a new client may take to say hello (10)\n"
      "  TELVANED_DEVICE_INFO         device-information override file\n"
      "  TELVANE_DEFAULTS_DB          settings database (the storebag server: telvane_storebag_url)\n"
      "  TELVANED_CA_FILE             extra trusted certificates (PEM) for the HTTPS servers\n"
      "  TELVANED_PUBLIC_KEY          storebag signature key (DER)\n"
      "  TELVANED_CACHE_DIR           storebag disk cache parent folder\n"
      "  TELVANED_STOREBAG_REFRESH_SPREAD_SECONDS  narrows the spread of background storebag refreshes (1..7200)\n"
      "  TELVANED_METRIX_ADAPTOR      diagnostics adaptor object (default " TELVANE_LIBDIR "/telvane/metrix-adaptor.so)\n"
      "  TELVANE_LOG_LEVEL            debug, info or error\n");
}

}  // namespace

int main(int argc, char** argv) {
  using namespace telvane;
  for (int i = 1; i < argc; ++i) {
    std::string arg = argv[i];
    if (arg == "--version") {
      std::printf("telvaned %s\n", TELVANE_VERSION);
      return 0;
    }
    printUsage();
    return arg == "--help" || arg == "-h" ? 0 : 2;
  }

  // Signals are taken synchronously by the main thread; block them before any worker
  // thread exists so that every thread inherits the mask.
  sigset_t signals;
  sigemptyset(&signals);
  sigaddset(&signals, SIGTERM);
  sigaddset(&signals, SIGINT);
  sigaddset(&signals, SIGHUP);
  pthread_sigmask(SIG_BLOCK, &signals, nullptr);
  ::signal(SIGPIPE, SIG_IGN);

  log::useSpdlog();
  setUtilityQualityOfService();
  log::info("startLogging: Daemon starts logging...");
  ReportingSessionConnectivityHelper::cleanupStorageRootFolder();

  auto listenerQueue = SerialQueue::create("com.zembra.telvaned.listener");
  std::shared_ptr<TelvanedAgent> agent;
  auto listener = IpcListener::create(listenerQueue, [&agent](UniqueFd connection) {
    if (agent) agent->acceptConnection(std::move(connection));
  });
  const std::string socketPath = ipcSocketPath();
  if (auto status = listener->listen(socketPath); !status) {
    log::error("main: Cannot listen on %s: %s", socketPath, status.error());
    return 1;
  }

  auto keepAlive = IdleExitKeepAlive::create(
      listenerQueue, IdleExitKeepAlive::idlePeriodFromEnvironment(listener->socketActivated()), [] { gIdle = true; });

  TelvanedAgent::Options options;
  options.keepAlive = keepAlive;
  if (const char* v = std::getenv("TELVANED_HELLO_TIMEOUT_SECONDS"); v && *v) {
    char* end = nullptr;
    double seconds = std::strtod(v, &end);
    if (end && *end == '\0' && seconds > 0) {
      options.helloTimeout = std::chrono::milliseconds(static_cast<long long>(seconds * 1000));
    }
  }
  // The storebag retrieval lives as long as the process, like its GET helper.
  static StorebagRetrieval storebagRetrieval{StorebagRetrieval::Options{}};
  options.storebagSelector = [](std::int32_t clientType) {
    return fetchStorebagForEnvironmentAndClientType(clientType, storebagRetrieval.fetcher(),
                                                    [] { return userDefaultsEnvironment(); });
  };
  options.storebagFileTime = [](const std::string& name) {
    return storebagRetrieval.diskCache().modificationTime(name);
  };
  // Sessions make their backends from their storebag section through the factory.
  BackendPlatform backendPlatform;
  backendPlatform.environmentType = [] { return lastUserDefaultsEnvironment(); };
  options.environment.backendFactory =
      makeStorebagBackendFactory(makeTelvaneBackendEntryFactory(std::move(backendPlatform)));
  agent = TelvanedAgent::create(std::move(options));
  listener->resume();
  log::info("main: Listener resumes with sandbox, start loop.");
  sd_notify(0, "READY=1");

  // The main run loop: nothing runs here but the wait for a reason to stop.
  int stopSignal = 0;
  while (!gIdle.load()) {
    timespec timeout{0, 200 * 1000 * 1000};
    int signal = sigtimedwait(&signals, nullptr, &timeout);
    if (signal == SIGTERM || signal == SIGINT) {
      stopSignal = signal;
      break;
    }
    // SIGHUP: nothing to reload (the entitlement policy is read at each accept).
  }

  sd_notify(0, "STOPPING=1");
  if (stopSignal) {
    log::info("main: Stopping on signal %d with %u sessions", stopSignal,
              static_cast<unsigned>(agent->sessionCount()));
  }
  listener->cancel();
  listenerQueue->sync([] {});
  Executors::stopAll();
  return 0;
}
