#include "tenond/server/CommandLine.h"

#include <unistd.h>

#include <cstdio>
#include <cstdlib>

#include "platform/log/Log.h"

namespace tnd {

std::optional<CommandLine> parseCommandLine(int argc, char** argv) {
  CommandLine line;
  opterr = 0;  // the usage line is the only complaint tenond prints
  optind = 1;
  int option;
  while ((option = getopt(argc, argv, "c:d:S:v")) != -1) {
    switch (option) {
      case 'S': line.serviceName = optarg; break;
      case 'd': line.databasePath = std::string(optarg); break;
      case 'c': line.cacheLimit = std::atoi(optarg); break;
      case 'v':
        ++line.verbose;
        TN_LOG_ERROR(tn::log::defaultLog(),
                     "verbose option -v is ineffective; use log config --subsystem com.ostrel.tenon");
        break;
      default: return std::nullopt;
    }
  }
  if (optind < argc) return std::nullopt;
  return line;
}

void printUsage() { std::fputs("Usage: tenond [-S servicename] [-v]\n", stderr); }

}  // namespace tnd
