#include "tenond/server/Daemon.h"

#include <csignal>
#include <cstdlib>

#include "platform/dispatch/MainLoop.h"
#include "platform/dispatch/SignalSource.h"
#include "platform/log/Log.h"
#include "platform/relay/SocketActivation.h"
#include "tenond/server/CommandLine.h"
#include "tenond/server/FileLimit.h"
#include "tenond/server/TNDServer.h"

namespace tnd {

int runDaemon(int argc, char** argv) {
  // Before any thread exists, so that every thread inherits the mask and
  // SIGTERM only ever reaches the watcher that hands it to the main queue.
  tn::dispatch::SignalSource::blockInAllThreads(SIGTERM);

  TN_LOG_INFO(tn::log::ops(), "tenond is launching");

  const std::optional<CommandLine> line = parseCommandLine(argc, argv);
  if (!line) {
    printUsage();
    return 2;
  }

  raiseFileLimit();
  std::shared_ptr<TNDServer> server = TNDServer::initForService(line->serviceName, line->databasePath);
  if (!server) {
    TN_LOG_ERROR(tn::log::ops(), "unable to construct server");
    return 1;
  }
  server->setVerbose(line->verbose);
  server->setCacheLimit(static_cast<uint32_t>(line->cacheLimit));  // a negative limit wraps, as documented
  TN_LOG_DEBUG(tn::log::ops(), "serving {} with cache limit {}, annotation file {}", line->serviceName,
               server->cacheLimit(), server->annotationsPath());

  static auto termination = tn::dispatch::SignalSource::create(SIGTERM, tn::dispatch::mainQueue(), [server] {
    server->stop();
    std::exit(0);
  });

  relay::notifyReady();
  server->run();
}

}  // namespace tnd
