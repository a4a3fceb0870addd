// The helper's requests: POST (plain or through a container file), GET with its
// per-URL suppression and delayed pull, and the HTTP session's callbacks.
#include <algorithm>
#include <cstdio>
#include <fstream>

#include "connectivity/ReportingSessionConnectivityHelperImpl.h"
#include "platform/Log.h"

namespace telvane {
namespace {

// One lock for the GET suppression of all helpers.
std::mutex gGetRequestLock;

std::string describe(const std::optional<TelvaneError>& error) {
  if (!error) return "(null)";
  return "Error Domain=" + error->domain + " Code=" + std::to_string(error->code) + " \"" + error->description + "\"";
}

std::string describe(const std::optional<HttpResponse>& response) {
  if (!response) return "(null)";
  return "{ Status Code: " + std::to_string(response->statusCode) + " }";
}

std::uint64_t monotonicNowNs() {
  return static_cast<std::uint64_t>(
      std::chrono::duration_cast<std::chrono::nanoseconds>(std::chrono::steady_clock::now().time_since_epoch())
          .count());
}

}  // namespace

// ---- POST ----

void ReportingSessionConnectivityHelperImpl::postURLRequestWithCompletionHandler(HttpRequest request,
                                                                                  ConnectivityCompletion completion) {
  stateQueue_->async([self = shared_from_this(), request = std::move(request),
                      completion = std::move(completion)]() mutable {
    self->postOnQueue(std::move(request), std::move(completion));
  });
}

void ReportingSessionConnectivityHelperImpl::postOnQueue(HttpRequest request, ConnectivityCompletion completion) {
  assertOnQueue(stateQueue_);
  if (!isActive_) return;
  if (mode_ == kPOSTRequestMode) {
    if (!startRegisteredTask(std::move(request), std::move(completion))) {
      log::error("postURLRequestWithCompletionHandler: underlying WebSession has been invalidated with error %s. "
                 "Ignoring POST request.",
                 HttpSession::kInvalidatedError);
    }
    return;
  }
  if (mode_ == kFileUploadRequestMode) {
    const std::string container = composeUniqueContainerURL();
    {
      std::ofstream file(container, std::ios::binary | std::ios::trunc);
      if (!file) return;
      file.write(request.body.data(), static_cast<std::streamsize>(request.body.size()));
      if (!file) {
        file.close();
        deleteContainerAtURL(container);
        return;
      }
    }
    HttpRequest upload = std::move(request);
    upload.body.clear();
    upload.uploadFilePath = container;
    if (!startRegisteredTask(std::move(upload), std::move(completion))) {
      log::error("postURLRequestWithCompletionHandler: underlying WebSession has been invalidated with error %s. "
                 "Ignoring POST request.",
                 HttpSession::kInvalidatedError);
    }
    // The running upload has the file open already.
    deleteContainerAtURL(container);
    return;
  }
  log::error("postURLRequestWithCompletionHandler: wrong mode for POST operation detected %d", mode_);
}

bool ReportingSessionConnectivityHelperImpl::startRegisteredTask(HttpRequest request,
                                                                 ConnectivityCompletion completion) {
  assertOnQueue(stateQueue_);
  if (!privateURLSession_ || privateURLSession_->isInvalidated()) return false;
  const std::string taskDescription = createHelperForTask(std::move(completion));
  // Only this queue invalidates the session, so it cannot refuse the request now.
  privateURLSession_->startTask(std::move(request), callbacksForTask(taskDescription));
  return true;
}

// ---- GET ----

void ReportingSessionConnectivityHelperImpl::getURLRequestWithCompletionHandler(HttpRequest request, bool isUrgent,
                                                                                 ConnectivityCompletion completion) {
  if (mode_ != kGETRequestMode && mode_ != kBackgroundGETRequestMode) {
    log::error("getURLRequestWithCompletionHandler: wrong mode for GET operation detected %d", mode_);
    if (completion) {
      completion(std::nullopt, std::nullopt,
                 makeTelvaneError(mode_, "getURLRequestWithCompletionHandler: unrecognized mode"));
    }
    return;
  }
  const std::string key = request.url;
  std::lock_guard<std::mutex> lock(gGetRequestLock);
  // An entry is never removed (a finished pull only sets it to false): each distinct
  // URL is fetched once in a helper's lifetime. Intended.
  if (requestInProgress_.count(key)) {
    log::info("getURLRequestWithCompletionHandler: ignored duplicate request for storebag '%s'", key);
    return;
  }
  requestInProgress_[key] = true;
  if (isUrgent) {
    log::info("getURLRequestWithCompletionHandler: storebag immediate pull for '%s' has been initiated", key);
    stateQueue_->async([self = shared_from_this(), request = std::move(request), key,
                        completion = std::move(completion)]() mutable {
      self->pullOnQueue(std::move(request), key, std::move(completion));
    });
    return;
  }
  const std::uint32_t delaySeconds = random_->uniform(std::max<std::uint32_t>(1, options_.pullDelayRangeSeconds));
  const std::uint64_t now = monotonicNowNs();
  const std::uint64_t scheduled =
      now + static_cast<std::uint64_t>(
                std::chrono::duration_cast<std::chrono::nanoseconds>(helperSeconds(delaySeconds)).count());
  log::info("getURLRequestWithCompletionHandler: storebag delayed pull for '%s' delayed by %d seconds has been "
            "initiated. Time now %llu, scheduled time to pull %llu",
            key, delaySeconds, static_cast<unsigned long long>(now), static_cast<unsigned long long>(scheduled));
  std::weak_ptr<ReportingSessionConnectivityHelperImpl> weak = weak_from_this();
  stateQueue_->after(helperSeconds(delaySeconds), [weak, request = std::move(request), key,
                                                   completion = std::move(completion)]() mutable {
    if (auto self = weak.lock()) self->pullOnQueue(std::move(request), key, std::move(completion));
  });
}

void ReportingSessionConnectivityHelperImpl::setRequestInProgress(const std::string& key, bool inProgress) {
  std::lock_guard<std::mutex> lock(gGetRequestLock);
  requestInProgress_[key] = inProgress;
}

void ReportingSessionConnectivityHelperImpl::pullOnQueue(HttpRequest request, const std::string& key,
                                                         ConnectivityCompletion completion) {
  assertOnQueue(stateQueue_);
  if (!isActive_) {
    if (completion) completion(std::nullopt, std::nullopt, makeTelvaneError(-1, "ConnectivityHelper is not ative"));
    setRequestInProgress(key, false);
    log::info("getURLRequestWithCompletionHandler: new storebag pull for '%s' has been cancelled as WebSession is not "
              "active",
              key);
    return;
  }
  std::weak_ptr<ReportingSessionConnectivityHelperImpl> weak = weak_from_this();
  auto wrapping = [weak, key, completion](std::optional<std::string> data, std::optional<HttpResponse> response,
                                          std::optional<TelvaneError> error) {
    const std::string errorText = describe(error);
    if (completion) completion(std::move(data), std::move(response), std::move(error));
    if (auto self = weak.lock()) self->setRequestInProgress(key, false);
    log::info("getURLRequestWithCompletionHandler: new storebag pull for '%s' has been completed with error %s", key,
              errorText);
  };
  if (!startRegisteredTask(std::move(request), wrapping)) {
    log::error("getURLRequestWithCompletionHandler: underlying WebSession has been invalidated with error %s. "
               "Ignoring GET request.",
               HttpSession::kInvalidatedError);
    if (completion) {
      completion(std::nullopt, std::nullopt,
                 makeTelvaneError(-1, "getURLRequestWithCompletionHandler: unable to create data task"));
    }
    setRequestInProgress(key, false);
    log::info("getURLRequestWithCompletionHandler: new storebag pull for '%s' has been cancelled as WebSession data "
              "task creation has failed",
              key);
  }
}

// ---- HTTP session callbacks ----

HttpTaskCallbacks ReportingSessionConnectivityHelperImpl::callbacksForTask(const std::string& taskDescription) {
  std::weak_ptr<ReportingSessionConnectivityHelperImpl> weak = weak_from_this();
  HttpTaskCallbacks callbacks;
  // Response head and upload progress only log, on the delegate queue.
  callbacks.didReceiveResponse = [weak, taskDescription](const HttpResponse&) {
    if (auto self = weak.lock()) {
      log::info("didReceiveResponse: for <session>:<task> <%s>:<%s>", self->webSessionDescription(), taskDescription);
    }
  };
  callbacks.didSendBodyData = [weak, taskDescription](std::int64_t sent, std::int64_t total) {
    if (auto self = weak.lock()) {
      log::info("didSendBodyData: for <session>:<task> <%s>:<%s>: Sent %lld out of %lld", self->webSessionDescription(),
                taskDescription, static_cast<long long>(sent), static_cast<long long>(total));
    }
  };
  callbacks.didReceiveData = [weak, taskDescription](const std::string& chunk) {
    auto self = weak.lock();
    if (!self) return;
    self->stateQueue_->async([self, taskDescription, chunk] {
      log::info("didReceiveData: received %d bytes for <session>:<task> <%s>:<%s>", static_cast<int>(chunk.size()),
                self->webSessionDescription(), taskDescription);
      auto task = self->tasks_.find(taskDescription);
      if (task != self->tasks_.end()) task->second->appendReceivedData(chunk);
    });
  };
  callbacks.didComplete = [weak, taskDescription](HttpResponse response) {
    auto self = weak.lock();
    if (!self) return;
    self->stateQueue_->async([self, taskDescription, response = std::move(response)]() mutable {
      self->didCompleteTask(taskDescription, std::move(response));
    });
  };
  return callbacks;
}

void ReportingSessionConnectivityHelperImpl::didCompleteTask(const std::string& taskDescription,
                                                             HttpResponse response) {
  assertOnQueue(stateQueue_);
  std::optional<HttpResponse> head;
  if (response.statusCode != 0) {
    head = std::move(response);
    head->body.clear();  // the bytes are the task's received data
  }
  std::optional<TelvaneError> error;
  const std::string failure = head ? head->error : response.error;
  if (!failure.empty()) error = TelvaneError{"TelvaneHTTPErrorDomain", -1, failure};
  log::info("didCompleteWithError: for <session>:<task> <%s>:<%s> with response %s, error %s", webSessionDescription(),
            taskDescription, describe(head), describe(error));
  auto it = tasks_.find(taskDescription);
  if (it == tasks_.end()) return;
  auto task = it->second;
  if (task->completionHandler()) {
    std::optional<std::string> data;
    if (!error || !task->receivedData().empty()) data = task->receivedData();
    task->completionHandler()(std::move(data), std::move(head), std::move(error));
  }
  tasks_.erase(taskDescription);
}

}  // namespace telvane
