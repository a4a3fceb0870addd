// Telvane::Impl: file and log-data uploads, and the digest key.
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>

#include "client/ClientErrors.h"
#include "client/TelvaneImpl.h"
#include "platform/Log.h"

namespace telvane {

namespace {

// The class of the read token a client hands out for an upload. On this platform the
// token is the open descriptor itself, which travels with the call; the class name
// travels as the token text so that the daemon can tell what it was given.
constexpr const char* kUploadTokenClass = "com.zembra.telvane.upload";
constexpr const char* kUploadBackendName = "upload_server";
constexpr const char* kFileURLScheme = "file://";

Bytes uploadTokenText() { return Bytes(kUploadTokenClass, kUploadTokenClass + std::strlen(kUploadTokenClass)); }

// The read token: the file opened by us, read-only and never through a symbolic link.
// Opening does not block (a FIFO would wait for a writer). A symbolic link is handed
// over as the link itself (a descriptor that grants no reading), so that the daemon
// sees what it was given and refuses it as not a regular file.
UniqueFd openForUpload(const std::string& path) {
  UniqueFd descriptor(::open(path.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!descriptor && errno == ELOOP) descriptor = UniqueFd(::open(path.c_str(), O_PATH | O_NOFOLLOW | O_CLOEXEC));
  return descriptor;
}

// Removes the uploaded file when the daemon says that the server asked for it and it
// could not do it itself, as long as the path still names the file that was uploaded.
void removeUploadedFile(const std::string& path, dev_t device, ino_t inode) {
  struct stat named {};
  if (::lstat(path.c_str(), &named) != 0 || named.st_dev != device || named.st_ino != inode) return;
  if (::unlink(path.c_str()) == 0) {
    log::info("uploadFileWithURL: Removed %s as the upload server asked", path);
  } else {
    const int error = errno;
    log::info("uploadFileWithURL: Failed to remove %s, errno %d", path, error);
  }
}

}  // namespace

bool Telvane::Impl::serverSupportsFileUpload() {
  const std::vector<std::string> names = enabledBackendNames();
  const bool supported = std::find(names.begin(), names.end(), kUploadBackendName) != names.end();
  log::info("serverSupportsFileUpload:%s (%lu backends)", supported ? "YES" : "NO",
            static_cast<unsigned long>(names.size()));
  return supported;
}

bool Telvane::Impl::uploadFileWithURL(const std::optional<std::string>& fileURL, UploadCompletion completion) {
  if (!fileURL) {
    log::info("uploadFileWithURL: fileURL provided is nil");
    return false;
  }
  std::string path = *fileURL;
  if (path.rfind(kFileURLScheme, 0) == 0) path.erase(0, std::strlen(kFileURLScheme));
  // The daemon names the file in its logs; a path relative to our folder means nothing
  // there.
  if (!path.empty() && path[0] != '/') {
    std::error_code error;
    auto absolute = std::filesystem::absolute(path, error);
    if (!error) path = absolute.string();
  }
  UniqueFd token = openForUpload(path);
  if (!token) {
    const int error = errno;
    log::info("uploadFileWithURL: Failed to get sandbox extension for path %s, errno %d", path, error);
    return false;
  }
  struct stat identity {};
  if (::fstat(token.get(), &identity) != 0) identity = {};
  // std::function wants a copyable closure: the descriptor travels behind a pointer.
  auto descriptor = std::make_shared<UniqueFd>(std::move(token));
  reportingQueue_->async([self = shared_from_this(), path, descriptor, device = identity.st_dev,
                          inode = identity.st_ino, completion = std::move(completion)] {
    auto remote = self->connection_->remote();
    if (!remote) {
      log::info("uploadFileWithURL: Failed to get remote object proxy: %s", remote.error());
      if (completion) completion(false);
      return;
    }
    std::vector<UniqueFd> descriptors;
    descriptors.push_back(std::move(*descriptor));
    self->connection_->call(
        remote.value(), ipc::Operation::UploadFileAtPath, Array{Value(path), Value(uploadTokenText())},
        [completion, path, device, inode](Array reply) {
          if (reply.size() > 1 && reply[1].boolValue()) removeUploadedFile(path, device, inode);
          if (completion) completion(!reply.empty() && reply[0].boolValue());
        },
        [completion] {
          if (completion) completion(false);
        },
        std::move(descriptors));
  });
  return true;
}

bool Telvane::Impl::uploadDataArray(const Value& logDataArray, UploadDataCompletion completion) {
  const Array* entries = logDataArray.asArray();
  if (!entries || entries->empty()) {
    log::info("uploadDataArray: Log data array is empty");
    return false;
  }
  Value data = logDataArray.deepCopy();
  reportingQueue_->async([self = shared_from_this(), data, completion = std::move(completion)] {
    auto remote = self->connection_->remote();
    if (!remote) {
      log::info("uploadDataArray: Failed to get remote object proxy: %s", remote.error());
      if (completion) completion(false, std::nullopt);
      return;
    }
    self->connection_->call(
        remote.value(), ipc::Operation::UploadLogData, Array{data},
        [completion](Array reply) {
          if (!completion) return;
          completion(!reply.empty() && reply[0].boolValue(),
                     client::errorFromReplyValue(reply.size() > 1 ? reply[1] : Value()));
        },
        [completion] {
          if (completion) completion(false, std::nullopt);
        });
  });
  return true;
}

bool Telvane::Impl::setDigestKey(const std::optional<Bytes>& key, std::int32_t algorithm) {
  if (!key) {
    log::info("setDigestKey: digestKey should not be nil!!!");
    return false;
  }
  reportingQueue_->async([self = shared_from_this(), key = *key, algorithm] {
    auto remote = self->connection_->remote();
    if (!remote) {
      log::info("setDigestKey: Failed to get remote object proxy: %s", remote.error());
      return;
    }
    self->connection_->noteDigestKey(key, algorithm);
    self->connection_->send(remote.value(), ipc::Operation::SetDigestKey, Array{Value(key), Value(algorithm)});
  });
  return true;
}

}  // namespace telvane
