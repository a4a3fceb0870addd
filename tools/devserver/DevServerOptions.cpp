#include "devserver/DevServerOptions.h"

#include <unistd.h>

#include <charconv>
#include <cstdlib>
#include <filesystem>
#include <optional>
#include <system_error>

#include "platform/Paths.h"

#ifndef TELVANE_DEVSERVER_SOURCE_STOREBAGS
#define TELVANE_DEVSERVER_SOURCE_STOREBAGS ""
#endif
#ifndef TELVANE_DEVSERVER_INSTALLED_STOREBAGS
#define TELVANE_DEVSERVER_INSTALLED_STOREBAGS ""
#endif
#ifndef TELVANE_DEVSERVER_INSTALLED_BINDIR
#define TELVANE_DEVSERVER_INSTALLED_BINDIR ""
#endif

namespace telvane::devserver {

const char* const kDevServerUsage =
    "usage: telvane-devserver [options]\n"
    "\n"
    "A development server for telvaned on 127.0.0.1. It serves signed storebags built\n"
    "on the fly from documents in a folder, receives the HTTPS event posts, file uploads\n"
    "and log-data uploads of the daemon's backends and the dashboard's UDP datagrams\n"
    "(acknowledging each one), and shows every arrival as one line on standard output.\n"
    "\n"
    "options:\n"
    "  --port N              HTTPS port (default 8443; 0: pick a free one)\n"
    "  --udp-port N          dashboard UDP port (default 8444; 0: pick a free one)\n"
    "  --state DIR           keys, certificate and received uploads\n"
    "                        (default ${XDG_STATE_HOME:-~/.local/state}/telvane-devserver)\n"
    "  --storebags DIR       storebag documents (default: the sample folder)\n"
    "  --events FILE         also append every arrival to FILE as JSON, one object a line\n"
    "  --once-ready-file FILE  when listening, write the ports, URLs and file paths to\n"
    "                        FILE as NAME=value lines (a shell can source it)\n"
    "  --max-age SECONDS     Cache-Control max-age of served storebags (default 300)\n"
    "  --quiet               no arrival lines on standard output\n"
    "  --exit-with-parent    stop when the process that started the server ends\n"
    "  --version, --help\n"
    "\n"
    "First run: the state folder gets an RSA-2048 storebag signing key pair\n"
    "(storebag-private.pem, publicKey.der) and a self-signed TLS certificate for\n"
    "127.0.0.1 and localhost (tls-cert.pem, tls-key.pem); later runs reuse them. The\n"
    "daemon trusts them through TELVANED_PUBLIC_KEY=<state>/publicKey.der and\n"
    "TELVANED_CA_FILE=<state>/tls-cert.pem, and finds the server through the setting\n"
    "  telvane-defaults write com.zembra.telvane telvane_storebag_url -string https://127.0.0.1:PORT/storebags\n"
    "\n"
    "Endpoints:\n"
    "  GET  /storebags/NAME  the signed envelope of NAME.json, NAME.plist or NAME in the\n"
    "                        storebag folder. Last-Modified is the file's modification time\n"
    "                        (or this server's start, when later: the envelope carries this\n"
    "                        run's ports); If-Modified-Since at or after it answers 304.\n"
    "  POST /upload...       a gzip-compressed file upload; saved under <state>/uploads\n"
    "  POST /dashboard...    a log-data archive (binary property list); saved likewise\n"
    "  POST (anything else)  an event post: JSON {postTime, clientId, events}, gzip or not\n"
    "  UDP                   dashboard datagrams; each is acknowledged with its own header\n"
    "\n"
    "In documents, the texts ${DEVSERVER_URL} (https://127.0.0.1:PORT), ${DEVSERVER_HOST}\n"
    "and ${DEVSERVER_UDP_PORT} are replaced before signing; a value that is exactly\n"
    "${DEVSERVER_UDP_PORT} becomes a number.\n"
    "\n"
    "Standard output gets one line per arrival, standard error the server's problems.\n"
    "SIGINT or SIGTERM stops the server. Exit status: 0 after a stop, 1 when it cannot\n"
    "start, 2 for a malformed command line.\n";

namespace {

Result<DevServerOptions> failure(std::string why) { return Result<DevServerOptions>::failure(std::move(why)); }

std::optional<std::int64_t> parseInteger(const std::string& text, std::int64_t min, std::int64_t max) {
  std::int64_t n = 0;
  auto [end, ec] = std::from_chars(text.data(), text.data() + text.size(), n);
  if (text.empty() || ec != std::errc() || end != text.data() + text.size() || n < min || n > max) {
    return std::nullopt;
  }
  return n;
}

// The directory of the running program, resolved.
std::filesystem::path programDir() {
  std::error_code error;
  std::filesystem::path self = std::filesystem::read_symlink("/proc/self/exe", error);
  return error ? std::filesystem::path() : self.parent_path();
}

bool isDirectory(const std::string& path) {
  std::error_code error;
  return !path.empty() && std::filesystem::is_directory(path, error);
}

}  // namespace

std::string defaultStateDir() {
  const char* stateHome = std::getenv("XDG_STATE_HOME");
  std::string base = stateHome && *stateHome ? stateHome : expandTilde("~/.local/state");
  return base + "/telvane-devserver";
}

std::string defaultStorebagsDir() {
  const std::string installed = TELVANE_DEVSERVER_INSTALLED_STOREBAGS;
  const std::string source = TELVANE_DEVSERVER_SOURCE_STOREBAGS;
  std::error_code error;
  const std::string bindir = TELVANE_DEVSERVER_INSTALLED_BINDIR;
  bool runsInstalled = !bindir.empty() && std::filesystem::equivalent(programDir(), bindir, error) && !error;
  if (runsInstalled && isDirectory(installed)) return installed;
  if (isDirectory(source)) return source;
  return installed;
}

Result<DevServerOptions> parseDevServerOptions(const std::vector<std::string>& arguments) {
  DevServerOptions options;
  for (std::size_t i = 0; i < arguments.size(); ++i) {
    const std::string& option = arguments[i];
    auto value = [&]() -> std::optional<std::string> {
      if (i + 1 >= arguments.size()) return std::nullopt;
      return arguments[++i];
    };
    auto port = [&](std::uint16_t& into) -> std::optional<std::string> {
      auto text = value();
      if (!text) return option + " needs a value";
      auto n = parseInteger(*text, 0, 65535);
      if (!n) return option + " takes a port number from 0 to 65535, not '" + *text + "'";
      into = static_cast<std::uint16_t>(*n);
      return std::nullopt;
    };
    auto text = [&](std::string& into) -> std::optional<std::string> {
      auto given = value();
      if (!given || given->empty()) return option + " needs a value";
      into = *given;
      return std::nullopt;
    };
    std::optional<std::string> problem;
    if (option == "--help" || option == "-h") {
      options.help = true;
      return Result<DevServerOptions>::success(options);
    } else if (option == "--version") {
      options.version = true;
      return Result<DevServerOptions>::success(options);
    } else if (option == "--port") {
      problem = port(options.httpsPort);
    } else if (option == "--udp-port") {
      problem = port(options.udpPort);
    } else if (option == "--state") {
      problem = text(options.stateDir);
    } else if (option == "--storebags") {
      problem = text(options.storebagsDir);
    } else if (option == "--events") {
      problem = text(options.eventsFile);
    } else if (option == "--once-ready-file") {
      problem = text(options.readyFile);
    } else if (option == "--max-age") {
      auto given = value();
      auto n = given ? parseInteger(*given, 0, 100000000) : std::nullopt;
      if (!n) problem = "--max-age takes a whole number of seconds";
      else options.maxAgeSeconds = *n;
    } else if (option == "--quiet" || option == "-q") {
      options.quiet = true;
    } else if (option == "--exit-with-parent") {
      options.exitWithParent = true;
    } else {
      return failure("unknown argument '" + option + "'");
    }
    if (problem) return failure(*problem);
  }
  if (options.stateDir.empty()) options.stateDir = defaultStateDir();
  if (options.storebagsDir.empty()) options.storebagsDir = defaultStorebagsDir();
  return Result<DevServerOptions>::success(options);
}

}  // namespace telvane::devserver
