#include "devserver/StorebagResponder.h"

#include <sys/stat.h>

#include <algorithm>
#include <cctype>
#include <cstring>
#include <fstream>
#include <iterator>

#include "platform/Json.h"
#include "platform/PropertyList.h"

namespace telvane::devserver {

namespace {

// Storebag names are lower-case words; anything that could leave the folder is refused.
bool isPlainName(const std::string& name) {
  if (name.empty() || name.size() > 128) return false;
  return std::all_of(name.begin(), name.end(), [](char c) {
    unsigned char u = static_cast<unsigned char>(c);
    return std::isalnum(u) || c == '_' || c == '-';
  });
}

std::optional<Bytes> readFile(const std::string& path) {
  std::ifstream in(path, std::ios::binary);
  if (!in) return std::nullopt;
  Bytes bytes((std::istreambuf_iterator<char>(in)), std::istreambuf_iterator<char>());
  if (in.bad()) return std::nullopt;
  return bytes;
}

void replaceAll(std::string& text, const std::string& from, const std::string& to) {
  for (std::size_t at = text.find(from); at != std::string::npos; at = text.find(from, at + to.size())) {
    text.replace(at, from.size(), to);
  }
}

}  // namespace

std::string httpDate(std::time_t time) {
  // Fixed English names: the C library's would follow the locale.
  static const char* const kDays[] = {"Sun", "Mon", "Tue", "Wed", "Thu", "Fri", "Sat"};
  static const char* const kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                        "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
  std::tm utc{};
  gmtime_r(&time, &utc);
  char text[64];
  std::snprintf(text, sizeof text, "%s, %02d %s %04d %02d:%02d:%02d GMT", kDays[utc.tm_wday], utc.tm_mday,
                kMonths[utc.tm_mon], utc.tm_year + 1900, utc.tm_hour, utc.tm_min, utc.tm_sec);
  return text;
}

std::optional<std::time_t> parseHttpDate(const std::string& text) {
  static const char* const kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                                        "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};
  char weekday[4] = {}, month[4] = {}, zone[4] = {};
  int day = 0, year = 0, hour = 0, minute = 0, second = 0;
  if (std::sscanf(text.c_str(), "%3s, %d %3s %d %d:%d:%d %3s", weekday, &day, month, &year, &hour, &minute, &second,
                  zone) != 8 ||
      std::strcmp(zone, "GMT") != 0) {
    return std::nullopt;
  }
  int monthIndex = -1;
  for (int i = 0; i < 12; ++i) {
    if (std::strcmp(month, kMonths[i]) == 0) monthIndex = i;
  }
  if (monthIndex < 0 || day < 1 || day > 31 || hour > 23 || minute > 59 || second > 60 || year < 1970) {
    return std::nullopt;
  }
  std::tm utc{};
  utc.tm_year = year - 1900;
  utc.tm_mon = monthIndex;
  utc.tm_mday = day;
  utc.tm_hour = hour;
  utc.tm_min = minute;
  utc.tm_sec = second;
  return timegm(&utc);
}

Result<Value> decodeDocument(const Bytes& bytes) {
  std::string_view text(reinterpret_cast<const char*>(bytes.data()), bytes.size());
  std::size_t start = text.find_first_not_of(" \t\r\n");
  std::string_view trimmed = start == std::string_view::npos ? std::string_view() : text.substr(start);
  if (text.rfind("bplist", 0) == 0 || trimmed.rfind("<", 0) == 0) return plist::decode(bytes);
  return json::parse(text);
}

StorebagResponder::StorebagResponder(std::string folder, StorebagSigner signer, Placeholders placeholders,
                                     std::time_t startTime, std::int64_t maxAgeSeconds)
    : folder_(std::move(folder)),
      signer_(std::move(signer)),
      placeholders_(std::move(placeholders)),
      startTime_(startTime),
      maxAgeSeconds_(maxAgeSeconds) {}

Value StorebagResponder::fillPlaceholders(const Value& value) const {
  if (const std::string* text = value.asString()) {
    if (*text == kPlaceholderUdpPort) return Value(static_cast<unsigned>(placeholders_.udpPort));
    if (text->find("${") == std::string::npos) return value;
    std::string filled = *text;
    replaceAll(filled, kPlaceholderUrl, placeholders_.url);
    replaceAll(filled, kPlaceholderHost, placeholders_.host);
    replaceAll(filled, kPlaceholderUdpPort, std::to_string(placeholders_.udpPort));
    return Value(std::move(filled));
  }
  if (const Array* elements = value.asArray()) {
    Array filled;
    filled.reserve(elements->size());
    for (const Value& element : *elements) filled.push_back(fillPlaceholders(element));
    return Value(std::move(filled));
  }
  if (const Dictionary* entries = value.asDictionary()) {
    Dictionary filled;
    for (const auto& [key, entry] : *entries) filled.set(key, fillPlaceholders(entry));
    return Value(std::move(filled));
  }
  return value;
}

StorebagAnswer StorebagResponder::answer(const std::string& name,
                                         const std::optional<std::string>& ifModifiedSince) const {
  StorebagAnswer answer;
  answer.headers.emplace_back("Cache-Control", "max-age=" + std::to_string(maxAgeSeconds_));
  if (!isPlainName(name)) {
    answer.status = 404;
    answer.problem = "not a storebag name";
    return answer;
  }
  struct stat info {};
  for (const char* extension : {".json", ".plist", ""}) {
    std::string candidate = folder_ + "/" + name + extension;
    if (::stat(candidate.c_str(), &info) == 0 && S_ISREG(info.st_mode)) {
      answer.file = candidate;
      break;
    }
  }
  if (answer.file.empty()) {
    answer.status = 404;
    answer.problem = "no document " + name + ".json, " + name + ".plist or " + name + " in " + folder_;
    return answer;
  }

  const std::time_t lastModified = std::max<std::time_t>(info.st_mtim.tv_sec, startTime_);
  answer.headers.emplace_back("Last-Modified", httpDate(lastModified));
  if (ifModifiedSince) {
    std::optional<std::time_t> since = parseHttpDate(*ifModifiedSince);
    if (since && *since >= lastModified) {
      answer.status = 304;
      return answer;
    }
  }

  std::optional<Bytes> bytes = readFile(answer.file);
  if (!bytes) {
    answer.status = 500;
    answer.problem = "cannot read " + answer.file;
    return answer;
  }
  Result<Value> document = decodeDocument(*bytes);
  if (!document || !document->isDictionary()) {
    answer.status = 500;
    answer.problem =
        answer.file + ": " + (document ? std::string("the document is not a dictionary") : document.error());
    return answer;
  }
  Value filled = fillPlaceholders(*document);
  answer.version = filled["version"].stringOrEmpty();
  Result<Bytes> envelope = signer_.makeEnvelopeForDocument(filled);
  if (!envelope) {
    answer.status = 500;
    answer.problem = answer.file + ": " + envelope.error();
    return answer;
  }
  answer.status = 200;
  answer.body = std::move(envelope).value();
  return answer;
}

}  // namespace telvane::devserver
