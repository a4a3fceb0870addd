// ToolRunner: runs a built command-line tool as a real process and collects its exit
// status and both output streams.
#pragma once

#include <string>
#include <vector>

namespace telvane::test {

struct ToolRun {
  int exitCode = -1;  // -1 when the process could not be started or did not exit normally
  std::string out;
  std::string err;
};

// The path of a tool built into <build>/tools: TELVANE_TEST_BINARY_DIR when ctest sets
// it, else found next to the running test binary.
std::string builtToolPath(const std::string& name);

// Runs the tool with the arguments and the test process's environment, where each
// "NAME=value" of `environment` replaces or adds a variable.
ToolRun runTool(const std::string& path, const std::vector<std::string>& arguments,
                const std::vector<std::string>& environment = {});

}  // namespace telvane::test
