// FakeConnectivityHelper: records what a session asks of its shared helper, and the
// POST requests that backends hand it, which the test answers (or leaves unanswered,
// as an inactive helper would).
#pragma once

#include <cstddef>
#include <functional>
#include <mutex>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "connectivity/ReportingSessionConnectivityHelper.h"

namespace telvane::test {

class FakeConnectivityHelper : public ReportingSessionConnectivityHelper {
 public:
  void activate(std::uint32_t releaseTimeoutSeconds) override {
    std::lock_guard<std::mutex> lock(mutex_);
    activations_.push_back(releaseTimeoutSeconds);
  }
  void setReleaseTimeout(std::uint32_t releaseTimeoutSeconds) override {
    std::lock_guard<std::mutex> lock(mutex_);
    releaseTimeouts_.push_back(releaseTimeoutSeconds);
  }
  void incrementTotalSessionsServedCount() override {
    std::lock_guard<std::mutex> lock(mutex_);
    ++totalSessionsServed_;
  }
  std::string webSessionDescription() const override { return "inactive"; }
  void postURLRequestWithCompletionHandler(HttpRequest request, ConnectivityCompletion completion) override {
    std::lock_guard<std::mutex> lock(mutex_);
    posts_.push_back(Post{std::move(request), std::move(completion)});
  }

  // ---- POST requests ----
  std::size_t postCount() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return posts_.size();
  }
  std::vector<HttpRequest> postedRequests() const {
    std::lock_guard<std::mutex> lock(mutex_);
    std::vector<HttpRequest> requests;
    for (const Post& post : posts_) requests.push_back(post.request);
    return requests;
  }
  HttpRequest postedRequest(std::size_t index) const {
    std::lock_guard<std::mutex> lock(mutex_);
    return posts_.at(index).request;
  }
  // Completes the index-th POST with a response of the given status (0: no response)
  // and the error, on the calling thread. Each POST is completed at most once.
  void answerPost(std::size_t index, long status, std::optional<TelvaneError> error = std::nullopt) {
    answerPostWithData(index, status, std::string(), std::move(error));
  }
  // The same with the received bytes (none: no data at all).
  void answerPostWithData(std::size_t index, long status, std::optional<std::string> data,
                          std::optional<TelvaneError> error = std::nullopt) {
    ConnectivityCompletion completion;
    {
      std::lock_guard<std::mutex> lock(mutex_);
      completion = std::move(posts_.at(index).completion);
      posts_.at(index).completion = nullptr;
    }
    if (!completion) return;
    std::optional<HttpResponse> response;
    if (status != 0) {
      response.emplace();
      response->statusCode = status;
    }
    completion(std::move(data), std::move(response), std::move(error));
  }

  std::vector<std::uint32_t> activations() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return activations_;
  }
  std::vector<std::uint32_t> releaseTimeouts() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return releaseTimeouts_;
  }
  int totalSessionsServed() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return totalSessionsServed_;
  }

 private:
  mutable std::mutex mutex_;
  std::vector<std::uint32_t> activations_;
  std::vector<std::uint32_t> releaseTimeouts_;
  int totalSessionsServed_ = 0;
  struct Post {
    HttpRequest request;
    ConnectivityCompletion completion;
  };
  std::vector<Post> posts_;
};

}  // namespace telvane::test
