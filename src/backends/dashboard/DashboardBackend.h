// DashboardBackend: sends events as UDP datagrams to a dashboard collector, and
// uploads archived log-data arrays over HTTP through the session's connectivity helper.
//
// A datagram is a 64-byte big-endian header followed by a text of " key=value" pairs
// (at most 1023 characters, cut silently). Some header fields are written complemented
// on purpose (session ID, client version, total length); the collector complements them
// back. In reliable mode (the socket could be bound for answers) every datagram waits in
// a queue of at most 50 packets until the collector acknowledges its event id; the
// periodic task resends unacknowledged packets after 2, 3, 5 and 9 checks and drops a
// packet on the check after its fourth retransmission. A datagram that could not be sent
// at all is queued too, also without reliability, and sent again by the periodic task.
// Of an answer only bytes 60-61 are read, as the big-endian event id acknowledged; the
// first queued packet with that id goes. An answer too short to hold them (0 to 61
// bytes) is read and ignored.
//
// Events from sessions never become datagrams: the session path calls the base's
// five-argument send, which hands the event to the six-argument one, and this class
// does not override that. Its own five-argument send (with an event id instead of a
// flag) is a separate function that nothing in the daemon calls. The two are kept apart
// deliberately; do not bridge them.
//
// Ownership: owned by its session. The socket, the message queue and the timer and read
// sources live in a `Network` object shared with the work queued on the network queue.
// After `cleanup` with packets still queued, that object keeps itself alive until the
// periodic task (or the last-resort clean-up 9.5 s later) has cancelled the sources, so
// the retransmissions finish even when the session has already let the backend go.
// The cancel action of the read source (reliable mode) or of the timer (otherwise)
// closes the socket.
//
// Threading: socket work, the message queue, acknowledgements, the periodic task and
// clean-up run only on the serial network queue "com.zembra.Telvane.networkProc".
// Header building and sanitising run on the caller's thread, reading the base's
// settings under its mutex. `uploadLogData` blocks its caller until the connectivity
// helper answers (on the helper's queue), at most 600 s.
#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "backends/TelvaneBackendBase.h"
#include "backends/dashboard/UDPPacketToSend.h"
#include "platform/SerialQueue.h"

namespace telvane {

// What tests replace in a dashboard backend: the last-resort delay (so that no test
// waits 9.5 s), the bind of the socket for acknowledgements (so that a bind failure can
// be made) and the bound of the upload's wait. A helper that is inactive or never
// answers would otherwise block the session's queue for good; after the bound the
// upload counts as failed.
struct DashboardOptions {
  // How long after the clean-up request the sources are cancelled even though packets
  // still wait for acknowledgements.
  std::chrono::milliseconds lastResortCleanupDelay{9500};
  // Binds the socket to any local address and port 0; returns 0, or -1 with errno set.
  // Unset: bind(2).
  std::function<int(int descriptor)> bindForAcknowledgements;
  // How long uploadLogData waits for the connectivity helper's answer at most.
  std::chrono::milliseconds uploadAnswerWaitLimit{std::chrono::seconds(600)};
};

class DashboardBackend : public TelvaneBackendBase {
 public:
  static constexpr const char* kNetworkQueueLabel = "com.zembra.Telvane.networkProc";
  static constexpr std::size_t kHeaderSize = 64;
  static constexpr std::size_t kMaxTextLength = 1023;
  // The most bytes read of one answer (a longer datagram is cut to this).
  static constexpr std::size_t kBufferSize = kHeaderSize + 1024;
  static constexpr std::size_t kLocalLogRecordBufferSize = 1152;
  static constexpr std::size_t kMaxQueuedPackets = 50;
  static constexpr std::chrono::milliseconds kDefaultTimerPeriod{500};
  static constexpr std::chrono::milliseconds kMaxTimerPeriod{std::chrono::hours(24)};
  // Header flags.
  static constexpr std::uint16_t kFlagReliableUDP = 0x1;
  static constexpr std::uint16_t kFlagAddressNotFromProfile = 0x2;
  // The checks before each retransmission, by the number of retransmissions so far;
  // after the last one the next check drops the packet.
  static constexpr std::int32_t kRetransmitThresholds[4] = {2, 3, 5, 9};
  static constexpr std::int32_t kMaxRetransmits = 3;
  static constexpr const char* kLogDataUploadLocationKey = "LogDataUploadLocation";

  // initWithName:profile:productFamily:: the collector from the profile's "ip" and
  // "port". An "ip" that is not text counts as missing, as does a "port" that is not a
  // number; a port number is truncated to 16 bits (70000 → 4464, -1 → 65535), and one
  // that becomes 0 fails like a refused connect. "reliable" switches reliable mode on
  // with its integer value as the period in ms; a value that is not positive (0, -5,
  // "often") keeps the default of 500 ms, with an error line, and one above a day is cut
  // to a day. An "ip" that is not dotted IPv4 (a host name, "", "999.1.1.1") is not
  // resolved: it fails like a refused connect.
  static std::shared_ptr<DashboardBackend> create(const std::string& name, const Value& profile,
                                                  const std::optional<std::string>& productFamily,
                                                  const BackendPlatform& platform = {},
                                                  const DashboardOptions& options = {});
  // initWithName:serverIP:serverPort:productFamily:: nothing (and no log line) without
  // a server IP; otherwise reliable mode with the default period, no profile.
  static std::shared_ptr<DashboardBackend> createWithServerIP(const std::string& name,
                                                              const std::optional<std::string>& serverIP,
                                                              std::uint16_t serverPort,
                                                              const std::optional<std::string>& productFamily,
                                                              const BackendPlatform& platform = {},
                                                              const DashboardOptions& options = {});
  // initWithName:profile:serverIP:serverPort:productFamily:, the designated one. The
  // profile (when given) wins over the server IP and port. Every failure is logged and
  // leaves no socket open.
  static std::shared_ptr<DashboardBackend> createWithProfile(const std::string& name,
                                                             const std::optional<Value>& profile,
                                                             const std::optional<std::string>& serverIP,
                                                             std::uint16_t serverPort,
                                                             const std::optional<std::string>& productFamily,
                                                             const BackendPlatform& platform = {},
                                                             const DashboardOptions& options = {});
  ~DashboardBackend() override;

  BackendKind kind() const override { return BackendKind::Dashboard; }

  // The base's sends stay visible; see the next function.
  using TelvaneBackendBase::sendMessage;
  // sendMessage:timestamp:method:respCode:eventID:: builds one datagram, hands it to
  // the network queue and returns the local log record. It neither overrides nor is
  // called by the base's event path (which ends in the six-argument send this class
  // leaves alone), so session events never reach it. This is intended. Its last
  // argument is a 16-bit event id where the base's five-argument send takes a 32-bit
  // flag: callers pass a std::uint16_t.
  std::optional<std::string> sendMessage(const Value& blob, TimeValue timestamp, std::uint16_t method,
                                         std::uint16_t respCode, std::uint16_t eventID);

  // Archives the array as a binary property list and posts it to "post_url". True when
  // it was uploaded, or when there is no connectivity helper to upload through.
  bool uploadLogData(const Array& logData) override;

  // With an empty message queue cancels the sources at once, otherwise leaves that to
  // the periodic task. Runs asynchronously on the network queue.
  void cleanup() override;

  // A string or number gives its description, anything else "null". Numbers are
  // written as the platform describes them: booleans as 1 or 0, integers in decimal,
  // doubles in the shortest text that reads back the same.
  static std::string descriptionForObject(const Value& value);
  // Removes every newline, then doubles every backslash, then writes every "=" as
  // "\="; an empty result becomes "empty".
  static std::string sanitize(const std::string& text);
  // The text of an event: " key=value" for each entry, shortest value description
  // first (equal lengths keep the dictionary's order), cut at 1023 characters.
  static std::string textForEvent(const Value& event);
  // The local log record of a datagram (header and text).
  static std::string writeLocalLog(const Bytes& datagram);

  // ---- What the backend was made with ----
  std::optional<std::string> postURL() const { return postURL_; }
  bool usingProfile() const { return usingProfile_; }
  bool reliableUDP() const;
  std::chrono::milliseconds timerPeriod() const { return timerPeriod_; }

  // ---- Network-queue state, read synchronously (never from the network queue) ----
  int socketDescriptor() const;
  std::int32_t cleanupState() const;
  std::vector<UDPPacketToSend> messageQueueSnapshot() const;
  // The local port the socket is bound to (reliable mode), or 0.
  std::uint16_t localPort() const;
  // Waits until the work already handed to the network queue has run.
  void waitForNetworkQueue() const;
  // Runs one periodic check synchronously on the network queue, as a timer firing
  // would.
  void runPeriodicTaskForTesting();
  const std::shared_ptr<SerialQueue>& networkProcQueue() const;

 private:
  class Network;

  DashboardBackend(std::string name, Value profile, std::optional<std::string> productFamily,
                   BackendPlatform platform);
  // Closes the socket of a backend whose creation failed after the socket was opened.
  void abandonNetwork();

  // Constant after creation.
  std::optional<std::string> postURL_;
  bool usingProfile_ = false;
  std::chrono::milliseconds timerPeriod_ = kDefaultTimerPeriod;
  std::shared_ptr<Network> network_;
  std::chrono::milliseconds uploadAnswerWaitLimit_{std::chrono::seconds(600)};
  // Set by cleanup(); from then on the network object ends its sources itself.
  std::atomic<bool> cleanupRequested_{false};
};

}  // namespace telvane
