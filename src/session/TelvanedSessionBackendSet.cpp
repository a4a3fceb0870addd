// TelvanedSession: building the backend set, its reporting states and category lists,
// user info and digest settings for the backends, and the hierarchy synchronisation.
#include <set>

#include "platform/Log.h"
#include "session/SessionKeys.h"
#include "session/TelvanedSession.h"

namespace telvane {

namespace {

// Only this backend receives the digest key and algorithm.
constexpr const char* kDigestBackendName = "quarl";

Array integersToArray(const std::set<std::int64_t>& values) {
  Array out;
  out.reserve(values.size());
  for (std::int64_t v : values) out.emplace_back(static_cast<long long>(v));
  return out;
}

}  // namespace

void TelvanedSession::createBackendsWithStorebag(const Value& section) {
  log::info("createBackendsWithStorebag: Creating backends for session %u", sessionID());
  const Value& releaseTimeout = section[keys::kStorebagReleaseTimeout];
  std::uint32_t timeout =
      releaseTimeout.isNull() ? kDefaultConnectivityHelperReleaseTimeoutSeconds : releaseTimeout.unsignedIntValue();
  Value sessionInfo, userInfo;
  std::string deviceID;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    connectivityHelperReleaseTimeout_ = timeout;
    sessionInfo = sessionInfo_;
    userInfo = userInfo_;
    deviceID = deviceid_;
  }
  BackendMap backends = environment_.backendFactory(section, sessionInfo, userInfo, deviceID);
  std::shared_ptr<ReportingSessionConnectivityHelper> helper;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    // An earlier map is replaced without being told to clean up.
    backends_ = backends;
    helper = connectivityHelper_;
  }
  for (const auto& [name, backend] : backends) {
    backend->setReportingSessionConnectivityDelegate(helper);
    backend->setCombinedSessionIDString(sessionIDString_);
  }
}

void TelvanedSession::updateUserInfoForBackends() {
  std::optional<BackendMap> backends;
  Value userInfo;
  std::optional<Bytes> digestKey;
  std::int32_t digestAlgorithm;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    backends = backends_;
    userInfo = userInfo_;
    digestKey = digestKey_;
    digestAlgorithm = digestAlgorithm_;
  }
  if (!backends) return;
  for (const auto& [name, backend] : *backends) {
    backend->setUserInfoDict(userInfo);
    if (name == kDigestBackendName) {
      backend->setDigestKey(digestKey);
      backend->setDigestAlgorithm(digestAlgorithm);
    }
  }
}

void TelvanedSession::setDigestKey(const std::optional<Bytes>& key, std::int32_t algorithm) {
  assertOnQueue(queue_);
  std::optional<BackendMap> backends;
  {
    std::lock_guard<std::mutex> lock(mutex_);
    digestKey_ = key;
    backends = backends_;
  }
  // The algorithm goes to the backend but is not kept: a later user-info update hands
  // the backend the session's stored algorithm (0) again. Long-standing behaviour.
  if (!backends) return;
  auto it = backends->find(kDigestBackendName);
  if (it == backends->end()) return;
  it->second->setDigestKey(key);
  it->second->setDigestAlgorithm(algorithm);
}

bool TelvanedSession::updateReportingStates() {
  bool anyActive = false;
  if (auto backends = this->backends()) {
    // Every backend is updated; no early stop.
    for (const auto& [name, backend] : *backends) {
      if (backend->updateState() == kBackendStateEnabled) anyActive = true;
    }
  }
  return anyActive;
}

std::optional<Array> TelvanedSession::fetchReportingStates() const {
  auto backends = this->backends();
  if (!backends) return std::nullopt;
  Array active;
  for (const auto& [name, backend] : *backends) {
    if (backend->state() == kBackendStateEnabled) active.emplace_back(name);
  }
  return active;
}

std::optional<Array> TelvanedSession::fetchWhitelistedEvents() const {
  auto backends = this->backends();
  if (!backends || backends->empty()) return std::nullopt;
  std::set<std::int64_t> categories;
  for (const auto& [name, backend] : *backends) {
    auto whitelist = backend->eventWhitelist();
    // An active HTTPS post backend without a whitelist lets every category through.
    if (backend->kind() == BackendKind::HTTPSPost && backend->state() == kBackendStateEnabled && !whitelist) {
      return std::nullopt;
    }
    if (whitelist) {
      for (const Value& category : *whitelist) categories.insert(category.integerValue());
    }
  }
  return integersToArray(categories);
}

std::optional<Array> TelvanedSession::fetchBlacklistedEvents() const {
  auto backends = this->backends();
  if (!backends || backends->empty()) return std::nullopt;
  std::optional<std::set<std::int64_t>> common;
  for (const auto& [name, backend] : *backends) {
    if (backend->kind() != BackendKind::HTTPSPost) continue;
    auto blacklist = backend->eventBlacklist();
    if (!blacklist) continue;
    std::set<std::int64_t> categories;
    for (const Value& category : *blacklist) categories.insert(category.integerValue());
    if (!common) {
      common = std::move(categories);
    } else {
      std::set<std::int64_t> both;
      for (std::int64_t c : *common) {
        if (categories.count(c)) both.insert(c);
      }
      common = std::move(both);
    }
  }
  // A category is reported only when every HTTPS post backend with a blacklist has it.
  if (!common) return std::nullopt;
  return integersToArray(*common);
}

void TelvanedSession::updateCombinedSessionID() {
  auto agent = delegate();
  if (!agent) return;
  auto parent = agent->parentSessionIDStringForSession(shared_from_this());
  if (!parent) return;
  std::string combined = *parent + "." + sessionIDString_;
  log::info("updateCombinedSessionID: Updating combined session ID '%s' for session %u backends", combined,
            sessionID());
  if (auto backends = this->backends()) {
    for (const auto& [name, backend] : *backends) backend->setCorrelatedSessionID(combined);
  }
}

void TelvanedSession::syncReportingStates() {
  auto agent = delegate();
  if (!agent) return;
  std::lock_guard<std::recursive_mutex> lock(agent->agentLock());
  auto parent = agent->parentSessionForChild(shared_from_this());
  auto backends = this->backends();
  if (!backends) return;
  for (const auto& [name, backend] : *backends) {
    if (!parent) {
      std::int64_t level = hierarchyLevel();
      if (level != 0) {
        log::info("syncReportingStates: child session %u (backend %s) with hierarchy %d is missing its parent",
                  sessionID(), name, level);
      }
      continue;
    }
    std::int32_t state = backend->state();
    // A deferred child keeps its own state.
    if (state == kBackendStateDeferred) continue;
    auto parentBackend = parent->backendNamed(name);
    if (!parentBackend) {
      log::info(
          "HTTPSPostBackend(syncReportingStates): Parent session  does not have backend %s. Current state '%d' kept "
          "for child session",
          name, state);
      continue;
    }
    std::int32_t parentState = parentBackend->state();
    std::optional<double> threshold = parentBackend->samplingThreshold();
    backend->setState(parentState);
    backend->setSamplingThreshold(threshold);
    log::info("HTTPSPostBackend(syncReportingStates): %s: state and sampling rate updated to %d, %.02f%%",
              backend->name(), parentState, threshold.value_or(0.0));
  }
}

}  // namespace telvane
