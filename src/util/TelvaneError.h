// TelvaneError: the error value of the system, handed to clients and completions.
//
// Every error is in the domain "TelvaneErrorDomain" with an integer code (-1 for the
// daemon's own refusals, the HTTP status for a server's refusal, small positive codes
// in the client library) and the message text as its description. A plain value;
// copy it freely between threads.
#pragma once

#include <string>
#include <utility>

namespace telvane {

inline constexpr const char* kTelvaneErrorDomain = "TelvaneErrorDomain";

struct TelvaneError {
  std::string domain;
  long code = 0;
  std::string description;

  bool operator==(const TelvaneError&) const = default;
};

// An error in the domain "TelvaneErrorDomain" with the given code and text.
inline TelvaneError makeTelvaneError(long code, std::string description) {
  return TelvaneError{kTelvaneErrorDomain, code, std::move(description)};
}

}  // namespace telvane
