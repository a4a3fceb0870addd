#include "DeliveryStorebag.h"

#include "storebag/StorebagSigner.h"

namespace telvane::bench {

namespace {

// A filter for a key that no post document has: compiled and walked for every post,
// but it changes nothing.
Value harmlessFilters() {
  return Value(Array{Value(Dictionary{{"key", Value("benchUnusedKey")}, {"action", Value("remove")}})});
}

Value clientRule(const DeliveryStorebagSettings& settings) {
  Dictionary rule{{"client", Value(settings.clientName)},
                  {"service", Value(settings.serviceName)},
                  {"locale_whitelist", Value(Array{Value(settings.countryCode)})},
                  {"filters", harmlessFilters()},
                  {"sampling_threshold", Value(1)},
                  {"post_url", Value(settings.batchPostURL)},
                  {"realtime_post_url", Value(settings.realtimePostURL)},
                  // 0: batching on whatever the session asked for.
                  {"expedite", Value(0)}};
  if (settings.eventThreshold) rule.set("event_threshold", Value(*settings.eventThreshold));
  if (settings.overrideConsent) rule.set("override_dnu", Value(1));
  return Value(std::move(rule));
}

}  // namespace

Value makeDeliveryStorebagDocument(const DeliveryStorebagSettings& settings) {
  Dictionary document{{"version", Value("delivery-bench-1")}, {"refresh_cycle", Value(86400)}};
  for (const char* section : {"zembra_internal", "development", "seed", "release"}) {
    Value profile(Dictionary{{"display_url", Value(settings.displayURL)},
                             {"clients", Value(Array{clientRule(settings)})}});
    document.set(section, Value(Dictionary{{kDeliveryBackendName, profile}}));
  }
  return Value(std::move(document));
}

std::optional<SignedDeliveryStorebag> signDeliveryStorebag(const Value& document, std::string* error) {
  auto keys = generateStorebagKeyPair();
  if (!keys) {
    if (error) *error = "key pair: " + keys.error();
    return std::nullopt;
  }
  auto signer = StorebagSigner::fromPrivateKeyPem(keys.value().privateKeyPem);
  if (!signer) {
    if (error) *error = "signer: " + signer.error();
    return std::nullopt;
  }
  auto envelope = signer.value().makeEnvelopeForDocument(document);
  if (!envelope) {
    if (error) *error = "envelope: " + envelope.error();
    return std::nullopt;
  }
  return SignedDeliveryStorebag{std::move(envelope).value(), keys.value().publicKeyDer};
}

}  // namespace telvane::bench
