// HTTPSPostBackend: the HTTP request of a post document and the server's answer.
//
// The body is gzip-compressed when that makes it strictly shorter. Outside internal
// releases every URL is forced onto https. The request carries the client's names,
// the daemon's version and the sender's component tag in headers, and, for a backend
// given a digest key, an HMAC-SHA1 of the uncompressed JSON. A 5xx answer disables the
// backend; any other answer leaves its state alone.
#include <utility>

#include "backends/https/HTTPSPostBackend.h"
#include "platform/Crypto.h"
#include "platform/Log.h"
#include "util/ComponentTags.h"
#include "util/Compression.h"

namespace telvane {

namespace {

constexpr const char* kSchemeSeparator = "://";
constexpr const char* kSecureScheme = "https";
constexpr const char* kClientNameKey = "_clientName";
constexpr const char* kServiceNameKey = "_serviceName";
constexpr const char* kJsonContentType = "application/json";
// The digest algorithm that sends an HMAC-SHA1; other values send no digest.
constexpr std::int32_t kHmacSha1DigestAlgorithm = 0;

bool isRealtimeFlag(std::uint32_t flag) {
  return flag == kMessageFlagRealtime || flag == kMessageFlagRealtimeAndPromote;
}

bool equalsIgnoringCaseAscii(std::string_view a, std::string_view b) {
  if (a.size() != b.size()) return false;
  for (std::size_t i = 0; i < a.size(); ++i) {
    char x = a[i] >= 'A' && a[i] <= 'Z' ? static_cast<char>(a[i] - 'A' + 'a') : a[i];
    char y = b[i] >= 'A' && b[i] <= 'Z' ? static_cast<char>(b[i] - 'A' + 'a') : b[i];
    if (x != y) return false;
  }
  return true;
}

// "https://" and the text between the first and the second "://", when the URL has a
// scheme other than https; the URL itself otherwise.
std::string forcedSecureURL(const std::string& url) {
  std::size_t first = url.find(kSchemeSeparator);
  if (first == std::string::npos) return url;
  std::string_view scheme(url.data(), first);
  if (equalsIgnoringCaseAscii(scheme, kSecureScheme)) return url;
  std::size_t start = first + std::char_traits<char>::length(kSchemeSeparator);
  std::size_t second = url.find(kSchemeSeparator, start);
  std::string remainder = url.substr(start, second == std::string::npos ? std::string::npos : second - start);
  return std::string(kSecureScheme) + kSchemeSeparator + remainder;
}

// Byte data as the platform describes it: lower-case hexadecimal in angle brackets,
// eight digits to a group, groups separated by blanks.
std::string byteDataDescription(const Bytes& bytes) {
  static constexpr char kDigits[] = "0123456789abcdef";
  std::string text = "<";
  for (std::size_t i = 0; i < bytes.size(); ++i) {
    if (i > 0 && i % 4 == 0) text += ' ';
    text += kDigits[bytes[i] >> 4];
    text += kDigits[bytes[i] & 0x0f];
  }
  text += '>';
  return text;
}

std::string headerText(const Value& value) {
  if (const std::string* text = value.asString()) return *text;
  return value.description();
}

}  // namespace

void HTTPSPostBackend::postJSONMessage(const std::string& json, std::uint32_t flag,
                                       std::optional<std::uint16_t> method, std::optional<std::uint16_t> responseCode,
                                       FlushCompletion completion) {
  std::optional<std::string> url;
  {
    std::lock_guard<std::mutex> lock(settingsMutex_);
    url = isRealtimeFlag(flag) ? realtimePostURL_ : postURL_;
  }
  if (!url) {
    if (completion) completion(std::nullopt, makeTelvaneError(-1, "postURL is nil"));
    return;
  }

  HttpRequest request;
  request.method = "POST";
  bool compressed = false;
  {
    std::optional<Bytes> gzipped = gzipDeflate(json);
    if (gzipped && !gzipped->empty() && gzipped->size() < json.size()) {
      request.body.assign(reinterpret_cast<const char*>(gzipped->data()), gzipped->size());
      compressed = true;
    } else {
      request.body = json;
    }
  }
  addBytesSent(static_cast<std::uint32_t>(request.body.size()));
  // Internal releases may post over plain HTTP.
  request.url = internalRelease_ ? *url : forcedSecureURL(*url);

  std::optional<Bytes> digest;
  {
    std::lock_guard<std::mutex> lock(settingsMutex_);
    auto& headers = request.headers;
    headers.reserve(13);
    const Value& clientName = userInfoDict_[kClientNameKey];
    if (!clientName.isNull()) headers.emplace_back("X-TVX-Client-Name", headerText(clientName));
    const Value& serviceName = userInfoDict_[kServiceNameKey];
    if (!serviceName.isNull()) headers.emplace_back("X-TVX-Service-Name", headerText(serviceName));
    if (isInternal_) headers.emplace_back("X-TVX-Internal-Build", "1");
    std::string version = std::to_string(selfVersionMajor_) + "." + std::to_string(selfVersionMiddle_);
    if (selfVersionMinor_ != 0) version += "." + std::to_string(selfVersionMinor_);
    headers.emplace_back("User-Agent", "Telvane/" + version + " (" + hardwareType_.value_or("(null)") + "; " +
                                           productVersion_.value_or("(null)") + ")");
    headers.emplace_back("X-TVX-Client-Version", std::to_string(clientVersion_));
    std::optional<std::string_view> tag = componentTag(compType_);
    headers.emplace_back("X-TVX-Sender", std::string(tag ? *tag : std::string_view(kUnknownComponentTag)));
    if (method && responseCode) {
      headers.emplace_back("X-TVX-Event-Map", std::to_string(*method) + " " + std::to_string(*responseCode));
    }
    headers.emplace_back("Accept", kJsonContentType);
    headers.emplace_back("Content-Type", kJsonContentType);
    headers.emplace_back("Content-Length", std::to_string(request.body.size()));
    if (compressed) headers.emplace_back("Content-Encoding", "gzip");
    if (digestKey_ && digestAlgorithm_ == kHmacSha1DigestAlgorithm) digest = digestKey_;
  }
  if (digest) request.headers.emplace_back("X-TVX-DIGEST", byteDataDescription(crypto::hmacSha1(*digest, json)));

  std::shared_ptr<ReportingSessionConnectivityHelper> helper = reportingSessionConnectivityDelegate();
  // Without a helper nothing is sent and the completion is never called.
  if (!helper) return;
  // The answer may come after the backend is gone: it holds the state queue and its
  // data, not the backend.
  helper->postURLRequestWithCompletionHandler(
      std::move(request), [name = name_, queue = stateQueue_, data = queueState_, completion = std::move(completion)](
                              std::optional<std::string> /*data*/, std::optional<HttpResponse> response,
                              std::optional<TelvaneError> error) {
        if (error) log::info("HTTPSPostBackend(postJsonMessage): post error: %s", error->description);
        long status = response ? response->statusCode : 0;
        if (status >= 500 && status <= 599) {
          std::string text = fmt::sprintf("backend %s disabled by server %d return code", name, status);
          log::info("postJSONMessage: %s", text);
          queue->async([data] { data->state = kBackendStateDisabled; });
          if (completion) completion(std::nullopt, makeTelvaneError(status, text));
          return;
        }
        // A 4xx answer leaves the backend enabled.
        if (completion) completion(std::nullopt, std::move(error));
      });
}

}  // namespace telvane
