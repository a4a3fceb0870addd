#include "platform/Paths.h"

#include <pwd.h>
#include <unistd.h>

#include <cstdlib>
#include <vector>

#ifndef TELVANE_DATADIR
#define TELVANE_DATADIR "/usr/share"
#endif

namespace telvane {

namespace {

constexpr const char* kDefaultStorebagCacheParentDir = "~/Library/Caches/telvaned";
constexpr const char* kDefaultMessageLogDir = "/var/mobile/Library/Logs/Mishapper/Retired";
constexpr const char* kDefaultConnectivityStorageDir = "/tmp/tvxstorage";
constexpr const char* kDefaultIpcSocketPath = "/run/telvaned/com.zembra.telvaned";
constexpr const char* kDefaultEntitlementsDir = "/etc/telvaned/entitlements.d";
constexpr const char* kDefaultPublicKeyPath = TELVANE_DATADIR "/telvane/publicKey.der";

std::string overridable(const char* variable, const char* fallback) {
  const char* value = std::getenv(variable);
  return expandTilde(value && *value ? value : fallback);
}

// The home folder of a named user, or of the effective user when the name is empty.
std::string userHome(const std::string& name) {
  long suggested = sysconf(_SC_GETPW_R_SIZE_MAX);
  std::vector<char> buffer(suggested > 0 ? static_cast<std::size_t>(suggested) : 16384);
  passwd entry{};
  passwd* found = nullptr;
  int rc = name.empty() ? getpwuid_r(geteuid(), &entry, buffer.data(), buffer.size(), &found)
                        : getpwnam_r(name.c_str(), &entry, buffer.data(), buffer.size(), &found);
  if (rc != 0 || !found || !found->pw_dir) return {};
  return found->pw_dir;
}

}  // namespace

std::string expandTilde(std::string path) {
  if (path.empty() || path.front() != '~') return path;
  auto slash = path.find('/');
  std::string name = path.substr(1, slash == std::string::npos ? std::string::npos : slash - 1);
  std::string home;
  if (name.empty()) {
    const char* env = std::getenv("HOME");
    home = env && *env ? env : userHome({});
  } else {
    home = userHome(name);
  }
  if (home.empty()) return path;
  while (home.size() > 1 && home.back() == '/') home.pop_back();
  if (slash == std::string::npos) return home;
  if (home == "/") return path.substr(slash);
  return home + path.substr(slash);
}

std::string storebagCacheParentDir() { return overridable("TELVANED_CACHE_DIR", kDefaultStorebagCacheParentDir); }
std::string messageLogDir() { return overridable("TELVANED_MESSAGE_LOG_DIR", kDefaultMessageLogDir); }
std::string connectivityStorageDir() { return overridable("TELVANED_STORAGE_DIR", kDefaultConnectivityStorageDir); }
std::string ipcSocketPath() { return overridable("TELVANED_SOCKET", kDefaultIpcSocketPath); }
std::string entitlementsDir() { return overridable("TELVANED_ENTITLEMENTS_DIR", kDefaultEntitlementsDir); }
std::string publicKeyPath() { return overridable("TELVANED_PUBLIC_KEY", kDefaultPublicKeyPath); }

}  // namespace telvane
