#include "platform/EntitlementPolicy.h"

#include <grp.h>
#include <pwd.h>

#include <algorithm>
#include <filesystem>
#include <fstream>
#include <sstream>

#include "platform/Log.h"

namespace telvane {

namespace {

std::optional<unsigned long> parseId(const std::string& text) {
  if (text.empty() || text.size() > 10 || !std::all_of(text.begin(), text.end(), ::isdigit)) return std::nullopt;
  return std::stoul(text);
}

std::optional<unsigned long> lookUpUser(const std::string& name) {
  struct passwd pw {};
  struct passwd* result = nullptr;
  char buffer[4096];
  if (getpwnam_r(name.c_str(), &pw, buffer, sizeof buffer, &result) != 0 || !result) return std::nullopt;
  return result->pw_uid;
}

std::optional<unsigned long> lookUpGroup(const std::string& name) {
  struct group gr {};
  struct group* result = nullptr;
  char buffer[16384];
  if (getgrnam_r(name.c_str(), &gr, buffer, sizeof buffer, &result) != 0 || !result) return std::nullopt;
  return result->gr_gid;
}

}  // namespace

EntitlementPolicy EntitlementPolicy::load(const std::string& directory) {
  EntitlementPolicy policy;
  std::error_code ec;
  std::vector<std::filesystem::path> files;
  for (const auto& entry : std::filesystem::directory_iterator(directory, ec)) {
    if (entry.is_regular_file(ec)) files.push_back(entry.path());
  }
  std::sort(files.begin(), files.end());
  for (const auto& file : files) {
    std::ifstream in(file);
    std::stringstream text;
    text << in.rdbuf();
    policy.addText(text.str(), file.string());
  }
  return policy;
}

void EntitlementPolicy::addText(const std::string& text, const std::string& sourceName) {
  std::istringstream lines(text);
  std::string line;
  int number = 0;
  while (std::getline(lines, line)) {
    ++number;
    if (auto hash = line.find('#'); hash != std::string::npos) line.erase(hash);
    std::istringstream words(line);
    std::string entitlement, subject, extra;
    if (!(words >> entitlement)) continue;  // blank or comment
    if (!(words >> subject) || (words >> extra)) {
      log::error("EntitlementPolicy: %s:%d: expected '<entitlement> <subject>'", sourceName, number);
      continue;
    }
    auto colon = subject.find(':');
    std::string kind = colon == std::string::npos ? subject : subject.substr(0, colon);
    std::string value = colon == std::string::npos ? "" : subject.substr(colon + 1);
    std::optional<unsigned long> id;
    Grant::Kind grantKind = Grant::Kind::Uid;
    if (kind == "uid") {
      id = parseId(value);
    } else if (kind == "gid") {
      id = parseId(value);
      grantKind = Grant::Kind::Gid;
    } else if (kind == "user") {
      id = lookUpUser(value);
    } else if (kind == "group") {
      id = lookUpGroup(value);
      grantKind = Grant::Kind::Gid;
    } else {
      log::error("EntitlementPolicy: %s:%d: unknown subject '%s'", sourceName, number, subject);
      continue;
    }
    if (!id) {
      log::error("EntitlementPolicy: %s:%d: no such %s '%s'", sourceName, number, kind, value);
      continue;
    }
    grants_.push_back({entitlement, grantKind, *id});
  }
}

std::optional<bool> EntitlementPolicy::valueFor(const std::string& entitlement, const PeerCredentials& peer) const {
  for (const auto& grant : grants_) {
    if (grant.entitlement != entitlement) continue;
    if (grant.kind == Grant::Kind::Uid && grant.id == peer.uid) return true;
    if (grant.kind == Grant::Kind::Gid) {
      if (grant.id == peer.gid) return true;
      if (std::find(peer.groups.begin(), peer.groups.end(), static_cast<gid_t>(grant.id)) != peer.groups.end()) {
        return true;
      }
    }
  }
  return std::nullopt;
}

}  // namespace telvane
