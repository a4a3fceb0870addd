#include "platform/DiagnosticLogService.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <system_error>

#include "platform/Log.h"

namespace telvane {

namespace {

constexpr mode_t kLogFileMode = 0644;

class LinuxDiagnosticLogService : public DiagnosticLogService {
 public:
  explicit LinuxDiagnosticLogService(std::optional<std::string> submissionDir)
      : submissionDir_(std::move(submissionDir)) {}

  int createLogFile(const std::string& path, const std::string& logType) override {
    // The caller reports a failure in its own words.
    return ::open(path.c_str(), O_CREAT | O_WRONLY | O_CLOEXEC, kLogFileMode);
  }

  bool submitLogFile(const std::string& path, const std::string& logType) override {
    if (!submissionDir_) return false;
    std::error_code ec;
    std::filesystem::create_directories(*submissionDir_, ec);
    if (ec) {
      log::error("DiagnosticLogService: Cannot create submission folder %s: %s", *submissionDir_, ec.message());
      return false;
    }
    const std::string target =
        (std::filesystem::path(*submissionDir_) / std::filesystem::path(path).filename()).string();
    if (::rename(path.c_str(), target.c_str()) == 0) return true;
    if (errno == EXDEV) return copyThenUnlink(path, target);
    log::debug("DiagnosticLogService: Cannot move %s to %s: %s", path, target, std::strerror(errno));
    return false;
  }

 private:
  const std::optional<std::string> submissionDir_;
};

}  // namespace

bool copyThenUnlink(const std::string& from, const std::string& to) {
  const std::string temporary = to + ".partial";
  std::error_code ec;
  std::filesystem::copy_file(from, temporary, std::filesystem::copy_options::overwrite_existing, ec);
  if (ec) {
    log::debug("DiagnosticLogService: Cannot copy %s to %s: %s", from, temporary, ec.message());
    std::filesystem::remove(temporary, ec);
    return false;
  }
  if (::rename(temporary.c_str(), to.c_str()) != 0) {
    log::debug("DiagnosticLogService: Cannot rename %s to %s: %s", temporary, to, std::strerror(errno));
    std::filesystem::remove(temporary, ec);
    return false;
  }
  if (::unlink(from.c_str()) != 0 && errno != ENOENT) {
    log::debug("DiagnosticLogService: Cannot remove %s: %s", from, std::strerror(errno));
  }
  return true;
}

std::shared_ptr<DiagnosticLogService> DiagnosticLogService::system() {
  static const std::shared_ptr<DiagnosticLogService> service = [] {
    const char* dir = std::getenv("TELVANED_SUBMISSION_DIR");
    return makeDiagnosticLogService(dir && *dir ? std::optional<std::string>(dir) : std::nullopt);
  }();
  return service;
}

std::shared_ptr<DiagnosticLogService> makeDiagnosticLogService(std::optional<std::string> submissionDir) {
  return std::make_shared<LinuxDiagnosticLogService>(std::move(submissionDir));
}

}  // namespace telvane
