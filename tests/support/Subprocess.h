#pragma once

// Runs a program to completion for a test and captures what it printed.

#include <string>
#include <vector>

namespace tn::test {

struct ProcessResult {
  int exitStatus = -1;  // -1 when the process did not exit normally
  std::string out;
  std::string err;
};

// Runs argv[0] (a path) with the given arguments and extra "NAME=value"
// environment entries added to the current environment; stdin is /dev/null.
ProcessResult runProcess(const std::vector<std::string>& argv, const std::vector<std::string>& extraEnvironment = {});

}  // namespace tn::test
