// StorebagRetrieval: obtains the signed storebag of one storebag name for the storebag
// document, keeping the last good envelope in the disk cache and refreshing it from
// the storebag server with conditional GET requests.
//
// A call of fetchStorebagWithName loads the cached envelope (and, when it has aged
// past the server's max age, starts a background refresh whose answer only later
// calls see), or, without a cached envelope, waits for the server. Every envelope is
// verified before use. The server's caching metrics live in the settings store; a
// 200 answer moves them forward before and independently of the signature check.
//
// All HTTP goes through one GET-mode connectivity helper made on first use and kept
// for the object's life (the daemon has one retrieval, so one helper). That helper
// fetches each distinct URL once in its lifetime; a blocking fetch whose URL was
// already asked for therefore returns at once as failed instead of waiting for a
// completion that will never come, and every blocking wait is bounded.
//
// Threading: safe from any thread. Every disk-cache and metrics access holds
// storebagLock(); a blocking fetch waits with it released, and the completion runs on
// the helper's queue, never needing the caller's thread. A completion keeps the disk
// cache and metrics it writes alive itself, so the object may go while a request is
// still out.
#pragma once
#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "connectivity/ReportingSessionConnectivityHelper.h"
#include "platform/Clock.h"
#include "platform/SettingsStore.h"
#include "storebag/StorebagDiskCache.h"
#include "storebag/StorebagDocument.h"
#include "storebag/StorebagEnvelope.h"
#include "storebag/StorebagMetrics.h"
#include "telvane/Value.h"

namespace telvane {

// The settings key of the storebag server's base URL.
inline constexpr const char* kStorebagURLSettingsKey = "telvane_storebag_url";
// How long one request may stay without progress.
inline constexpr std::chrono::seconds kStorebagRequestTimeout{15};
// Narrows the random spread (seconds) of background storebag refreshes.
inline constexpr const char* kStorebagRefreshSpreadVariable = "TELVANED_STOREBAG_REFRESH_SPREAD_SECONDS";
// The spread of background refreshes for the variable's text: whole seconds from 1 up
// to the default spread, which the variable may only narrow. A missing or empty text
// keeps the default; a text that is not a number keeps it with an error line; a value
// above the default keeps it too, and 0 becomes 1.
std::uint32_t storebagRefreshSpreadSeconds(const char* text);
// The activation value of the shared GET helper.
inline constexpr std::uint32_t kStorebagHelperReleaseTimeoutSeconds = 30;

class StorebagRetrieval {
 public:
  using HelperFactory = std::function<std::shared_ptr<ReportingSessionConnectivityHelper>()>;

  struct Options {
    // Metrics and the server URL setting. Null: the process's settings store.
    std::shared_ptr<SettingsStore> settings;
    // The envelope files. Unset: the daemon's cache folder.
    std::optional<StorebagDiskCache> diskCache;
    // The deployment's public key. Unset: the key file of the installation.
    PublicKeyLoader publicKey;
    // Chooses the built-in server. Unset: isInternalBuild().
    std::optional<bool> internalBuild;
    // The "version" query value. Unset: the framework's bundle version, else "8.0".
    std::optional<std::string> daemonVersion;
    Clock* clock = nullptr;  // null: the system clock
    // Makes the shared GET helper (already activated). Unset: a real helper in GET
    // mode for the user "storebag:shared", activated with 30.
    HelperFactory makeHelper;
    // The longest a blocking fetch waits for its completion: the request's own
    // timeout is the normal bound, this one only guards against a lost completion.
    std::chrono::milliseconds blockingWaitLimit{std::chrono::seconds(60)};
  };

  explicit StorebagRetrieval(Options options);
  ~StorebagRetrieval();
  StorebagRetrieval(const StorebagRetrieval&) = delete;
  StorebagRetrieval& operator=(const StorebagRetrieval&) = delete;

  // The decoded, macro-expanded document of the name, or nothing; sets the max age
  // (seconds) and the not-modified flag.
  std::optional<Value> fetchStorebagWithName(const std::string& name, std::int32_t& maxAge, bool& notModified);
  // Blocking: the envelope bytes of a 200 answer (also empty ones), the fallback
  // document for "confera" after a failure, or nothing. Non-blocking: nothing at once;
  // the completion saves what the server sent.
  std::optional<Bytes> fetchNetworkStorebag(const std::string& name, bool blocking,
                                            const std::optional<std::string>& lastModified);

  // The base URL: the "telvane_storebag_url" setting when it is a string, else the
  // built-in one.
  std::string storebagServerBaseURL() const;
  // "<base>/<name>?version=<daemon version>".
  std::string storebagRequestURL(const std::string& name) const;
  // This object as the document's fetcher. The object must outlive it.
  StorebagFetcher fetcher();

  const StorebagDiskCache& diskCache() const { return cache_->diskCache; }

  // The built-in base URL of a build kind.
  static std::string builtInServerBaseURL(bool internalBuild);

 private:
  // The disk cache, the metrics and the verifier: what a request's completion works
  // with. Completions hold it themselves, so that one arriving after this object has
  // gone (a blocking fetch that gave up waiting, a background refresh) still finds it.
  struct Cache {
    Cache(StorebagDiskCache diskCache, std::shared_ptr<SettingsStore> settings, PublicKeyLoader publicKey);
    Cache(const Cache&) = delete;
    Cache& operator=(const Cache&) = delete;

    const StorebagDiskCache diskCache;
    StorebagMetrics metrics;
    const StorebagVerifier verifier;  // saves into diskCache
  };

  std::shared_ptr<ReportingSessionConnectivityHelper> sharedStorebagConnectivityHelper();
  static void handleCompletion(Cache& cache, const std::string& name, const std::optional<std::string>& data,
                               const std::optional<HttpResponse>& response);

  // Constant after construction.
  std::shared_ptr<SettingsStore> settings_;
  const std::shared_ptr<Cache> cache_;
  bool internalBuild_;
  std::string daemonVersion_;
  Clock* clock_;
  HelperFactory makeHelper_;
  std::chrono::milliseconds blockingWaitLimit_;

  // Guarded by storebagLock().
  std::shared_ptr<ReportingSessionConnectivityHelper> sharedHelper_;
  // The URLs handed to the shared helper; the helper ignores a URL a second time.
  std::vector<std::string> requestedURLs_;
};

}  // namespace telvane
