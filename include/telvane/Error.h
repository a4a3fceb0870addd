// telvane::Error: the error value a reporting client receives from the client library
// and from the daemon's replies. A plain value; copy it freely between threads.
//
// Errors of the library are in the domain "TelvaneErrorDomain" with these codes:
// 2 session information missing, 3 component type invalid, 4 category 0, 8 the daemon
// refused the session (the description is the daemon's reason). An event map without
// its category or type gives code 7 with the missing-parameter text itself as the
// domain; clients have long relied on that shape, so it stays. The daemon's own refusals
// of a request carry code -1, a server's refusal its HTTP status.
#pragma once

#include <string>
#include <utility>

#include "telvane/Value.h"

namespace telvane {

struct Error {
  static constexpr const char* kDomain = "TelvaneErrorDomain";

  static constexpr long kCodeSessionInfoMissing = 2;
  static constexpr long kCodeComponentTypeInvalid = 3;
  static constexpr long kCodeCategoryZero = 4;
  static constexpr long kCodeMissingParameter = 7;
  static constexpr long kCodeRefusedByDaemon = 8;

  std::string domain;
  long code = 0;
  // The message text (the localised description).
  std::string description;
  // Further details, a dictionary or null.
  Value userInfo;

  bool operator==(const Error&) const = default;
};

}  // namespace telvane
