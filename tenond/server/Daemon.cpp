#include "tenond/server/Daemon.h"

#include <malloc.h>

#include <csignal>
#include <cstdlib>

#include "platform/dispatch/MainLoop.h"
#include "platform/dispatch/SignalSource.h"
#include "platform/log/Log.h"
#include "platform/paths/InstancePaths.h"
#include "platform/relay/SocketActivation.h"
#include "tenond/server/CommandLine.h"
#include "tenond/server/FileLimit.h"
#include "tenond/server/IdleExit.h"
#include "tenond/server/TNDServer.h"

namespace tnd {
namespace {

// Only a daemon the service manager started for its socket may go when
// idle: the manager starts it again for the next client. One that bound its
// own socket would leave its clients with nothing to connect to.
std::unique_ptr<IdleExit> startIdleExit(const std::shared_ptr<TNDServer>& server) {
  const std::size_t seconds =
      server->configuration().idleExitSeconds.value_or(TNDConfiguration::kDefaultIdleExitSeconds);
  if (!server->service()->isSocketActivated() || seconds == 0) return nullptr;
  TN_LOG_DEBUG(tn::log::ops(), "socket-activated: exiting after {} seconds idle", seconds);
  IdleExit::Actions actions;
  actions.isIdle = [server] { return server->isIdle(); };
  actions.stopAccepting = [server] { server->stopAccepting(); };
  actions.exit = [server, seconds] {
    TN_LOG_DEFAULT(tn::log::ops(), "idle for {} seconds (no connection, hold or plug-in instance): exiting",
                   seconds);
    server->stop();
    std::exit(0);
  };
  return IdleExit::start(std::chrono::seconds(seconds), std::move(actions));
}

// A per-user instance whose environment cannot place its files must not
// fall back on the system's.
bool layoutIsSound() {
  const std::string error = paths::currentLayoutError();
  if (error.empty()) return true;
  TN_LOG_ERROR(tn::log::ops(), "cannot place the instance's files: {}", error);
  return false;
}

}  // namespace

int runDaemon(int argc, char** argv) {
  // Before any thread exists, so that every thread inherits the mask and
  // SIGTERM only ever reaches the watcher that hands it to the main queue.
  tn::dispatch::SignalSource::blockInAllThreads(SIGTERM);
  // One allocator arena for every thread: the daemon's work is mostly one
  // request at a time, and an arena per thread held 5 to 13 MB more of
  // freed memory on 10,000 plug-ins at no measurable gain in throughput
  // (docs/performance.md).
  ::mallopt(M_ARENA_MAX, 1);

  TN_LOG_INFO(tn::log::ops(), "tenond is launching");

  const std::optional<CommandLine> line = parseCommandLine(argc, argv);
  if (!line) {
    printUsage();
    return 2;
  }

  if (!layoutIsSound()) return 1;
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
  static std::unique_ptr<IdleExit> idleExit = startIdleExit(server);

  relay::notifyReady();
  server->run();
}

}  // namespace tnd
