#include "platform/Log.h"

#include <spdlog/sinks/stdout_sinks.h>
#include <spdlog/sinks/systemd_sink.h>
#include <spdlog/spdlog.h>

#include <algorithm>
#include <atomic>
#include <cstdlib>
#include <cstring>
#include <string>

#include <unistd.h>

namespace telvane::log {

namespace {

Level levelFromEnvironment() {
  const char* v = std::getenv("TELVANE_LOG_LEVEL");
  if (!v) return Level::Info;
  if (std::strcmp(v, "debug") == 0) return Level::Debug;
  if (std::strcmp(v, "error") == 0) return Level::Error;
  return Level::Info;
}

std::shared_ptr<spdlog::logger> makeLogger(bool journal) {
  std::shared_ptr<spdlog::sinks::sink> sink;
  if (journal) {
    sink = std::make_shared<spdlog::sinks::systemd_sink_mt>("", false);
  } else {
    sink = std::make_shared<spdlog::sinks::stderr_sink_mt>();
    // The process id is written into the pattern once: "%P" would ask the kernel for
    // it on every line.
    sink->set_pattern("%Y-%m-%d %H:%M:%S.%e [" + std::to_string(::getpid()) + ":%t] <%l> %v");
  }
  auto logger = std::make_shared<spdlog::logger>("telvane", sink);
  logger->set_level(spdlog::level::trace);
  logger->flush_on(spdlog::level::trace);
  return logger;
}

struct State {
  std::mutex mutex;
  std::shared_ptr<spdlog::logger> logger = makeLogger(std::getenv("JOURNAL_STREAM") != nullptr);
  std::vector<LogCapture*> captures;  // guarded by mutex
};

State& state() {
  static State* s = new State();  // never destroyed: logging may happen during exit
  return *s;
}

std::atomic<int> gLevel{static_cast<int>(levelFromEnvironment())};
std::atomic<int> gCaptureCount{0};

spdlog::level::level_enum toSpd(Level level) {
  switch (level) {
    case Level::Debug: return spdlog::level::debug;
    case Level::Info: return spdlog::level::info;
    case Level::Error: return spdlog::level::err;
  }
  return spdlog::level::info;
}

}  // namespace

bool enabled(Level level) {
  return static_cast<int>(level) >= gLevel.load(std::memory_order_relaxed) ||
         gCaptureCount.load(std::memory_order_relaxed) > 0;
}

void write(Level level, std::string line) {
  // A line is one line: embedded line breaks would split it in the journal.
  std::replace(line.begin(), line.end(), '\n', ' ');
  State& s = state();
  std::shared_ptr<spdlog::logger> logger;
  {
    std::lock_guard<std::mutex> lock(s.mutex);
    for (auto* capture : s.captures) capture->append(level, line);
    logger = s.logger;
  }
  if (static_cast<int>(level) >= gLevel.load(std::memory_order_relaxed)) logger->log(toSpd(level), line);
}

void setLevel(Level level) { gLevel.store(static_cast<int>(level)); }

void useStandardError() {
  State& s = state();
  std::lock_guard<std::mutex> lock(s.mutex);
  s.logger = makeLogger(false);
}

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
