#include "devserver/ArrivalLog.h"

#include <cerrno>
#include <cmath>
#include <chrono>
#include <cstring>
#include <ctime>

#include "platform/Json.h"

namespace telvane::devserver {

namespace {

// "HH:MM:SS.mmm" of the local time now.
std::string timeOfDay(std::chrono::system_clock::time_point now) {
  std::time_t seconds = std::chrono::system_clock::to_time_t(now);
  std::tm local{};
  localtime_r(&seconds, &local);
  auto milliseconds =
      std::chrono::duration_cast<std::chrono::milliseconds>(now.time_since_epoch()).count() % 1000;
  char text[32];
  std::snprintf(text, sizeof text, "%02d:%02d:%02d.%03d", local.tm_hour, local.tm_min, local.tm_sec,
                static_cast<int>(milliseconds));
  return text;
}

// The value with every string that is not UTF-8 written with "\xNN" escapes for its
// bytes above 0x7F, and every infinite or not-a-number double as null: what a
// client sent must still reach the events file, readable.
Value representable(const Value& value) {
  if (const std::string* text = value.asString()) {
    if (json::isValidUtf8(*text)) return value;
    std::string escaped;
    for (unsigned char c : *text) {
      if (c < 0x80) {
        escaped += static_cast<char>(c);
      } else {
        char hex[8];
        std::snprintf(hex, sizeof hex, "\\x%02x", c);
        escaped += hex;
      }
    }
    return Value(std::move(escaped));
  }
  if (value.isDouble() && !std::isfinite(value.doubleValue())) return Value();
  if (const Array* elements = value.asArray()) {
    Array out;
    for (const Value& element : *elements) out.push_back(representable(element));
    return Value(std::move(out));
  }
  if (const Dictionary* entries = value.asDictionary()) {
    Dictionary out;
    for (const auto& [key, entry] : *entries) {
      out.set(json::isValidUtf8(key) ? key : representable(Value(key)).stringOrEmpty(), representable(entry));
    }
    return Value(std::move(out));
  }
  return value;
}

}  // namespace

Result<std::unique_ptr<ArrivalLog>> ArrivalLog::open(const std::string& eventsFile, bool quiet) {
  std::FILE* events = nullptr;
  if (!eventsFile.empty()) {
    events = std::fopen(eventsFile.c_str(), "a");
    if (!events) {
      return Result<std::unique_ptr<ArrivalLog>>::failure("could not open " + eventsFile + ": " + std::strerror(errno));
    }
  }
  return Result<std::unique_ptr<ArrivalLog>>::success(std::unique_ptr<ArrivalLog>(new ArrivalLog(events, quiet)));
}

ArrivalLog::~ArrivalLog() {
  if (events_) std::fclose(events_);
}

void ArrivalLog::report(const std::string& line, Value record) {
  auto now = std::chrono::system_clock::now();
  if (Dictionary* fields = record.asDictionary()) {
    fields->set("time", Value(std::chrono::duration<double>(now.time_since_epoch()).count()));
  }
  Result<std::string> encoded = json::write(record);
  if (!encoded) encoded = json::write(representable(record));
  std::lock_guard<std::mutex> lock(mutex_);
  if (!quiet_) {
    std::printf("%s %s\n", timeOfDay(now).c_str(), line.c_str());
    std::fflush(stdout);
  }
  if (events_) {
    if (encoded) {
      std::fprintf(events_, "%s\n", encoded->c_str());
    } else {
      std::fprintf(stderr, "telvane-devserver: an arrival cannot be written as JSON: %s\n", encoded.error().c_str());
    }
    std::fflush(events_);
  }
}

std::string readableText(const Value& value) {
  if (value.isNull()) return "-";
  if (const std::string* text = value.asString()) return *text;
  return value.description();
}

}  // namespace telvane::devserver
