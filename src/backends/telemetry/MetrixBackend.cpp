#include "backends/telemetry/MetrixBackend.h"

#include <cmath>
#include <limits>
#include <utility>

#include "platform/Json.h"
#include "platform/Log.h"

namespace telvane {

namespace {

constexpr const char* kEmptyObjectJson = "{}";

// The place of a value inside the event dictionary, for log lines: keys joined with
// ".", array elements as "[index]".
std::string memberPath(const std::string& parent, const std::string& key) {
  return parent.empty() ? key : parent + "." + key;
}

bool textJsonCanCarry(const std::string& text) {
  return text.size() <= std::numeric_limits<std::uint32_t>::max() && json::isValidUtf8(text);
}

// The value with everything JSON cannot carry taken out, or nothing when the value
// itself cannot be carried. Each value left out is logged with its place. `depth`
// counts the containers around the value, as the JSON writer does.
std::optional<Value> jsonCarriableValue(const Value& value, const std::string& place, int depth) {
  auto leaveOut = [&place]() -> std::optional<Value> {
    log::error("MetrixBackend(sendMessage): JSON can't carry the value of %s; left out", place);
    return std::nullopt;
  };
  switch (value.type()) {
    case Value::Type::Double:
      if (!std::isfinite(value.doubleValue())) return leaveOut();
      return value;
    case Value::Type::Date:
      if (!std::isfinite(value.asDate()->secondsSince1970)) return leaveOut();
      return value;
    case Value::Type::String:
      if (!textJsonCanCarry(*value.asString())) return leaveOut();
      return value;
    case Value::Type::Array: {
      if (depth >= json::kMaxNestingDepth) return leaveOut();
      Array carried;
      carried.reserve(value.asArray()->size());
      std::size_t index = 0;
      for (const Value& element : *value.asArray()) {
        // A left-out element keeps its place as null, so that later ones keep their index.
        std::optional<Value> kept = jsonCarriableValue(element, place + "[" + std::to_string(index) + "]", depth + 1);
        carried.push_back(kept ? std::move(*kept) : Value());
        ++index;
      }
      return Value(std::move(carried));
    }
    case Value::Type::Dictionary: {
      if (depth >= json::kMaxNestingDepth) return leaveOut();
      Dictionary carried;
      carried.reserve(value.asDictionary()->size());
      for (const auto& [key, member] : *value.asDictionary()) {
        std::string memberPlace = memberPath(place, key);
        if (!textJsonCanCarry(key)) {
          log::error("MetrixBackend(sendMessage): JSON can't carry the key %s; left out", Value(key).description());
          continue;
        }
        std::optional<Value> kept = jsonCarriableValue(member, memberPlace, depth + 1);
        if (kept) carried.appendInOrder(key, std::move(*kept));
      }
      return Value(std::move(carried));
    }
    case Value::Type::Null:
    case Value::Type::Boolean:
    case Value::Type::Integer:
    case Value::Type::Unsigned:
    case Value::Type::Bytes:
      return value;
  }
  return leaveOut();
}

}  // namespace

bool MetrixBackend::isClientTypeAllowed(std::int32_t clientType) {
  if (clientType < kFirstMaskedClientType || clientType > kLastMaskedClientType) return false;
  return (kAllowedClientTypeMask >> (clientType - kFirstMaskedClientType)) & 1u;
}

std::shared_ptr<MetrixBackend> MetrixBackend::create(const std::string& name, const Value& profile,
                                                     const std::optional<std::string>& productFamily,
                                                     std::int32_t clientType, const BackendPlatform& platform) {
  log::info("MetrixBackend(initWithName): Loading Metrix adaptor class for client type %d", clientType);
  if (!isClientTypeAllowed(clientType)) {
    log::error("MetrixBackend(initWithName): No matching bundle found for client type %d", clientType);
    return nullptr;
  }
  BackendPlatform resolved = platform.withSystemDefaults();
  // A missing object is no error here: the backend is made, and each event reports
  // the absent adaptor.
  std::shared_ptr<const MetrixAdaptorLibrary> bundle =
      MetrixAdaptorLibrary::loadIfNeeded(resolved.metrixAdaptorPath.value_or(MetrixAdaptorLibrary::defaultPath()));
  return std::shared_ptr<MetrixBackend>(new MetrixBackend(name, profile.copy(), productFamily, std::move(resolved),
                                                          clientType, std::move(bundle)));
}

std::shared_ptr<MetrixBackend> MetrixBackend::create(const std::string& name, const Value& profile,
                                                     const std::optional<std::string>& productFamily,
                                                     const BackendPlatform& platform) {
  return create(name, profile, productFamily, 0, platform);
}

MetrixBackend::MetrixBackend(std::string name, Value profile, std::optional<std::string> productFamily,
                             BackendPlatform platform, std::int32_t clientType,
                             std::shared_ptr<const MetrixAdaptorLibrary> clientBundle)
    : TelvaneBackendBase(std::move(name), std::move(profile), std::move(productFamily), std::move(platform)),
      clientType_(clientType),
      clientBundle_(std::move(clientBundle)),
      adaptor_(clientBundle_ ? clientBundle_->sendMessageEntry() : nullptr) {}

std::string MetrixBackend::adaptorDescription() const {
  return clientBundle_ ? clientBundle_->path() : std::string(kAbsentAdaptorDescription);
}

std::string MetrixBackend::adaptorJsonForDictionary(const Value& dictionary) {
  if (!dictionary.isDictionary()) return kEmptyObjectJson;
  // Nearly every event is written as it is; only one that JSON refuses is copied
  // without the values it cannot carry.
  Result<std::string> direct = json::write(dictionary);
  if (direct.ok()) return std::move(direct).value();
  std::optional<Value> carried = jsonCarriableValue(dictionary, std::string(), 0);
  if (!carried) return kEmptyObjectJson;
  Result<std::string> text = json::write(*carried);
  if (!text.ok()) {
    // Not expected after the values JSON cannot carry are out; the adaptor still gets
    // a well-formed object.
    log::error("MetrixBackend(sendMessage): %s", text.error());
    return kEmptyObjectJson;
  }
  return std::move(text).value();
}

std::optional<std::string> MetrixBackend::sendMessage(const Value& blob, TimeValue /*timestamp*/,
                                                      std::uint16_t method, std::uint16_t respCode,
                                                      std::uint16_t /*eventID*/, std::uint32_t /*flag*/) {
  if (!adaptor_) {
    log::error("MetrixBackend(sendMessage): Metrix adaptor %s does not respond to forwarding selector %s",
               adaptorDescription(), kForwardingSelectorName);
    return std::nullopt;
  }
  const std::string dictionary = adaptorJsonForDictionary(blob);
  adaptor_(method, respCode, dictionary.c_str(), dictionary.size());
  return std::nullopt;
}

}  // namespace telvane
