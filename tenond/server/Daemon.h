#pragma once

namespace tnd {

// The whole life of the daemon process: log the launch, parse the command
// line (usage error: exit 2), build the server (failure: exit 1), route
// SIGTERM to the main queue (stop, then exit 0) and run the server forever.
int runDaemon(int argc, char** argv);

}  // namespace tnd
