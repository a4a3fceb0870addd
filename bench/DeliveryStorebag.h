// DeliveryStorebag: the signed configuration the delivery benchmark serves to its
// daemons. Every environment section carries one HTTPS post backend ("brindle") with
// one client rule for the benchmark's clients: enabled for every device of the chosen
// country, sampled in (threshold 1), a filter that touches nothing the clients send,
// batching on, posts to the benchmark's collector.
//
// Threading: plain functions; safe from any thread.
#pragma once

#include <optional>
#include <string>

#include "telvane/Value.h"

namespace telvane::bench {

// The backend name of the section entry; the factory makes an HTTPS post backend of it.
inline constexpr const char* kDeliveryBackendName = "brindle";

struct DeliveryStorebagSettings {
  std::string batchPostURL;
  std::string realtimePostURL;
  std::string displayURL;
  std::string clientName;     // the rule's "client" (matched whole)
  std::string serviceName;    // the rule's "service" (matched as a substring)
  std::string countryCode;    // the only element of "locale_whitelist"
  // "event_threshold"; nothing leaves the key out (the backend's default then).
  std::optional<int> eventThreshold;
  // "override_dnu" 1: the backend reports without the user's diagnostics consent.
  bool overrideConsent = true;
};

// The storebag document (version, refresh cycle and the four environment sections).
Value makeDeliveryStorebagDocument(const DeliveryStorebagSettings& settings);

struct SignedDeliveryStorebag {
  Bytes envelope;      // what the storebag server answers
  Bytes publicKeyDer;  // for $TELVANED_PUBLIC_KEY
};

// A fresh key pair and the document's envelope signed with it; nothing (and the reason
// in `error`) when signing fails.
std::optional<SignedDeliveryStorebag> signDeliveryStorebag(const Value& document, std::string* error);

}  // namespace telvane::bench
