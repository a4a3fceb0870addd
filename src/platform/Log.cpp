#include "platform/Log.h"

#include <sys/syscall.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <string>

namespace telvane::log {

namespace {

Level levelFromEnvironment() {
  const char* v = std::getenv("TELVANE_LOG_LEVEL");
  if (!v) return Level::Info;
  if (std::strcmp(v, "debug") == 0) return Level::Debug;
  if (std::strcmp(v, "error") == 0) return Level::Error;
  return Level::Info;
}

const char* levelName(Level level) {
  switch (level) {
    case Level::Debug: return "debug";
    case Level::Info: return "info";
    case Level::Error: return "error";
  }
  return "info";
}

struct State {
  std::mutex mutex;
  Output output = nullptr;             // guarded by mutex; null: standard error
  std::vector<LogCapture*> captures;  // guarded by mutex
};

State& state() {
  static State* s = new State();  // never destroyed: logging may happen during exit
  return *s;
}

std::atomic<int> gLevel{static_cast<int>(levelFromEnvironment())};
std::atomic<int> gCaptureCount{0};

}  // namespace

void writeStandardError(Level level, const std::string& line) {
  using namespace std::chrono;
  const auto now = system_clock::now();
  const std::time_t seconds = system_clock::to_time_t(now);
  const auto millis = duration_cast<milliseconds>(now.time_since_epoch()).count() % 1000;
  std::tm local{};
  ::localtime_r(&seconds, &local);
  char stamp[32];
  std::strftime(stamp, sizeof stamp, "%Y-%m-%d %H:%M:%S", &local);
  static const long pid = static_cast<long>(::getpid());
  const long tid = static_cast<long>(::syscall(SYS_gettid));
  // One write per line, so that lines of several threads never interleave.
  std::string out = fmt::format("{}.{:03d} [{}:{}] <{}> {}\n", stamp, static_cast<int>(millis), pid, tid,
                                levelName(level), line);
  std::fwrite(out.data(), 1, out.size(), stderr);
}

bool enabled(Level level) {
  return static_cast<int>(level) >= gLevel.load(std::memory_order_relaxed) ||
         gCaptureCount.load(std::memory_order_relaxed) > 0;
}

void write(Level level, std::string line) {
  // A line is one line: embedded line breaks would split it in the journal.
  std::replace(line.begin(), line.end(), '\n', ' ');
  State& s = state();
  Output output;
  {
    std::lock_guard<std::mutex> lock(s.mutex);
    for (auto* capture : s.captures) capture->append(level, line);
    output = s.output;
  }
  if (static_cast<int>(level) < gLevel.load(std::memory_order_relaxed)) return;
  if (output) {
    output(level, line);
  } else {
    writeStandardError(level, line);
  }
}

void setLevel(Level level) { gLevel.store(static_cast<int>(level)); }

void setOutput(Output output) {
  State& s = state();
  std::lock_guard<std::mutex> lock(s.mutex);
  s.output = output;
}

void useStandardError() { setOutput(nullptr); }

LogCapture::LogCapture() {
  State& s = state();
  std::lock_guard<std::mutex> lock(s.mutex);
  s.captures.push_back(this);
  gCaptureCount.fetch_add(1);
}

LogCapture::~LogCapture() {
  State& s = state();
  std::lock_guard<std::mutex> lock(s.mutex);
  s.captures.erase(std::remove(s.captures.begin(), s.captures.end(), this), s.captures.end());
  gCaptureCount.fetch_sub(1);
}

void LogCapture::append(Level level, const std::string& text) {
  std::lock_guard<std::mutex> lock(mutex_);
  lines_.push_back({level, text});
}

std::vector<CapturedLine> LogCapture::lines() const {
  std::lock_guard<std::mutex> lock(mutex_);
  return lines_;
}

std::vector<std::string> LogCapture::texts() const {
  std::lock_guard<std::mutex> lock(mutex_);
  std::vector<std::string> out;
  for (const auto& l : lines_) out.push_back(l.text);
  return out;
}

bool LogCapture::contains(std::string_view text) const { return count(text) > 0; }

bool LogCapture::contains(Level level, std::string_view text) const {
  std::lock_guard<std::mutex> lock(mutex_);
  return std::any_of(lines_.begin(), lines_.end(),
                     [&](const CapturedLine& l) { return l.level == level && l.text == text; });
}

bool LogCapture::containsPrefix(std::string_view prefix) const {
  std::lock_guard<std::mutex> lock(mutex_);
  return std::any_of(lines_.begin(), lines_.end(),
                     [&](const CapturedLine& l) { return l.text.compare(0, prefix.size(), prefix) == 0; });
}

std::size_t LogCapture::count(std::string_view text) const {
  std::lock_guard<std::mutex> lock(mutex_);
  return static_cast<std::size_t>(
      std::count_if(lines_.begin(), lines_.end(), [&](const CapturedLine& l) { return l.text == text; }));
}

void LogCapture::clear() {
  std::lock_guard<std::mutex> lock(mutex_);
  lines_.clear();
}

}  // namespace telvane::log
