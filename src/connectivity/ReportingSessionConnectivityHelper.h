// ReportingSessionConnectivityHelper: the shared HTTP helper of the reporting sessions
// of one client.
//
// The helper itself arrives with the connectivity work. Until then this declaration
// carries only what the reporting sessions and the backend interface rely on: the
// request modes and the four operations a session calls on the helper it obtained
// from the agent. The agent hands out no helper yet, so none of these is called today.
//
// Threading: the real helper keeps its state on its own serial queue; every operation
// below may be called from any thread and returns at once.
#pragma once

#include <cstdint>
#include <string>

namespace telvane {

class ReportingSessionConnectivityHelper {
 public:
  // Request modes of a helper.
  static constexpr std::int32_t kPOSTRequestMode = 4;
  static constexpr std::int32_t kGETRequestMode = 8;

  virtual ~ReportingSessionConnectivityHelper() = default;

  // Creates the HTTP session (once) and sets the release timeout.
  virtual void activate(std::uint32_t releaseTimeoutSeconds) = 0;
  virtual void setReleaseTimeout(std::uint32_t releaseTimeoutSeconds) = 0;
  // Called by a session that ends while holding the helper: the helper gives the
  // session's IPC transaction back to the agent when it is released itself.
  virtual void incrementTotalSessionsServedCount() = 0;
  // The identifier of the helper's HTTP session for log lines; "inactive" before
  // activation.
  virtual std::string webSessionDescription() const = 0;
};

}  // namespace telvane
