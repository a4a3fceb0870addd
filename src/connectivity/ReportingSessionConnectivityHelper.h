// ReportingSessionConnectivityHelper: the shared HTTP helper of the reporting sessions
// of one client, as the rest of the daemon sees it.
//
// This is the helper's interface: what a reporting session calls on the helper it
// obtained from the agent (activate, release timeout, served-session count, its HTTP
// session's identifier for log lines) and the two requests through which the HTTPS
// backend and the storebag retrieval reach the network (POST and GET). It also holds
// the class-wide parts: the request modes, the user-info key and the storage folder of
// file-based uploads. The real helper is ReportingSessionConnectivityHelperImpl.
//
// Threading: every operation may be called from any thread and returns at once; the
// real helper does the work on its own serial queue. Completions run on that queue.
#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <string>

#include "platform/HttpEngine.h"
#include "telvane/Value.h"
#include "util/TelvaneError.h"

namespace telvane {

// What a request ends with: the received bytes, the response (none when no response
// arrived) and the error (none on success).
using ConnectivityCompletion = std::function<void(std::optional<std::string> data,
                                                  std::optional<HttpResponse> response,
                                                  std::optional<TelvaneError> error)>;

class ReportingSessionConnectivityHelper {
 public:
  // Request modes of a helper: 1 uploads through files in the storage folder, 2 is a
  // background GET, 4 a plain POST and 8 a plain GET.
  static constexpr std::int32_t kFileUploadRequestMode = 1;
  static constexpr std::int32_t kBackgroundGETRequestMode = 2;
  static constexpr std::int32_t kPOSTRequestMode = 4;
  static constexpr std::int32_t kGETRequestMode = 8;
  static constexpr const char* kContainerExtension = "tvxdiag";

  static std::int32_t GETRequestMode() { return kGETRequestMode; }
  // Sessions ask for this mode. Making it return 1 switches POSTs to file uploads.
  static std::int32_t POSTRequestMode() { return kPOSTRequestMode; }

  // "<client name>:<service name>", both lower-cased, an absent one empty.
  static std::string userInfoKey(const Value& userInfo);
  // True when the user info has "_clientName" or "_serviceName".
  static bool isValidUserInfo(const Value& userInfo);

  // The folder of upload container files ("/tmp/tvxstorage" unless
  // $TELVANED_STORAGE_DIR says otherwise).
  static std::string storageRootFolder();
  // A new "<UUID>.tvxdiag" path inside the storage folder.
  static std::string composeUniqueContainerURL();
  // Removes the file, ignoring errors.
  static void deleteContainerAtURL(const std::string& path);
  // Called once at daemon start-up: with the file-upload POST mode, makes sure the
  // storage folder exists and removes the container files an earlier run left there.
  // With any other POST mode it does nothing; that follows from the mode choice.
  static void cleanupStorageRootFolder();
  // The same for a given POST mode.
  static void cleanupStorageRootFolderForMode(std::int32_t postRequestMode);

  virtual ~ReportingSessionConnectivityHelper() = default;

  // Creates the HTTP session (once) and sets the release timeout.
  virtual void activate(std::uint32_t releaseTimeoutSeconds) = 0;
  virtual void setReleaseTimeout(std::uint32_t releaseTimeoutSeconds) = 0;
  // Called by a session that ends while holding the helper: the helper gives the
  // session's IPC transaction back to the agent when it is released itself.
  virtual void incrementTotalSessionsServedCount() = 0;
  // The identifier of the helper's HTTP session for log lines; "inactive" before
  // activation.
  virtual std::string webSessionDescription() const = 0;

  // POST (modes 4 and 1). A helper that is not active, or in another mode, drops the
  // request without calling the completion; callers must not wait for it unbounded.
  // The base helper has no HTTP session and so behaves as one never activated.
  virtual void postURLRequestWithCompletionHandler(HttpRequest request, ConnectivityCompletion completion) {}
  // GET (modes 8 and 2), at once when urgent, else after a random delay. Each distinct
  // URL is fetched once in a helper's lifetime; later requests for it are ignored and
  // their completions never run. The base helper fails the request as inactive.
  virtual void getURLRequestWithCompletionHandler(HttpRequest request, bool isUrgent,
                                                  ConnectivityCompletion completion) {
    if (completion) completion(std::nullopt, std::nullopt, makeTelvaneError(-1, "ConnectivityHelper is not ative"));
  }
};

}  // namespace telvane
