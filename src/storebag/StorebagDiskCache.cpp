#include "storebag/StorebagDiskCache.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstring>
#include <filesystem>
#include <utility>

#include "platform/Log.h"
#include "platform/Paths.h"
#include "util/DeviceInfo.h"

namespace telvane {

namespace {

std::string errorText(int error) { return std::strerror(error); }

// Writes everything, retrying short writes and interruptions; 0 or the errno.
int writeAll(int fd, const Bytes& bytes) {
  std::size_t done = 0;
  while (done < bytes.size()) {
    ssize_t written = ::write(fd, bytes.data() + done, bytes.size() - done);
    if (written < 0) {
      if (errno == EINTR) continue;
      return errno;
    }
    done += static_cast<std::size_t>(written);
  }
  return 0;
}

// Writes the file through a temporary sibling; 0 or the errno of the failed step.
int writeAtomically(const std::string& path, const Bytes& bytes) {
  std::filesystem::path target(path);
  std::string leaf(".");
  leaf.append(target.filename().string()).append(".XXXXXX");
  std::string pattern = (target.parent_path() / leaf).string();
  int fd = ::mkostemp(pattern.data(), O_CLOEXEC);
  if (fd < 0) return errno;
  int error = writeAll(fd, bytes);
  if (error == 0 && ::fchmod(fd, 0644) != 0) error = errno;
  if (error == 0 && ::fsync(fd) != 0) error = errno;
  if (::close(fd) != 0 && error == 0) error = errno;
  if (error == 0 && ::rename(pattern.c_str(), path.c_str()) != 0) error = errno;
  if (error != 0) {
    ::unlink(pattern.c_str());
    return error;
  }
  // Make the rename itself durable.
  int dirFd = ::open(target.parent_path().c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (dirFd >= 0) {
    ::fsync(dirFd);
    ::close(dirFd);
  }
  return 0;
}

}  // namespace

StorebagDiskCache::StorebagDiskCache(std::string parentDir, bool internalBuild)
    : parentDir_(std::move(parentDir)), internalBuild_(internalBuild) {}

StorebagDiskCache StorebagDiskCache::system() { return StorebagDiskCache(storebagCacheParentDir(), isInternalBuild()); }

std::string StorebagDiskCache::directory() const {
  return (std::filesystem::path(parentDir_) / kStorebagCacheFolderName).string();
}

std::string StorebagDiskCache::cacheFilePath(const std::string& name) const {
  std::string folder = directory();
  std::error_code ignored;
  std::filesystem::create_directories(folder, ignored);
  return (std::filesystem::path(folder) / name).string();
}

bool StorebagDiskCache::save(const std::string& name, const Bytes& envelope) const {
  std::string path = cacheFilePath(name);
  int error = writeAtomically(path, envelope);
  if (error != 0) {
    log::error("saveStorebagToDisk: could not save storebag '%s' to file '%s'. Error is '%s'", name, path,
               errorText(error));
    return false;
  }
  return true;
}

std::optional<Bytes> StorebagDiskCache::load(const std::string& name) const {
  std::string path = cacheFilePath(name);
  if (internalBuild_) {
    setStorageClassProtectionLevel(parentDir_);
    setStorageClassProtectionLevel(directory());
    setStorageClassProtectionLevel(path);
  }
  auto fail = [&](int error) -> std::optional<Bytes> {
    log::error("loadStorebagFromDisk: could not load storebag '%s' from file '%s'. Error is '%s'", name, path,
               errorText(error));
    return std::nullopt;
  };
  int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return fail(errno);
  struct stat info {};
  if (::fstat(fd, &info) != 0 || !S_ISREG(info.st_mode)) {
    int error = S_ISDIR(info.st_mode) ? EISDIR : errno;
    ::close(fd);
    return fail(error == 0 ? EINVAL : error);
  }
  Bytes bytes;
  bytes.reserve(static_cast<std::size_t>(info.st_size));
  std::uint8_t buffer[16384];
  for (;;) {
    ssize_t got = ::read(fd, buffer, sizeof buffer);
    if (got < 0) {
      if (errno == EINTR) continue;
      int error = errno;
      ::close(fd);
      return fail(error);
    }
    if (got == 0) break;
    bytes.insert(bytes.end(), buffer, buffer + got);
  }
  // The envelope is read once per use; keep it out of the page cache.
  ::posix_fadvise(fd, 0, 0, POSIX_FADV_DONTNEED);
  ::close(fd);
  return bytes;
}

std::optional<double> StorebagDiskCache::modificationTime(const std::string& name) const {
  struct stat info {};
  std::string path = (std::filesystem::path(directory()) / name).string();
  if (::stat(path.c_str(), &info) != 0) return std::nullopt;
  return static_cast<double>(info.st_mtim.tv_sec) + static_cast<double>(info.st_mtim.tv_nsec) / 1e9;
}

std::optional<double> StorebagDiskCache::ageSeconds(const std::string& name, double now) const {
  std::optional<double> modified = modificationTime(name);
  if (!modified) return std::nullopt;
  return std::fabs(now - *modified);
}

bool isStorebagCacheExpired(double ageSeconds, std::int32_t maxAgeSeconds) {
  return ageSeconds > static_cast<double>(maxAgeSeconds);
}

bool setStorageClassProtectionLevel(const std::string& path) { return true; }

std::recursive_mutex& storebagLock() {
  static std::recursive_mutex lock;
  return lock;
}

}  // namespace telvane
