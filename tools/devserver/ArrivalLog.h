// ArrivalLog: where the development server reports what arrived. Each arrival is one
// readable line on standard output (prefixed with the local time of day) and, when an
// events file is given, one JSON object on one line of that file, appended and
// flushed at once so that scripts and tests can follow the file while the server
// runs.
//
// Threading: thread-safe; the HTTPS workers and the UDP reader report concurrently,
// and a mutex keeps each line whole and both outputs in the same order.
#pragma once

#include <cstdio>
#include <memory>
#include <mutex>
#include <string>

#include "platform/Result.h"
#include "telvane/Value.h"

namespace telvane::devserver {

class ArrivalLog {
 public:
  // `eventsFile` empty: no JSON output. `quiet`: no readable lines.
  static Result<std::unique_ptr<ArrivalLog>> open(const std::string& eventsFile, bool quiet);
  ~ArrivalLog();
  ArrivalLog(const ArrivalLog&) = delete;
  ArrivalLog& operator=(const ArrivalLog&) = delete;

  // `line` is the readable text; `record` a dictionary, written with a "time" key
  // (seconds since 1970) added.
  void report(const std::string& line, Value record);

 private:
  ArrivalLog(std::FILE* events, bool quiet) : events_(events), quiet_(quiet) {}

  std::mutex mutex_;
  std::FILE* events_;  // guarded by mutex_; null without an events file
  const bool quiet_;
};

// A value's text for a readable line: strings as they are, other values as their
// one-line description, "-" for null.
std::string readableText(const Value& value);

}  // namespace telvane::devserver
