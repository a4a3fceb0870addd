#include "storebag/StorebagRetrieval.h"

#include <algorithm>
#include <cstdlib>
#include <string_view>
#include <utility>

#include "connectivity/ReportingSessionConnectivityHelperImpl.h"
#include "platform/Log.h"
#include "platform/Paths.h"
#include "platform/SystemInfo.h"
#include "storebag/StorebagBackends.h"
#include "util/DeviceInfo.h"

namespace telvane {

namespace {

std::shared_ptr<ReportingSessionConnectivityHelper> makeRealStorebagHelper() {
  Value userInfo = Value::dictionary();
  userInfo.asDictionary()->set("_clientName", Value("storebag"));
  userInfo.asDictionary()->set("_serviceName", Value("shared"));
  ReportingSessionConnectivityHelperImpl::Options options;
  // Background refreshes of a fleet are spread over two hours; a deployment (or a
  // developer machine) may narrow the spread.
  options.pullDelayRangeSeconds = storebagRefreshSpreadSeconds(std::getenv(kStorebagRefreshSpreadVariable));
  auto helper = ReportingSessionConnectivityHelperImpl::create(
      {}, ReportingSessionConnectivityHelper::GETRequestMode(), userInfo, std::move(options));
  if (helper) helper->activate(kStorebagHelperReleaseTimeoutSeconds);
  return helper;
}

std::string versionOrDefault(std::optional<std::string> version) {
  if (version && !version->empty()) return *version;
  std::string bundle = frameworkBundleVersion();
  return bundle.empty() ? std::string(kDefaultDaemonVersion) : bundle;
}

std::string describeError(const std::optional<TelvaneError>& error, const std::optional<HttpResponse>& response) {
  if (error) return error->description;
  if (response) return "HTTP status " + std::to_string(response->statusCode);
  return "no response";
}

}  // namespace

std::uint32_t storebagRefreshSpreadSeconds(const char* text) {
  constexpr std::uint32_t kPullDelayRangeSeconds = ReportingSessionConnectivityHelperImpl::kPullDelayRangeSeconds;
  if (!text || !*text) return kPullDelayRangeSeconds;
  // Decimal digits only: no sign, no blanks, no unit.
  const std::string_view digits(text);
  const bool decimal = std::all_of(digits.begin(), digits.end(), [](char c) { return c >= '0' && c <= '9'; });
  if (!decimal) {
    log::error("%s=%s is not a whole number of seconds; the refresh spread stays %u seconds",
               kStorebagRefreshSpreadVariable, text, kPullDelayRangeSeconds);
    return kPullDelayRangeSeconds;
  }
  // More digits than any spread needs, or a value above the default, only widen it.
  if (digits.size() > 9 || std::strtoul(text, nullptr, 10) > kPullDelayRangeSeconds) {
    log::info("%s=%s would widen the refresh spread; it stays %u seconds", kStorebagRefreshSpreadVariable, text,
              kPullDelayRangeSeconds);
    return kPullDelayRangeSeconds;
  }
  return std::max<std::uint32_t>(1, static_cast<std::uint32_t>(std::strtoul(text, nullptr, 10)));
}

StorebagRetrieval::Cache::Cache(StorebagDiskCache diskCache, std::shared_ptr<SettingsStore> settings,
                                PublicKeyLoader publicKey)
    : diskCache(std::move(diskCache)), metrics(std::move(settings)), verifier(std::move(publicKey), &this->diskCache) {}

StorebagRetrieval::StorebagRetrieval(Options options)
    : settings_(options.settings ? std::move(options.settings) : defaultSettingsStore()),
      cache_(std::make_shared<Cache>(options.diskCache ? std::move(*options.diskCache) : StorebagDiskCache::system(),
                                     settings_,
                                     options.publicKey ? std::move(options.publicKey)
                                                       : publicKeyFileLoader(publicKeyPath()))),
      internalBuild_(options.internalBuild.value_or(isInternalBuild())),
      daemonVersion_(versionOrDefault(std::move(options.daemonVersion))),
      clock_(options.clock ? options.clock : Clock::system().get()),
      makeHelper_(options.makeHelper ? std::move(options.makeHelper) : HelperFactory(makeRealStorebagHelper)),
      blockingWaitLimit_(options.blockingWaitLimit) {}

StorebagRetrieval::~StorebagRetrieval() = default;

std::string StorebagRetrieval::builtInServerBaseURL(bool internalBuild) {
  return internalBuild ? TELVANE_STOREBAG_SERVER_INTERNAL : TELVANE_STOREBAG_SERVER_RELEASE;
}

std::string StorebagRetrieval::storebagServerBaseURL() const {
  if (auto value = settings_->read(kTelvaneSettingsDomain, kStorebagURLSettingsKey); value && value->isString()) {
    return *value->asString();
  }
  return builtInServerBaseURL(internalBuild_);
}

std::string StorebagRetrieval::storebagRequestURL(const std::string& name) const {
  return storebagServerBaseURL() + "/" + name + "?version=" + daemonVersion_;
}

StorebagFetcher StorebagRetrieval::fetcher() {
  return [this](const std::string& name, std::int32_t& maxAge, bool& notModified) {
    return fetchStorebagWithName(name, maxAge, notModified);
  };
}

std::shared_ptr<ReportingSessionConnectivityHelper> StorebagRetrieval::sharedStorebagConnectivityHelper() {
  std::lock_guard<std::recursive_mutex> lock(storebagLock());
  if (!sharedHelper_) sharedHelper_ = makeHelper_();
  return sharedHelper_;
}

std::optional<Value> StorebagRetrieval::fetchStorebagWithName(const std::string& name, std::int32_t& maxAge,
                                                              bool& notModified) {
  maxAge = 0;
  notModified = false;
  std::unique_lock<std::recursive_mutex> lock(storebagLock());
  std::optional<Bytes> envelope = cache_->diskCache.load(name);
  if (envelope) {
    // The local Last-Modified starts empty, so the stored value is handed back (and
    // logged as changed) rather than compared.
    std::optional<std::string> lastModified;
    cache_->metrics.get(name, &maxAge, nullptr, &lastModified);
    const double age = cache_->diskCache.ageSeconds(name, clock_->now()).value_or(0);
    lock.unlock();
    const bool expired = isStorebagCacheExpired(age, maxAge);
    log::info("fetchStorebagWithName: storebag '%s' loaded from disk cache. Disk cache %s refreshed", name,
              expired ? "expired and will be" : "is valid and will not be");
    // The cached envelope serves this call either way; a refresh helps later ones.
    if (expired) fetchNetworkStorebag(name, false, lastModified);
  } else {
    lock.unlock();
    envelope = fetchNetworkStorebag(name, true, std::nullopt);
  }

  lock.lock();
  // Seen again so that a save made by the network completion counts.
  cache_->metrics.get(name, &maxAge, &notModified, nullptr);
  if (notModified || !envelope) return std::nullopt;
  return cache_->verifier.verify(name, *envelope, false);
}

void StorebagRetrieval::handleCompletion(Cache& cache, const std::string& name, const std::optional<std::string>& data,
                                         const std::optional<HttpResponse>& response) {
  {
    std::lock_guard<std::recursive_mutex> lock(storebagLock());
    cache.metrics.save(name, response->header("Cache-Control"), response->header("Last-Modified"));
  }
  if (data && !data->empty()) {
    // Saves the envelope when its signature is good; the document is not needed here.
    std::lock_guard<std::recursive_mutex> lock(storebagLock());
    cache.verifier.verify(name, Bytes(data->begin(), data->end()), true);
  } else {
    log::info("fetchNetworkStorebag: received zero-length storebag for '%s\u2018, treat as unchanged", name);
  }
}

namespace {

// What a blocking fetch waits for.
struct BlockingResult {
  std::mutex mutex;
  std::condition_variable done;
  bool finished = false;
  std::optional<std::string> data;
  std::optional<HttpResponse> response;
  std::optional<TelvaneError> error;
};

}  // namespace

std::optional<Bytes> StorebagRetrieval::fetchNetworkStorebag(const std::string& name, bool blocking,
                                                             const std::optional<std::string>& lastModified) {
  const std::string url = storebagRequestURL(name);
  log::info("fetchNetworkStorebag: Storebag Server URL: %s", url);

  HttpRequest request;
  request.method = "GET";
  request.url = url;
  request.connectTimeout = kStorebagRequestTimeout;
  request.idleTimeout = kStorebagRequestTimeout;
  if (lastModified) {
    log::info("fetchNetworkStorebag: Adding 'Last-Modified: %s' to the header", *lastModified);
    request.headers.emplace_back("If-Modified-Since", *lastModified);
  }

  auto helper = sharedStorebagConnectivityHelper();
  bool alreadyRequested = false;
  {
    std::lock_guard<std::recursive_mutex> lock(storebagLock());
    alreadyRequested = std::find(requestedURLs_.begin(), requestedURLs_.end(), url) != requestedURLs_.end();
    if (!alreadyRequested) requestedURLs_.push_back(url);
  }

  auto result = blocking ? std::make_shared<BlockingResult>() : nullptr;
  // Holds the cache, not this object: the completion may come after this object has gone.
  auto completion = [cache = cache_, name, result](std::optional<std::string> data,
                                                   std::optional<HttpResponse> response,
                                                   std::optional<TelvaneError> error) {
    const long status = response ? response->statusCode : 0;
    if (!error && status == 200) {
      handleCompletion(*cache, name, data, response);
    } else {
      log::info("fetchNetworkStorebag: storebag '%s' does not need update as its content has not changed on the "
                "server",
                name);
    }
    if (result) {
      std::lock_guard<std::mutex> lock(result->mutex);
      result->data = std::move(data);
      result->response = std::move(response);
      result->error = std::move(error);
      result->finished = true;
      result->done.notify_all();
    }
  };
  if (!helper) {
    completion(std::nullopt, std::nullopt, makeTelvaneError(-1, "ConnectivityHelper is not ative"));
  } else {
    helper->getURLRequestWithCompletionHandler(std::move(request), blocking, completion);
  }
  if (!blocking) return std::nullopt;

  std::unique_lock<std::mutex> wait(result->mutex);
  // The helper ignores a URL it has seen and never completes it: do not wait then.
  if (!alreadyRequested || !helper) {
    result->done.wait_for(wait, blockingWaitLimit_, [&] { return result->finished; });
  }
  const bool ok = result->finished && !result->error && result->response && result->response->statusCode == 200;
  if (!ok) {
    std::string errorText;
    if (!result->finished) {
      errorText = alreadyRequested ? "request already made by this process" : "no answer in time";
    } else {
      errorText = describeError(result->error, result->response);
    }
    log::info("fetchNetworkStorebag: Error resolving with lookup server %s, sendSynchronousRequest error %s", url,
              errorText);
    if (name == kFallbackStorebagName) {
      log::info("fetchNetworkStorebag: Loading default storebag '%s'", name);
      return defaultStorebagData();
    }
    return std::nullopt;
  }
  const std::string& data = result->data ? *result->data : std::string();
  return Bytes(data.begin(), data.end());
}

}  // namespace telvane
