// Paths: the file-system locations the system uses, each with an environment override
// so that tests use temporary folders and the shipped units use the folders systemd
// makes for the service. An override that is set but empty counts as unset. Every
// result goes through tilde expansion.
//
// Functions read the environment on every call and are thread-safe as long as nobody
// changes the environment at the same time.
#pragma once

#include <string>

namespace telvane {

// "~" or "~/..." with $HOME (else the user database's home of the effective user);
// "~name/..." with that user's home. Anything else, or an unknown user, is returned
// unchanged.
std::string expandTilde(std::string path);

// Parent of the storebag cache: $TELVANED_CACHE_DIR, else "~/Library/Caches/telvaned".
std::string storebagCacheParentDir();
// Daily message logs: $TELVANED_MESSAGE_LOG_DIR, else
// "/var/mobile/Library/Logs/Mishapper/Retired".
std::string messageLogDir();
// Connectivity storage: $TELVANED_STORAGE_DIR, else "/tmp/tvxstorage".
std::string connectivityStorageDir();
// The daemon's socket: $TELVANED_SOCKET, else "/run/telvaned/com.zembra.telvaned".
std::string ipcSocketPath();
// Entitlement policy files: $TELVANED_ENTITLEMENTS_DIR, else
// "/etc/telvaned/entitlements.d".
std::string entitlementsDir();
// The storebag signing key: $TELVANED_PUBLIC_KEY, else
// "<datadir>/telvane/publicKey.der".
std::string publicKeyPath();

}  // namespace telvane
