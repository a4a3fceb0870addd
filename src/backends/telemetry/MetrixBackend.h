// MetrixBackend: hands a session's events to the wireless-diagnostics adaptor of the
// device instead of sending them over the network.
//
// The adaptor is a shared object that the device maker installs (the C interface is
// in telvane/MetrixAdaptor.h). It serves only the conferencing-type clients 7, 11 and
// 13; for every other client type the backend is not made. When the backend is made
// it loads the adaptor object if no earlier backend has loaded it yet. A missing
// object or an object without the forwarding entry does not stop the backend from
// being made: each event then ends in the error line
//     MetrixBackend(sendMessage): Metrix adaptor <description> does not respond to
//     forwarding selector sendMessageWithMethod:respCode:dict:
// where the description is "(null)" when no object could be loaded and the object's
// path when it loaded but lacks the entry.
//
// Each event goes to the adaptor as method, response code and the event dictionary as
// JSON text; the time stamp, event id and flag stay behind. The dictionary is written
// with the daemon's JSON rules (bytes as base64, dates as seconds since 1970); values
// JSON cannot carry (NaN, infinities, text that is not UTF-8, nesting deeper than the
// JSON limit) are left out, each with an error line naming where it was: a dictionary
// loses the key, an array keeps the place as null so later elements keep their index.
// Nothing an event carries can make the backend fail.
//
// Ownership: owned by its session; the adaptor library is shared with every other
// backend of the process and lives as long as the process.
//
// Threading: as TelvaneBackendBase. The adaptor is fixed at construction, so the
// send path takes no lock; sessions of different clients call the adaptor from
// their own queues at the same time, which the adaptor interface allows.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "backends/TelvaneBackendBase.h"
#include "backends/telemetry/MetrixAdaptorLibrary.h"

namespace telvane {

class MetrixBackend : public TelvaneBackendBase {
 public:
  // The allowed client types as a bit mask over 7..13: bit n stands for client type
  // 7 + n, so 7, 11 and 13 are bits 0, 4 and 6.
  static constexpr std::int32_t kFirstMaskedClientType = 7;
  static constexpr std::int32_t kLastMaskedClientType = 13;
  static constexpr std::uint32_t kAllowedClientTypeMask = (1u << 0) | (1u << 4) | (1u << 6);
  // The name under which logs show the adaptor's forwarding operation.
  static constexpr const char* kForwardingSelectorName = "sendMessageWithMethod:respCode:dict:";
  // The adaptor's description when no adaptor object could be loaded.
  static constexpr const char* kAbsentAdaptorDescription = "(null)";

  // initWithName:profile:productFamily:clientType:, the designated form. Nothing (and
  // an error line) when the client type is not allowed. The adaptor object is the
  // platform's `metrixAdaptorPath` (resolved with the system defaults).
  static std::shared_ptr<MetrixBackend> create(const std::string& name, const Value& profile,
                                               const std::optional<std::string>& productFamily,
                                               std::int32_t clientType, const BackendPlatform& platform = {});
  // initWithName:profile:productFamily:: the designated form with client type 0,
  // which is never allowed, so this always yields nothing.
  static std::shared_ptr<MetrixBackend> create(const std::string& name, const Value& profile,
                                               const std::optional<std::string>& productFamily,
                                               const BackendPlatform& platform = {});

  static bool isClientTypeAllowed(std::int32_t clientType);

  // The event dictionary as the JSON object the adaptor receives (see above); "{}"
  // for anything that is not a dictionary.
  static std::string adaptorJsonForDictionary(const Value& dictionary);

  // ---- TelvaneBackend ----
  BackendKind kind() const override { return BackendKind::Metrix; }

  using TelvaneBackendBase::sendMessage;
  // Forwards method, response code and the dictionary to the adaptor, or logs that the
  // adaptor cannot take them. Returns nothing either way.
  std::optional<std::string> sendMessage(const Value& blob, TimeValue timestamp, std::uint16_t method,
                                         std::uint16_t respCode, std::uint16_t eventID,
                                         std::uint32_t flag) override;

  std::int32_t clientType() const { return clientType_; }
  // What logs call the adaptor: the loaded object's path, or "(null)".
  std::string adaptorDescription() const;
  // True when events reach an adaptor entry.
  bool hasAdaptor() const { return adaptor_ != nullptr; }

 private:
  MetrixBackend(std::string name, Value profile, std::optional<std::string> productFamily, BackendPlatform platform,
                std::int32_t clientType, std::shared_ptr<const MetrixAdaptorLibrary> clientBundle);

  // Constant after construction.
  const std::int32_t clientType_;
  // The loaded adaptor object (null when none could be loaded) and its forwarding
  // entry (null when the object lacks it).
  const std::shared_ptr<const MetrixAdaptorLibrary> clientBundle_;
  const telvane_metrix_adaptor_send_message_fn adaptor_;
};

}  // namespace telvane
