// UploadBackend: uploads whole files that clients hand over, compressed with gzip, to
// the upload server of the storebag profile ("post_url").
//
// A client opens its file itself and passes the descriptor with the path; the backend
// reads the file only through that descriptor, so the daemon never opens a client's
// path. The file goes out as one POST through the session's connectivity helper, with
// the device, the session and the file name in the query:
//     <post_url>?uuid=<udid>&sequence=<session id>
//         &description=Callwave%20AFRC%20log%20(Uploaded%20by%20VTR)
//         &filename=<last path component>.gz&raw=true
// A response body that contains "success" anywhere (so "unsuccessful" too) removes the
// file. The daemon removes it itself when it may; when it may not (the installed
// service runs as a dynamic user that cannot unlink in a user's folder), the upload's
// outcome asks the client to remove it.
//
// Files larger than the maximum upload size (the setting "maxUploadFileSize" of the
// daemon's settings domain, in bytes; default 16 MiB) are refused before they are read,
// so that a client cannot make the daemon hold an unbounded file in memory. The file is
// compressed as it is read: the daemon holds the compressed bytes, not the file.
//
// `uploadFileAtPath` blocks its caller (the session's queue) until the helper answers.
// Answers run on the helper's queue, never on the session pool, so blocked sessions
// cannot starve them. A helper that never answers (inactive, or in another mode) would
// block the session for good; the wait is therefore bounded by
// kUploadAnswerWaitLimit, after which the post counts as failed.
//
// Ownership: owned by its session. Threading: as TelvaneBackendBase; uploadURL_ is
// guarded by settingsMutex_.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "backends/TelvaneBackendBase.h"

namespace telvane {

class UploadBackend : public TelvaneBackendBase {
 public:
  // The settings key of the maximum upload size, and its default (16 MiB).
  static constexpr const char* kMaxUploadFileSizeDefaultsKey = "maxUploadFileSize";
  static constexpr std::int64_t kDefaultMaxUploadFileSize = 16 * 1024 * 1024;
  // How long an upload waits for the connectivity helper's answer at most.
  static constexpr std::chrono::seconds kUploadAnswerWaitLimit{600};
  // The description every upload carries (before "(Uploaded by VTR)").
  static constexpr const char* kUploadDescription = "Callwave AFRC log";

  // initWithName:profile:productFamily:. Nothing (and an error line) when the profile
  // has no "post_url" text.
  static std::shared_ptr<UploadBackend> create(const std::string& name, const Value& profile,
                                               const std::optional<std::string>& productFamily,
                                               const BackendPlatform& platform = {});

  BackendKind kind() const override { return BackendKind::Upload; }

  // Compresses and posts the file behind the token's descriptor. False only for a
  // missing upload URL, a file that is not a regular one, an empty, unreadable,
  // changing or too large file, a failed compression or a URL that cannot be made;
  // once posted the answer is true whatever the server said.
  bool uploadFileAtPath(const std::string& path, FileAccessToken& token) override;

  std::optional<std::string> uploadURL() const;
  void setUploadURL(std::optional<std::string> url);
  std::int64_t maxUploadFileSize() const { return maxUploadFileSize_; }

  // The text with every byte outside the characters a URL query allows written as
  // %XX (upper-case hex): letters, digits and "!$&'()*+,-./:;=?@_~" stay.
  static std::string percentEncodeForQuery(std::string_view text);
  // The whole upload URL for the base URL, device identifier, session and file path.
  static std::string composeUploadURL(const std::string& uploadURL, const std::string& udid, std::uint32_t sessionID,
                                      const std::string& path);

 private:
  UploadBackend(std::string name, Value profile, std::optional<std::string> productFamily, BackendPlatform platform);

  enum class ReadOutcome { Compressed, Empty, Refused };
  // Reads the whole file through the descriptor and compresses it as it is read, so
  // that only the compressed bytes are held. Empty for a file with nothing to read
  // (also one that could not be read); Refused (logged) when the file is too large or
  // changed its size while it was read, or compression failed.
  ReadOutcome readAndCompress(const std::string& path, int descriptor, std::int64_t expectedSize,
                              std::string& compressed) const;
  // Posts the request and waits for the answer; on a "success" body removes the file.
  void postAndRemoveOnSuccess(ReportingSessionConnectivityHelper& helper, HttpRequest request,
                              const std::string& path, FileAccessToken& token) const;

  std::int64_t maxUploadFileSize_ = kDefaultMaxUploadFileSize;
  // Guarded by settingsMutex_.
  std::optional<std::string> uploadURL_;
};

}  // namespace telvane
