// The daemon's log output: spdlog, to the journal with each line's priority when the
// process runs under systemd (JOURNAL_STREAM set), else to standard error in the same
// format as the default output.
#pragma once

namespace telvane::log {

// Installs the output for the rest of the process's life. Thread-safe.
void useSpdlog();

}  // namespace telvane::log
