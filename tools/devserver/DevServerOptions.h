// The command line of `telvane-devserver`: its options, parsed and checked, with the
// defaults filled in. Plain functions; safe from any thread.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

#include "platform/Result.h"

namespace telvane::devserver {

inline constexpr std::uint16_t kDefaultHttpsPort = 8443;
inline constexpr std::uint16_t kDefaultUdpPort = 8444;
inline constexpr std::int64_t kDefaultMaxAgeSeconds = 300;

struct DevServerOptions {
  bool help = false;
  bool version = false;
  // 0: the system picks a free port (printed when ready).
  std::uint16_t httpsPort = kDefaultHttpsPort;
  std::uint16_t udpPort = kDefaultUdpPort;
  // Keys, certificate and received uploads.
  std::string stateDir;
  // Storebag documents, one file per storebag name.
  std::string storebagsDir;
  // Arrivals as JSON, one object per line; empty: none.
  std::string eventsFile;
  // Written once both servers listen; empty: none.
  std::string readyFile;
  // The Cache-Control max-age of served storebags.
  std::int64_t maxAgeSeconds = kDefaultMaxAgeSeconds;
  // No arrival lines on standard output (the events file still gets them).
  bool quiet = false;
  // Stop when the process that started this one ends (scripts and tests).
  bool exitWithParent = false;
};

// Parses the arguments after the program name; the error text says what is wrong.
// Folders left out get their defaults (defaultStateDir(), defaultStorebagsDir()).
Result<DevServerOptions> parseDevServerOptions(const std::vector<std::string>& arguments);

// ${XDG_STATE_HOME:-~/.local/state}/telvane-devserver.
std::string defaultStateDir();
// The sample storebags: the installed copy when this program runs from its installed
// location, else the copy in the source tree it was built from.
std::string defaultStorebagsDir();

extern const char* const kDevServerUsage;

}  // namespace telvane::devserver
