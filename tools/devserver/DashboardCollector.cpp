#include "devserver/DashboardCollector.h"

#include <arpa/inet.h>
#include <netinet/in.h>
#include <poll.h>
#include <sys/eventfd.h>
#include <sys/socket.h>

#include <cerrno>
#include <cstring>

#include "devserver/DashboardDatagram.h"
#include "util/ComponentTags.h"

namespace telvane::devserver {

namespace {

// The largest datagram the backend sends: the header and 1023 characters of text,
// with room to spare.
constexpr std::size_t kMaxDatagramSize = 2048;

std::string senderTag(std::uint8_t componentType) {
  auto tag = componentTag(componentType);
  return tag ? std::string(*tag) : std::string("?");
}

}  // namespace

Result<std::uint16_t> DashboardCollector::start(std::uint16_t port) {
  using R = Result<std::uint16_t>;
  socket_.reset(::socket(AF_INET, SOCK_DGRAM | SOCK_CLOEXEC, 0));
  if (!socket_) return R::failure(std::string("UDP socket: ") + std::strerror(errno));
  sockaddr_in address{};
  address.sin_family = AF_INET;
  address.sin_port = htons(port);
  address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
  if (::bind(socket_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    return R::failure("cannot bind UDP 127.0.0.1:" + std::to_string(port) + ": " + std::strerror(errno));
  }
  socklen_t length = sizeof address;
  if (::getsockname(socket_.get(), reinterpret_cast<sockaddr*>(&address), &length) != 0) {
    return R::failure(std::string("getsockname: ") + std::strerror(errno));
  }
  wakeup_.reset(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
  if (!wakeup_) return R::failure(std::string("eventfd: ") + std::strerror(errno));
  thread_ = std::thread([this] { run(); });
  return R::success(ntohs(address.sin_port));
}

void DashboardCollector::stop() {
  if (!thread_.joinable()) return;
  std::uint64_t one = 1;
  ssize_t written = ::write(wakeup_.get(), &one, sizeof one);
  (void)written;
  thread_.join();
}

void DashboardCollector::run() {
  std::string buffer(kMaxDatagramSize, '\0');
  while (true) {
    pollfd watched[2] = {{socket_.get(), POLLIN, 0}, {wakeup_.get(), POLLIN, 0}};
    if (::poll(watched, 2, -1) < 0) {
      if (errno == EINTR) continue;
      std::fprintf(stderr, "telvane-devserver: UDP poll: %s\n", std::strerror(errno));
      return;
    }
    if (watched[1].revents != 0) return;
    if ((watched[0].revents & POLLIN) == 0) continue;
    sockaddr_in from{};
    socklen_t fromLength = sizeof from;
    ssize_t received = ::recvfrom(socket_.get(), buffer.data(), buffer.size(), MSG_TRUNC,
                                  reinterpret_cast<sockaddr*>(&from), &fromLength);
    if (received < 0) {
      if (errno != EINTR && errno != EAGAIN) {
        std::fprintf(stderr, "telvane-devserver: UDP receive: %s\n", std::strerror(errno));
      }
      continue;
    }
    char host[INET_ADDRSTRLEN] = "?";
    ::inet_ntop(AF_INET, &from.sin_addr, host, sizeof host);
    std::string sender = std::string(host) + ":" + std::to_string(ntohs(from.sin_port));
    std::size_t size = std::min(static_cast<std::size_t>(received), buffer.size());
    handle(buffer.substr(0, size), sender, &from, fromLength);
  }
}

void DashboardCollector::handle(const std::string& bytes, const std::string& from, const void* address,
                                unsigned addressLength) {
  std::optional<DashboardDatagram> datagram = parseDashboardDatagram(bytes);
  if (!datagram) {
    log_.report("udp " + from + " ignored: " + std::to_string(bytes.size()) + " bytes, shorter than the header",
                Value(Dictionary{{"kind", "datagram"},
                                 {"from", from},
                                 {"bytes", Value(static_cast<unsigned long long>(bytes.size()))},
                                 {"acknowledged", false},
                                 {"problem", "shorter than the 64-byte header"}}));
    return;
  }
  // The acknowledgement first, so that the sender's retransmission timer stops early.
  ssize_t sent = ::sendto(socket_.get(), bytes.data(), kDashboardHeaderSize, 0,
                          static_cast<const sockaddr*>(address), static_cast<socklen_t>(addressLength));
  bool acknowledged = sent == static_cast<ssize_t>(kDashboardHeaderSize);
  if (!acknowledged) std::fprintf(stderr, "telvane-devserver: UDP acknowledgement: %s\n", std::strerror(errno));

  Dictionary fields;
  std::string keys;
  for (const auto& [key, value] : datagram->fields) {
    fields.set(key, Value(value));
    keys += (keys.empty() ? "" : ",") + key;
  }
  const std::string tag = senderTag(datagram->componentType);
  std::string line = "udp " + from + " sender=" + tag + " session=" + std::to_string(datagram->sessionID) +
                     " event=" + std::to_string(datagram->eventID) + " category=" +
                     std::to_string(datagram->method) + " type=" + std::to_string(datagram->responseCode) +
                     " keys=" + (keys.empty() ? "-" : keys) +
                     (acknowledged ? " (acknowledged)" : " (not acknowledged)");
  if (datagram->declaredLength != bytes.size()) {
    line += " length field " + std::to_string(datagram->declaredLength) + " != " + std::to_string(bytes.size());
  }
  log_.report(line, Value(Dictionary{
                        {"kind", "datagram"},
                        {"from", from},
                        {"bytes", Value(static_cast<unsigned long long>(bytes.size()))},
                        {"acknowledged", acknowledged},
                        {"majorVersion", Value(static_cast<unsigned>(datagram->majorVersion))},
                        {"componentType", Value(static_cast<unsigned>(datagram->componentType))},
                        {"sender", tag},
                        {"timestamp", Value(datagram->seconds + datagram->milliseconds / 1000.0)},
                        {"sessionID", Value(static_cast<unsigned>(datagram->sessionID))},
                        {"clientVersion", Value(static_cast<unsigned>(datagram->clientVersion))},
                        {"declaredLength", Value(static_cast<unsigned>(datagram->declaredLength))},
                        {"category", Value(static_cast<unsigned>(datagram->method))},
                        {"type", Value(static_cast<unsigned>(datagram->responseCode))},
                        {"deviceID", datagram->deviceID},
                        {"eventID", Value(static_cast<unsigned>(datagram->eventID))},
                        {"reliable", datagram->reliable()},
                        {"addressFromProfile", datagram->addressFromProfile()},
                        {"text", datagram->text},
                        {"fields", Value(std::move(fields))},
                    }));
}

}  // namespace telvane::devserver
