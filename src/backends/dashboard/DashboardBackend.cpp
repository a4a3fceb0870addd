#include "backends/dashboard/DashboardBackend.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <utility>

#include "backends/dashboard/DashboardNetwork.h"
#include "platform/Log.h"
#include "util/ComponentTags.h"

namespace telvane {

namespace {

constexpr const char* kIPKey = "ip";
constexpr const char* kPortKey = "port";
constexpr const char* kReliableKey = "reliable";
constexpr const char* kDisplayURLKey = "display_url";
constexpr const char* kPostURLKey = "post_url";
// The IP text is read up to this many characters ("255.255.255.255" and its terminator).
constexpr std::size_t kMaxIPTextLength = 16;
constexpr std::size_t kUdidLength = 40;

void putBigEndian16(std::uint8_t* at, std::uint16_t value) {
  at[0] = static_cast<std::uint8_t>(value >> 8);
  at[1] = static_cast<std::uint8_t>(value);
}

void putBigEndian32(std::uint8_t* at, std::uint32_t value) {
  at[0] = static_cast<std::uint8_t>(value >> 24);
  at[1] = static_cast<std::uint8_t>(value >> 16);
  at[2] = static_cast<std::uint8_t>(value >> 8);
  at[3] = static_cast<std::uint8_t>(value);
}

std::uint16_t bigEndian16(const std::uint8_t* at) { return static_cast<std::uint16_t>((at[0] << 8) | at[1]); }

std::uint32_t bigEndian32(const std::uint8_t* at) {
  return (std::uint32_t{at[0]} << 24) | (std::uint32_t{at[1]} << 16) | (std::uint32_t{at[2]} << 8) | at[3];
}

std::string doubleDescription(double value) {
  char text[32];
  for (int precision = 15; precision <= 17; ++precision) {
    std::snprintf(text, sizeof text, "%.*g", precision, value);
    if (std::strtod(text, nullptr) == value) break;
  }
  return text;
}

// The collector's address: the first 16 characters of the text as dotted IPv4, with no
// name resolution. Nothing when the text is not such an address, or for port 0 (which
// Linux accepts in connect() but leaves the socket unconnected, so every send would fail).
std::optional<sockaddr_in> collectorAddress(const std::string& ip, std::uint16_t port) {
  if (port == 0) return std::nullopt;
  const std::string text = ip.substr(0, std::min(ip.size(), kMaxIPTextLength));
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  if (::inet_pton(AF_INET, text.c_str(), &address.sin_addr) != 1) return std::nullopt;
  return address;
}

}  // namespace

std::shared_ptr<DashboardBackend> DashboardBackend::create(const std::string& name, const Value& profile,
                                                           const std::optional<std::string>& productFamily,
                                                           const BackendPlatform& platform,
                                                           const DashboardOptions& options) {
  std::optional<std::string> ip;
  if (const std::string* text = profile[kIPKey].asString()) ip = *text;
  const Value& port = profile[kPortKey];
  return createWithProfile(name, profile, ip, port.isNumber() ? port.unsignedShortValue() : 0, productFamily,
                           platform, options);
}

std::shared_ptr<DashboardBackend> DashboardBackend::createWithServerIP(
    const std::string& name, const std::optional<std::string>& serverIP, std::uint16_t serverPort,
    const std::optional<std::string>& productFamily, const BackendPlatform& platform, const DashboardOptions& options) {
  if (!serverIP) return nullptr;
  return createWithProfile(name, std::nullopt, serverIP, serverPort, productFamily, platform, options);
}

std::shared_ptr<DashboardBackend> DashboardBackend::createWithProfile(
    const std::string& name, const std::optional<Value>& profile, const std::optional<std::string>& serverIP,
    std::uint16_t serverPort, const std::optional<std::string>& productFamily, const BackendPlatform& platform,
    const DashboardOptions& options) {
  // A profile that is not a dictionary is a profile without any of the keys.
  const bool withProfile = profile.has_value();
  if (withProfile) {
    if (!(*profile)[kIPKey].isString()) {
      log::error("DashboardBackend(initWithName): can't resolve server IP");
      return nullptr;
    }
    if (!(*profile)[kPortKey].isNumber()) {
      log::error("DashboardBackend(initWithName): can't resolve server port");
      return nullptr;
    }
  }

  const int descriptor = ::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  if (descriptor < 0) {
    log::error("DashboardBackend(initWithName): socket() failed (%d)", errno);
    return nullptr;
  }
  // Broken-pipe signals are suppressed per send (MSG_NOSIGNAL); Linux has no socket
  // option for it.
  std::shared_ptr<DashboardBackend> backend(new DashboardBackend(
      name, withProfile ? profile->copy() : Value::dictionary(), productFamily, platform.withSystemDefaults()));
  backend->network_ = std::make_shared<Network>(descriptor, SerialQueue::create(kNetworkQueueLabel), options);
  Network& network = *backend->network_;
  backend->uploadAnswerWaitLimit_ = options.uploadAnswerWaitLimit;

  std::string ip;
  std::uint16_t port = 0;
  if (!withProfile) {
    if (!serverIP) {
      log::error("DashboardBackend(initWithName): initWitName with all null params.");
      network.closeSocketDirectly();
      return nullptr;
    }
    ip = *serverIP;
    port = serverPort;
    network.useReliableUDP();
    backend->timerPeriod_ = kDefaultTimerPeriod;
  } else {
    backend->usingProfile_ = true;
    const Value& values = backend->profile_;
    {
      std::lock_guard<std::mutex> lock(backend->settingsMutex_);
      if (const std::string* url = values[kDisplayURLKey].asString()) backend->displayURL_ = *url;
    }
    if (const std::string* url = values[kPostURLKey].asString()) backend->postURL_ = *url;
    ip = *values[kIPKey].asString();
    port = values[kPortKey].unsignedShortValue();
    const Dictionary* entries = values.asDictionary();
    if (const Value* reliable = entries ? entries->find(kReliableKey) : nullptr) {
      network.useReliableUDP();
      // A period that is not a positive number of milliseconds (0, negative, or text
      // that does not start with digits) would make the timer spin: the default holds.
      // One longer than a day is cut to a day, so that the timer's deadline cannot
      // overflow.
      const std::int64_t period = reliable->integerValue();
      if (period > 0) {
        backend->timerPeriod_ = std::min(std::chrono::milliseconds(period), kMaxTimerPeriod);
      } else {
        log::error("DashboardBackend(initWithName): reliable period %s is not a positive number of ms, using %d ms.",
                   reliable->description(), static_cast<int>(kDefaultTimerPeriod.count()));
      }
    }
  }

  // An address that is not dotted IPv4 (a host name, an empty text, "999.1.1.1") or
  // port 0 cannot be connected to and fails like a refused connect.
  std::optional<sockaddr_in> address = collectorAddress(ip, port);
  if (!address || ::connect(network.socketDescriptor, reinterpret_cast<const sockaddr*>(&*address),
                            sizeof *address) != 0) {
    log::error("DashboardBackend(initWithName): socket connect() failed.");
    backend->abandonNetwork();
    return nullptr;
  }
  if (!network.startTimer(backend->timerPeriod_)) {
    log::error("DashboardBackend(initWithName): can't create timer source.");
    backend->abandonNetwork();
    return nullptr;
  }
  return backend;
}

DashboardBackend::DashboardBackend(std::string name, Value profile, std::optional<std::string> productFamily,
                                   BackendPlatform platform)
    : TelvaneBackendBase(std::move(name), std::move(profile), std::move(productFamily), std::move(platform)) {}

void DashboardBackend::abandonNetwork() {
  // A read source may already own the socket: cancel it and let its action close it;
  // otherwise close it here. Either way it is closed before the queue's next work.
  std::shared_ptr<Network> network = std::move(network_);
  network_.reset();
  if (network->readSource) {
    network->queue->sync([&network] { network->cleanupSources(); });
    network->queue->sync([] {});
  } else {
    network->closeSocketDirectly();
  }
}

DashboardBackend::~DashboardBackend() {
  if (!network_ || cleanupRequested_.load()) return;
  // Released without clean-up: stop the sources so that the socket is closed.
  network_->queue->async([network = network_] { network->cleanupSources(); });
}

bool DashboardBackend::reliableUDP() const { return network_->reliableUDP.load(); }

const std::shared_ptr<SerialQueue>& DashboardBackend::networkProcQueue() const { return network_->queue; }

int DashboardBackend::socketDescriptor() const {
  int descriptor = -1;
  network_->queue->sync([&] { descriptor = network_->socketDescriptor; });
  return descriptor;
}

std::int32_t DashboardBackend::cleanupState() const {
  std::int32_t state = 0;
  network_->queue->sync([&] { state = network_->cleanupState; });
  return state;
}

std::vector<UDPPacketToSend> DashboardBackend::messageQueueSnapshot() const {
  std::vector<UDPPacketToSend> packets;
  network_->queue->sync([&] { packets.assign(network_->messageQueue.begin(), network_->messageQueue.end()); });
  return packets;
}

std::uint16_t DashboardBackend::localPort() const {
  std::uint16_t port = 0;
  network_->queue->sync([&] {
    sockaddr_in address{};
    socklen_t length = sizeof address;
    if (network_->socketDescriptor >= 0 &&
        ::getsockname(network_->socketDescriptor, reinterpret_cast<sockaddr*>(&address), &length) == 0) {
      port = ntohs(address.sin_port);
    }
  });
  return port;
}

void DashboardBackend::waitForNetworkQueue() const { network_->queue->sync([] {}); }

void DashboardBackend::runPeriodicTaskForTesting() {
  network_->queue->sync([this] { network_->myPeriodicTask(); });
}

void DashboardBackend::cleanup() {
  cleanupRequested_.store(true);
  network_->queue->async([network = network_] { network->cleanup(); });
}

std::string DashboardBackend::descriptionForObject(const Value& value) {
  switch (value.type()) {
    case Value::Type::String: return *value.asString();
    case Value::Type::Boolean: return value.boolValue() ? "1" : "0";
    case Value::Type::Integer: return std::to_string(value.integerValue());
    case Value::Type::Unsigned: return std::to_string(value.unsignedLongLongValue());
    case Value::Type::Double: return doubleDescription(value.doubleValue());
    default: return "null";
  }
}

std::string DashboardBackend::sanitize(const std::string& text) {
  std::string out;
  out.reserve(text.size());
  for (char c : text) {
    if (c == '\n') continue;
    if (c == '\\') {
      out += "\\\\";
    } else if (c == '=') {
      out += "\\=";
    } else {
      out += c;
    }
  }
  return out.empty() ? std::string("empty") : out;
}

std::string DashboardBackend::textForEvent(const Value& event) {
  std::string text;
  const Dictionary* entries = event.asDictionary();
  if (!entries) return text;
  struct Entry {
    const std::string* key;
    std::string description;
  };
  std::vector<Entry> sorted;
  sorted.reserve(entries->size());
  for (const auto& [key, value] : *entries) sorted.push_back(Entry{&key, descriptionForObject(value)});
  std::stable_sort(sorted.begin(), sorted.end(),
                   [](const Entry& a, const Entry& b) { return a.description.size() < b.description.size(); });
  for (const Entry& entry : sorted) {
    if (text.size() >= kMaxTextLength) break;
    text += ' ';
    text += *entry.key;
    text += '=';
    text += sanitize(entry.description);
  }
  // Cut silently (by bytes) at the limit.
  if (text.size() > kMaxTextLength) text.resize(kMaxTextLength);
  return text;
}

std::string DashboardBackend::writeLocalLog(const Bytes& datagram) {
  if (datagram.size() < kHeaderSize) return std::string();
  const std::uint8_t* header = datagram.data();
  const std::string udid(reinterpret_cast<const char*>(header + 20),
                         strnlen(reinterpret_cast<const char*>(header + 20), kUdidLength));
  // The header carries the low byte of the component type.
  const std::optional<std::string_view> tag = componentTag(header[1]);
  const std::string tagText = tag ? std::string(*tag) : std::string(kUnknownComponentTag);
  const std::string text(datagram.begin() + kHeaderSize, datagram.end());
  char record[kLocalLogRecordBufferSize];
  std::snprintf(record, sizeof record, "%u.%03d %s 127.0.0.1 %s %5u %5u %5u %5u %5u %s",
                static_cast<unsigned>(bigEndian32(header + 4)), header[3] * 4, udid.c_str(), tagText.c_str(),
                static_cast<unsigned>(static_cast<std::uint16_t>(~bigEndian16(header + 12))),
                static_cast<unsigned>(~bigEndian32(header + 8)), static_cast<unsigned>(bigEndian16(header + 60)),
                static_cast<unsigned>(bigEndian16(header + 16)), static_cast<unsigned>(bigEndian16(header + 18)),
                text.c_str());
  return record;
}

std::optional<std::string> DashboardBackend::sendMessage(const Value& blob, TimeValue timestamp,
                                                         std::uint16_t method, std::uint16_t respCode,
                                                         std::uint16_t eventID) {
  // A time value whose microseconds lie outside one second is brought back into it.
  std::int64_t seconds = timestamp.seconds + timestamp.microseconds / 1'000'000;
  std::int64_t microseconds = timestamp.microseconds % 1'000'000;
  if (microseconds < 0) {
    microseconds += 1'000'000;
    seconds -= 1;
  }

  const std::string text = textForEvent(blob);
  Bytes datagram(kHeaderSize + text.size(), 0);
  std::uint8_t* header = datagram.data();
  header[0] = selfVersionMajor();
  header[1] = static_cast<std::uint8_t>(compType());
  header[2] = 1;
  header[3] = static_cast<std::uint8_t>(microseconds / 4000);
  putBigEndian32(header + 4, static_cast<std::uint32_t>(seconds));
  putBigEndian32(header + 8, ~sessionID());
  putBigEndian16(header + 12, static_cast<std::uint16_t>(~clientVersion()));
  putBigEndian16(header + 14, static_cast<std::uint16_t>(~static_cast<std::uint32_t>(datagram.size())));
  putBigEndian16(header + 16, method);
  putBigEndian16(header + 18, respCode);
  const std::string identifier = udid();
  std::memcpy(header + 20, identifier.data(), std::min(identifier.size(), kUdidLength));
  putBigEndian16(header + 60, eventID);
  std::uint16_t flags = 0;
  if (network_->reliableUDP.load()) flags |= kFlagReliableUDP;
  if (!usingProfile_) flags |= kFlagAddressNotFromProfile;
  putBigEndian16(header + 62, flags);
  std::memcpy(header + kHeaderSize, text.data(), text.size());

  std::string record = writeLocalLog(datagram);
  network_->queue->async([network = network_, datagram = std::move(datagram), eventID] {
    network->tryToSendMsg(datagram.data(), datagram.size(), eventID);
  });
  return record;
}

}  // namespace telvane
