#pragma once

// The command line of tenond: -S service name, -d annotation file path,
// -c cache limit, -v (accepted, ineffective). Parsed with getopt and the
// option string "c:d:S:v".

#include <cstdint>
#include <optional>
#include <string>

namespace tnd {

inline constexpr const char* kDefaultServiceName = "com.ostrel.tenon.tenond";
inline constexpr int kDefaultCacheLimit = 1000000;

struct CommandLine {
  std::string serviceName = kDefaultServiceName;
  std::optional<std::string> databasePath;  // -d, taken unaltered
  int cacheLimit = kDefaultCacheLimit;      // -c, converted like atoi
  uint32_t verbose = 0;                     // number of -v options
};

// Parses argv. Each -v logs the ineffective-option message on the default
// log as it is seen. Returns none after a usage error (unknown option,
// missing argument, or operands after the options); the caller then prints
// the usage line and exits with status 2.
std::optional<CommandLine> parseCommandLine(int argc, char** argv);

// Writes exactly "Usage: tenond [-S servicename] [-v]\n" to stderr.
void printUsage();

}  // namespace tnd
