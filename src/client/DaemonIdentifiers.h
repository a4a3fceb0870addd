// DaemonIdentifiers: the device's persistent identifiers, as the daemon keeps them.
//
// The identifiers that respect or override the user's diagnostics-sharing choice are
// settings of the daemon, which uses them in what it reports. The client class's
// operations therefore ask the daemon for them over a fresh connection, so that a
// client sees the same values the daemon sends, and the client library needs no
// settings database of its own.
//
// Threading: both functions block the calling thread until the daemon answers, at
// most kReplyTimeout; callable from any thread except the identifier queue itself.
#pragma once

#include <chrono>
#include <string>

namespace telvane {

class DaemonIdentifiers {
 public:
  static constexpr std::chrono::seconds kReplyTimeout{10};

  // The identifier, or an empty text (logged) when the daemon cannot be reached or
  // does not answer in time.
  static std::string get(bool respect);
  // Makes the daemon store a new random identifier and returns it (empty as above).
  static std::string regenerate(bool respect);
};

}  // namespace telvane
