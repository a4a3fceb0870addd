#include "platform/IpcListener.h"

#include <fcntl.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>

#include <asio/bind_executor.hpp>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "platform/Log.h"

namespace telvane {

namespace {
constexpr int kBacklog = 128;
}

std::shared_ptr<IpcListener> IpcListener::create(std::shared_ptr<SerialQueue> queue, AcceptHandler handler) {
  return std::shared_ptr<IpcListener>(new IpcListener(std::move(queue), std::move(handler)));
}

IpcListener::IpcListener(std::shared_ptr<SerialQueue> queue, AcceptHandler handler)
    : queue_(std::move(queue)), handler_(std::move(handler)), socket_(queue_->executor().context()) {}

IpcListener::~IpcListener() {
  std::error_code ignored;
  socket_.close(ignored);
  if (boundPath_) ::unlink(path_.c_str());
}

Status IpcListener::listen(const std::string& path) {
  path_ = path;
  int activated = sd_listen_fds(1);
  if (activated > 0) {
    int fd = SD_LISTEN_FDS_START;
    if (activated > 1) log::error("IpcListener: %d sockets handed over, using the first", activated);
    if (sd_is_socket_unix(fd, SOCK_STREAM, 1, nullptr, 0) <= 0) {
      return statusError("the handed-over descriptor is not a listening Unix stream socket");
    }
    int flags = ::fcntl(fd, F_GETFL, 0);
    ::fcntl(fd, F_SETFL, flags | O_NONBLOCK);
    ::fcntl(fd, F_SETFD, FD_CLOEXEC);
    socket_.assign(fd);
    socketActivated_ = true;
    return statusOk();
  }
  sockaddr_un address{};
  if (path.size() >= sizeof address.sun_path) return statusError("socket path too long: " + path);
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);

  std::error_code ec;
  std::filesystem::create_directories(std::filesystem::path(path).parent_path(), ec);
  UniqueFd fd(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  if (!fd) return statusError(std::string("socket: ") + std::strerror(errno));
  // A socket file left by a daemon that did not end cleanly: nobody answers on it.
  struct stat st {};
  if (::lstat(path.c_str(), &st) == 0 && S_ISSOCK(st.st_mode)) ::unlink(path.c_str());
  if (::bind(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) < 0) {
    return statusError("bind " + path + ": " + std::strerror(errno));
  }
  boundPath_ = true;
  ::chmod(path.c_str(), 0666);
  if (::listen(fd.get(), kBacklog) < 0) return statusError("listen " + path + ": " + std::strerror(errno));
  socket_.assign(fd.release());
  return statusOk();
}

void IpcListener::resume() {
  queue_->async([self = shared_from_this()] {
    if (!self->canceled_) self->waitForConnections();
  });
}

void IpcListener::cancel() {
  queue_->async([self = shared_from_this()] {
    if (self->canceled_) return;
    self->canceled_ = true;
    std::error_code ignored;
    self->socket_.close(ignored);
    if (self->boundPath_) {
      ::unlink(self->path_.c_str());
      self->boundPath_ = false;
    }
  });
}

void IpcListener::waitForConnections() {
  socket_.async_wait(asio::posix::stream_descriptor::wait_read,
                     asio::bind_executor(queue_->strand(), [weak = weak_from_this()](const std::error_code& error) {
                       auto self = weak.lock();
                       if (!self || error || self->canceled_) return;
                       self->acceptPending();
                       if (!self->canceled_) self->waitForConnections();
                     }));
}

void IpcListener::acceptPending() {
  for (;;) {
    int fd = ::accept4(socket_.native_handle(), nullptr, nullptr, SOCK_CLOEXEC | SOCK_NONBLOCK);
    if (fd < 0) {
      if (errno == EINTR || errno == ECONNABORTED) continue;
      if (errno != EAGAIN && errno != EWOULDBLOCK) {
        // Out of descriptors and the like: try again on the next readiness.
        log::error("IpcListener: accept failed: %s", std::strerror(errno));
      }
      return;
    }
    handler_(UniqueFd(fd));
  }
}

}  // namespace telvane
