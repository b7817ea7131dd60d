// tnctl start PATH [--env JSON|@FILE] [--warden-service NAME]
//   runs a plug-in for this process, as a host does: looks the plug-in up
//   ("find"), makes it ready for tnctl ("ready"), asks the supervisor to start
//   it, and then relays standard input to the plug-in and what it answers to
//   standard output, until both sides are done. The plug-in's process is
//   reported on standard error.

#include <poll.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <chrono>
#include <cstdio>
#include <cstring>
#include <future>
#include <memory>
#include <optional>
#include <string>

#include <fmt/format.h>

#include "libtenon/model/PlugInKeys.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

struct StartOptions {
  std::string path;
  std::optional<std::string> environment;
  std::string wardenService = "com.ostrel.tenon.warden";
};

struct FoundPlugIn {
  tn::UUID uuid;
  std::string bundleIdentifier;
};

FoundPlugIn findPlugIn(const GlobalOptions& options, const std::string& path) {
  FoundPlugIn found;
  const tn::URL url = tn::URL::fileURLWithPath(absolutePath(path));
  runClientOperationQuietly(
      options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
        client.findPlugInByPathURL(url, std::move(reply));
      },
      [&](const tn::TNDaemonClient& client, const tn::Value& reply) {
        const tn::Value form = client.convertFromRelay(reply["matches"]);
        const std::optional<tn::UUID> uuid =
            form["uuid"].string() ? tn::UUID::parse(*form["uuid"].string()) : std::nullopt;
        const std::string* identifier = form["bundleInfo"][tn::keys::kBundleIdentifier].string();
        if (!uuid || identifier == nullptr) fail(fmt::format("{}: the daemon's form of it names no plug-in", path));
        found = FoundPlugIn{*uuid, *identifier};
      });
  return found;
}

void makeReady(const GlobalOptions& options, const FoundPlugIn& plugIn, const std::optional<tn::Dictionary>& environment,
               const std::string& path) {
  runClientOperationQuietly(
      options, [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
        client.readyPlugIns({{absolutePath(path), plugIn.uuid}}, 0, environment,
                            std::move(reply));
      },
      [](const tn::TNDaemonClient&, const tn::Value&) {});
}

// Asks the supervisor to start the plug-in; the host's end of its socket.
relay::UniqueFd startPlugIn(const GlobalOptions& options, const std::string& service,
                            const std::string& bundleIdentifier) {
  const auto queue = tn::dispatch::SerialQueue::create("tnctl.start");
  auto connection = relay::Connection::connectToService(service, queue);
  if (!connection.ok()) fail(fmt::format("cannot reach {}: {}", service, connection.error().localizedDescription()));
  (*connection)->setEventHandler([](const relay::Event&) {});
  (*connection)->resume();
  auto answer = std::make_shared<std::promise<std::pair<relay::Reply, relay::Descriptors>>>();
  (*connection)->sendWithReply(tn::Dictionary{{"request", "start"}, {"plug-in", bundleIdentifier}},
                               relay::Descriptors(), queue,
                               [answer](relay::Reply reply, relay::Descriptors descriptors) {
                                 answer->set_value({std::move(reply), std::move(descriptors)});
                               });
  auto future = answer->get_future();
  if (future.wait_for(std::chrono::seconds(options.timeoutSeconds)) != std::future_status::ready) {
    fail(fmt::format("no reply from {} within {} seconds", service, options.timeoutSeconds));
  }
  auto [reply, descriptors] = future.get();
  (*connection)->cancel();
  if (!reply.ok()) fail(fmt::format("{}: {}", service, reply.error().localizedDescription()));
  if (const std::optional<uint64_t> code = (*reply)["errorcode"].uint64()) {
    const std::string* message = (*reply)["error"].string();
    fail(fmt::format("{}: error {}: {}", service, *code, message ? *message : "(no message)"));
  }
  if (descriptors.size() != 1) fail(fmt::format("{}: the reply carried no socket", service));
  std::fprintf(stderr, "tnctl: started %s (pid %s)\n", bundleIdentifier.c_str(),
               (*reply)["pid"].description().c_str());
  return std::move(descriptors[0]);
}

bool writeAll(int fd, const char* data, std::size_t size) {
  while (size > 0) {
    const ssize_t written = ::write(fd, data, size);
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) return false;
    data += written;
    size -= static_cast<std::size_t>(written);
  }
  return true;
}

// Standard input to the plug-in, the plug-in to standard output, until the
// plug-in closes its end (after standard input ended, its end is shut for
// writing so that the plug-in sees the end of its input).
void relayStandardStreams(int plugIn) {
  bool inputOpen = true;
  char buffer[65536];
  for (;;) {
    pollfd ready[2] = {{plugIn, POLLIN, 0}, {STDIN_FILENO, static_cast<short>(inputOpen ? POLLIN : 0), 0}};
    if (::poll(ready, inputOpen ? 2 : 1, -1) < 0) {
      if (errno == EINTR) continue;
      fail(fmt::format("poll: {}", std::strerror(errno)));
    }
    if (ready[0].revents != 0) {
      const ssize_t got = ::read(plugIn, buffer, sizeof buffer);
      if (got <= 0) return;
      if (!writeAll(STDOUT_FILENO, buffer, static_cast<std::size_t>(got))) return;
    }
    if (inputOpen && ready[1].revents != 0) {
      const ssize_t got = ::read(STDIN_FILENO, buffer, sizeof buffer);
      if (got <= 0 || !writeAll(plugIn, buffer, static_cast<std::size_t>(got))) {
        inputOpen = false;
        ::shutdown(plugIn, SHUT_WR);
      }
    }
  }
}

}  // namespace

void addStartCommand(CLI::App& app, const GlobalOptions& options) {
  auto arguments = std::make_shared<StartOptions>();
  CLI::App* command = app.add_subcommand(
      "start", "Run a plug-in for this process and talk to it: standard input to it, its answers to standard output");
  command->add_option("PATH", arguments->path, "The plug-in bundle's path")->required();
  command->add_option("--env", arguments->environment,
                      "Environment for the plug-in: JSON, or @FILE (needs the host entitlement to provide one)");
  command->add_option("--warden-service", arguments->wardenService, "The supervisor's relay service")
      ->capture_default_str();
  command->callback([&options, arguments] {
    std::optional<tn::Dictionary> environment;
    if (arguments->environment) environment = readDictionaryArgument(*arguments->environment, "--env");
    const FoundPlugIn plugIn = findPlugIn(options, arguments->path);
    makeReady(options, plugIn, environment, arguments->path);
    const relay::UniqueFd socket = startPlugIn(options, arguments->wardenService, plugIn.bundleIdentifier);
    relayStandardStreams(socket.get());
  });
}

}  // namespace tnctl
