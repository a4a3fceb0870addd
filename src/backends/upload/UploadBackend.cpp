#include "backends/upload/UploadBackend.h"

#include <curl/curl.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/Json.h"
#include "platform/Log.h"
#include "util/Compression.h"

namespace telvane {

namespace {

constexpr const char* kPostURLKey = "post_url";
constexpr const char* kDisplayURLKey = "display_url";
constexpr const char* kSuccessWord = "success";
constexpr std::size_t kReadChunkBytes = 256 * 1024;

std::string errnoText(int error) { return std::strerror(error); }

// Whether libcurl can make a request of the text: an absolute URL with a scheme.
bool isUsableURL(const std::string& url) {
  CURLU* handle = curl_url();
  if (!handle) return false;
  const bool usable = curl_url_set(handle, CURLUPART_URL, url.c_str(), 0) == CURLUE_OK;
  curl_url_cleanup(handle);
  return usable;
}

std::string lastPathComponent(const std::string& path) {
  std::string trimmed = path;
  while (trimmed.size() > 1 && trimmed.back() == '/') trimmed.pop_back();
  const std::size_t slash = trimmed.rfind('/');
  return slash == std::string::npos ? trimmed : trimmed.substr(slash + 1);
}

// Removes the uploaded file, but only while the path still names the file that was
// uploaded (the one behind the descriptor): a client cannot make the daemon remove a
// file it did not hand over. Errors are not reported to the caller; a removal the
// daemon has no right to make is left to the client.
void removeUploadedFile(const std::string& path, FileAccessToken& token) {
  struct stat uploaded {};
  struct stat named {};
  if (::fstat(token.descriptor, &uploaded) != 0 || ::lstat(path.c_str(), &named) != 0) return;
  if (uploaded.st_dev != named.st_dev || uploaded.st_ino != named.st_ino) {
    log::error("UploadBackend(uploadFileAtPath): Not removing %s: it is no longer the uploaded file", path);
    return;
  }
  if (::unlink(path.c_str()) == 0) return;
  const int error = errno;
  if (error == EACCES || error == EPERM || error == EROFS) {
    log::info("UploadBackend(uploadFileAtPath): Leaving the removal of %s to the client: %s", path, errnoText(error));
    token.removalLeftToClient = true;
  }
}

}  // namespace

std::shared_ptr<UploadBackend> UploadBackend::create(const std::string& name, const Value& profile,
                                                     const std::optional<std::string>& productFamily,
                                                     const BackendPlatform& platform) {
  if (!profile[kPostURLKey].isString()) {
    log::error("UploadBackend(initWithName): can't resolve upload post URL.");
    return nullptr;
  }
  return std::shared_ptr<UploadBackend>(
      new UploadBackend(name, profile.copy(), productFamily, platform.withSystemDefaults()));
}

UploadBackend::UploadBackend(std::string name, Value profile, std::optional<std::string> productFamily,
                             BackendPlatform platform)
    : TelvaneBackendBase(std::move(name), std::move(profile), std::move(productFamily), std::move(platform)) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  uploadURL_ = *profile_[kPostURLKey].asString();
  if (const std::string* url = profile_[kDisplayURLKey].asString()) displayURL_ = *url;
  // A maximum that is not a positive number keeps the default.
  if (std::optional<Value> stored = platform_.settings->read(kBackendDefaultsDomain, kMaxUploadFileSizeDefaultsKey)) {
    if (stored->isNumber() && stored->integerValue() > 0) maxUploadFileSize_ = stored->integerValue();
  }
}

std::optional<std::string> UploadBackend::uploadURL() const {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  return uploadURL_;
}

void UploadBackend::setUploadURL(std::optional<std::string> url) {
  std::lock_guard<std::mutex> lock(settingsMutex_);
  uploadURL_ = std::move(url);
}

std::string UploadBackend::percentEncodeForQuery(std::string_view text) {
  static constexpr char kDigits[] = "0123456789ABCDEF";
  static constexpr std::string_view kAllowedMarks = "!$&'()*+,-./:;=?@_~";
  std::string out;
  out.reserve(text.size());
  for (char c : text) {
    const auto byte = static_cast<unsigned char>(c);
    const bool alphanumeric = (byte >= 'a' && byte <= 'z') || (byte >= 'A' && byte <= 'Z') || (byte >= '0' && byte <= '9');
    if (alphanumeric || (byte < 0x80 && kAllowedMarks.find(c) != std::string_view::npos)) {
      out += c;
    } else {
      out += '%';
      out += kDigits[byte >> 4];
      out += kDigits[byte & 0x0f];
    }
  }
  return out;
}

std::string UploadBackend::composeUploadURL(const std::string& uploadURL, const std::string& udid,
                                            std::uint32_t sessionID, const std::string& path) {
  return uploadURL + "?uuid=" + udid + "&sequence=" + std::to_string(sessionID) +
         "&description=" + percentEncodeForQuery(kUploadDescription) + "%20(Uploaded%20by%20VTR)" +
         "&filename=" + percentEncodeForQuery(lastPathComponent(path) + ".gz") + "&raw=true";
}

UploadBackend::ReadOutcome UploadBackend::readAndCompress(const std::string& path, int descriptor,
                                                         std::int64_t expectedSize, std::string& compressed) const {
  if (expectedSize > maxUploadFileSize_) {
    log::error("UploadBackend(uploadFileAtPath): File %s of %lld bytes exceeds the maximum upload size of %lld bytes",
               path, static_cast<long long>(expectedSize), static_cast<long long>(maxUploadFileSize_));
    return ReadOutcome::Refused;
  }
  GzipDeflateStream stream;
  std::string chunk(kReadChunkBytes, '\0');
  // Read from the start whatever the descriptor's offset; it is shared with the client.
  off_t offset = 0;
  for (;;) {
    const ssize_t n = ::pread(descriptor, chunk.data(), chunk.size(), offset);
    if (n < 0) {
      if (errno == EINTR) continue;
      log::error("UploadBackend(uploadFileAtPath): Unable to read %s: %s", path, errnoText(errno));
      return ReadOutcome::Empty;  // what could not be read counts as empty
    }
    if (n == 0) break;
    offset += n;
    if (offset > maxUploadFileSize_) {
      log::error("UploadBackend(uploadFileAtPath): File %s grew beyond the maximum upload size of %lld bytes", path,
                 static_cast<long long>(maxUploadFileSize_));
      return ReadOutcome::Refused;
    }
    if (!stream.append(chunk.data(), static_cast<std::size_t>(n))) return ReadOutcome::Refused;
  }
  if (offset == 0) return ReadOutcome::Empty;
  if (offset != expectedSize) {
    log::error("UploadBackend(uploadFileAtPath): File %s changed while it was read (%lld bytes expected, %lld read)",
               path, static_cast<long long>(expectedSize), static_cast<long long>(offset));
    return ReadOutcome::Refused;
  }
  std::optional<std::string> finished = stream.finish();
  if (!finished) return ReadOutcome::Refused;
  compressed = std::move(*finished);
  return ReadOutcome::Compressed;
}

bool UploadBackend::uploadFileAtPath(const std::string& path, FileAccessToken& token) {
  log::info("UploadBackend(uploadFileAtPath): Uploading file %s", path);
  std::optional<std::string> url = uploadURL();
  if (!url) return false;

  // Redeeming the client's token is taking its descriptor; the session closes it when
  // the call returns.
  struct stat attributes {};
  if (token.descriptor < 0 || ::fstat(token.descriptor, &attributes) != 0) {
    log::error("UploadBackend(uploadFileAtPath): Cannot read the attributes of %s: %s", path,
               token.descriptor < 0 ? std::string("no file descriptor was passed") : errnoText(errno));
    log::error("UploadBackend(uploadFileAtPath): Only upload a regular file.");
    return false;
  }
  if (!S_ISREG(attributes.st_mode)) {
    log::error("UploadBackend(uploadFileAtPath): Only upload a regular file.");
    return false;
  }

  std::string compressed;
  switch (readAndCompress(path, token.descriptor, attributes.st_size, compressed)) {
    case ReadOutcome::Compressed: break;
    case ReadOutcome::Empty:
      log::error("UploadBackend(uploadFileAtPath): Input file is empty");
      return false;
    case ReadOutcome::Refused: return false;
  }

  HttpRequest request;
  request.method = "POST";
  request.url = composeUploadURL(*url, udid(), sessionID(), path);
  if (!isUsableURL(request.url)) {
    log::error("UploadBackend(uploadFileAtPath): Unable to create URL request");
    return false;
  }
  request.headers = {{"Content-Type", "application/octet-stream"}, {"Content-Encoding", "gzip"}};
  request.body = std::move(compressed);

  std::shared_ptr<ReportingSessionConnectivityHelper> helper = reportingSessionConnectivityDelegate();
  if (!helper) return true;
  postAndRemoveOnSuccess(*helper, std::move(request), path, token);
  // Once posted, the upload counts as done whatever came back.
  return true;
}

void UploadBackend::postAndRemoveOnSuccess(ReportingSessionConnectivityHelper& helper, HttpRequest request,
                                           const std::string& path, FileAccessToken& token) const {
  const std::string url = request.url;
  std::optional<PostAnswer> answer = postAndWait(helper, std::move(request), kUploadAnswerWaitLimit);
  if (!answer) {
    log::error("UploadBackend(uploadFileAtPath): post %s",
               "no answer within " + std::to_string(kUploadAnswerWaitLimit.count()) + " seconds");
    return;
  }
  if (answer->error) {
    log::error("UploadBackend(uploadFileAtPath): post %s", answer->error->description);
    return;
  }
  // A body that is not UTF-8 text reads as no text at all.
  std::optional<std::string> text;
  if (answer->data && json::isValidUtf8(*answer->data)) text = std::move(answer->data);
  log::info("UploadBackend(uploadFileAtPath): sending to |%s|, Json output: %s", url, text ? *text : "(null)");
  if (text && text->find(kSuccessWord) != std::string::npos) removeUploadedFile(path, token);
}

}  // namespace telvane
