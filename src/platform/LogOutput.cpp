#include "platform/LogOutput.h"

#include <spdlog/sinks/stdout_sinks.h>
#include <spdlog/sinks/systemd_sink.h>
#include <spdlog/spdlog.h>

#include <unistd.h>

#include <cstdlib>
#include <memory>
#include <string>

#include "platform/Log.h"

namespace telvane::log {

namespace {

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

spdlog::logger& logger() {
  // Never destroyed: logging may happen during exit.
  static auto* instance = new std::shared_ptr<spdlog::logger>(makeLogger(std::getenv("JOURNAL_STREAM") != nullptr));
  return **instance;
}

void writeSpdlog(Level level, const std::string& line) {
  switch (level) {
    case Level::Debug: logger().log(spdlog::level::debug, line); break;
    case Level::Info: logger().log(spdlog::level::info, line); break;
    case Level::Error: logger().log(spdlog::level::err, line); break;
  }
}

}  // namespace

void useSpdlog() {
  logger();  // made before the first line, not by it
  setOutput(&writeSpdlog);
}

}  // namespace telvane::log
