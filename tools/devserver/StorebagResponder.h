// StorebagResponder: answers the daemon's storebag requests from a folder of
// documents. The document of a storebag name is the file NAME.json, NAME.plist or NAME
// (the first that exists): a property list (XML or binary) or JSON, told apart by its
// content. On every request it is read afresh, the server's placeholders in its
// string values are filled in, and it is signed into an envelope, so that an edited
// document is served at once with a new Last-Modified.
//
// Conditional requests: Last-Modified is the later of the document file's
// modification time and the server's start (an envelope made by this run carries this
// run's ports and key, so it must not count as older than the run); an
// If-Modified-Since at or after that time answers 304 without a body. Every answer
// carries "Cache-Control: max-age=N".
//
// Threading: immutable after construction; answer() may run on any thread at once.
#pragma once

#include <cstdint>
#include <ctime>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "storebag/StorebagSigner.h"
#include "telvane/Value.h"

namespace telvane::devserver {

// The texts a document may carry, and what replaces them.
inline constexpr const char* kPlaceholderUrl = "${DEVSERVER_URL}";
inline constexpr const char* kPlaceholderHost = "${DEVSERVER_HOST}";
inline constexpr const char* kPlaceholderUdpPort = "${DEVSERVER_UDP_PORT}";

struct Placeholders {
  std::string url;   // "https://127.0.0.1:PORT"
  std::string host;  // "127.0.0.1"
  std::uint16_t udpPort = 0;
};

struct StorebagAnswer {
  int status = 404;
  Bytes body;
  // Response headers, in order.
  std::vector<std::pair<std::string, std::string>> headers;
  // The document file and its "version", when found.
  std::string file;
  std::string version;
  // Why the answer is not 200 or 304 (for the arrival line).
  std::string problem;
};

class StorebagResponder {
 public:
  StorebagResponder(std::string folder, StorebagSigner signer, Placeholders placeholders, std::time_t startTime,
                    std::int64_t maxAgeSeconds);

  // The answer for the storebag name; `ifModifiedSince` is the request header, if any.
  StorebagAnswer answer(const std::string& name, const std::optional<std::string>& ifModifiedSince) const;

  // The document with the placeholders filled in (exposed for the start-up check).
  Value fillPlaceholders(const Value& value) const;

 private:
  const std::string folder_;
  const StorebagSigner signer_;
  const Placeholders placeholders_;
  const std::time_t startTime_;
  const std::int64_t maxAgeSeconds_;
};

// "Sun, 06 Nov 1994 08:49:37 GMT".
std::string httpDate(std::time_t time);
// The time of an HTTP date in that form; nothing when it does not parse.
std::optional<std::time_t> parseHttpDate(const std::string& text);

// A property list when the bytes look like one (binary, or text starting with "<"),
// else JSON.
Result<Value> decodeDocument(const Bytes& bytes);

}  // namespace telvane::devserver
