// JoulemeterBackend: records events in the device's power log (PowerLog; on Linux
// the journal) as registered events of category 28 named "Vistacore-TVX".
//
// Only its own five-argument `sendMessage(dictionary, timestamp, method, respCode,
// eventID)` records anything. A session's event path calls the base's five-argument
// send (with a flag), which counts the event and calls the six-argument send; this
// class does not override the six-argument send, so events from sessions reach the
// base's send and are not recorded. That is deliberate and must stay so: the
// recording operation is a separate member, not an override.
//
// Ownership: owned by its session; the power log is shared through the platform.
// Threading: as TelvaneBackendBase; the recording operation keeps no state and may
// be called from any thread (the power log is thread-safe).
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "backends/TelvaneBackendBase.h"

namespace telvane {

class JoulemeterBackend : public TelvaneBackendBase {
 public:
  static constexpr std::uint32_t kPowerLogEventCategory = 28;
  static constexpr const char* kPowerLogEventName = "Vistacore-TVX";
  // The keys added to the recorded copy of the dictionary.
  static constexpr const char* kMethodKey = "method";
  static constexpr const char* kRespCodeKey = "respCode";
  static constexpr const char* kEventKey = "event";

  // initWithName:profile:productFamily: of the base; always makes a backend. The
  // power log is the platform's (resolved with the system defaults).
  static std::shared_ptr<JoulemeterBackend> create(const std::string& name, const Value& profile,
                                                   const std::optional<std::string>& productFamily,
                                                   const BackendPlatform& platform = {});

  BackendKind kind() const override { return BackendKind::Joulemeter; }

  // The base's sends stay visible, and stay the ones a session reaches. Call the
  // recording operation below with a 16-bit event id: a 32-bit last argument selects
  // the base's five-argument send (the flag) instead.
  using TelvaneBackendBase::sendMessage;
  // Records the event: nothing for method 0 or an empty (or absent) dictionary;
  // otherwise a copy of the dictionary with "method", "respCode" and "event" (the
  // event id) added as unsigned numbers. The timestamp is not recorded. Not an
  // override of any send of the base (see above).
  void sendMessage(const Value& dictionary, TimeValue timestamp, std::uint16_t method, std::uint16_t respCode,
                   std::uint16_t eventID);

 private:
  JoulemeterBackend(std::string name, Value profile, std::optional<std::string> productFamily,
                    BackendPlatform platform);
};

}  // namespace telvane
