// EntitlementPolicy: who holds which entitlement.
//
// The policy is every regular file in a directory (default
// /etc/telvaned/entitlements.d), one grant per line: "<entitlement> <subject>", where
// the subject is uid:N, gid:N, user:NAME or group:NAME. '#' starts a comment. A
// group subject matches the peer's primary and supplementary groups. Bad lines are
// logged and skipped. A granted entitlement has the value true; everything else is
// absent.
//
// Thread-safe: a loaded policy is immutable.
#pragma once

#include <sys/types.h>

#include <optional>
#include <string>
#include <vector>

#include "platform/IpcConnection.h"

namespace telvane {

class EntitlementPolicy {
 public:
  // Reads every file of the directory; a missing directory is an empty policy.
  static EntitlementPolicy load(const std::string& directory);
  // Parses one file's text (the name is for log lines).
  void addText(const std::string& text, const std::string& sourceName);

  // The value of the entitlement for the peer: true when granted, absent otherwise.
  std::optional<bool> valueFor(const std::string& entitlement, const PeerCredentials& peer) const;

  std::size_t grantCount() const { return grants_.size(); }

 private:
  struct Grant {
    std::string entitlement;
    enum class Kind { Uid, Gid } kind;
    unsigned long id;
  };
  std::vector<Grant> grants_;
};

}  // namespace telvane
