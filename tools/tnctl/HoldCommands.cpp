// tnctl hold [--plugins] [--unless-busy] [--terminate] [--wait] PATH...
//   puts plug-ins on hold ("lock", hold form) and prints the hold's token,
//   alone on its line. A hold lasts as long as the connection that placed
//   it: without --wait it ends when tnctl exits; with --wait tnctl keeps the
//   connection (and the hold) until SIGINT, SIGTERM or SIGHUP, then exits 0;
//   if the daemon goes away meanwhile (and the hold with it), exits 1.
//   A refusal for busy plug-ins prints "busy: <identifier>" per busy one.
// tnctl release TOKEN
//   ends the hold with that token ("lock", release form); prints "released".

#include <fcntl.h>
#include <signal.h>
#include <unistd.h>

#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <fmt/format.h>

#include "libtenon/model/PlugInKeys.h"
#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

// The hold flags of the "lock" request.
constexpr uint64_t kHoldFlagPlugInPaths = 0x1;
constexpr uint64_t kHoldFlagUnlessBusy = 0x2;
constexpr uint64_t kHoldFlagTerminate = 0x4;

struct HoldOptions {
  std::vector<std::string> paths;
  bool plugInPaths = false;
  bool unlessBusy = false;
  bool terminate = false;
  bool wait = false;

  uint64_t flags() const {
    return (plugInPaths ? kHoldFlagPlugInPaths : uint64_t{0}) | (unlessBusy ? kHoldFlagUnlessBusy : uint64_t{0}) |
           (terminate ? kHoldFlagTerminate : uint64_t{0});
  }
};

// The signals that end a hold kept with --wait. Their handler writes one
// byte into a pipe (the one thing it may safely do, on whichever thread the
// signal lands); the main thread waits on the other end.
constexpr int kHoldEndingSignals[] = {SIGINT, SIGTERM, SIGHUP};
int holdEndingPipe[2] = {-1, -1};

// What ends the wait, as the byte written into the pipe.
constexpr char kEndedBySignal = 's';
constexpr char kEndedByLostConnection = 'c';

void noteHoldEnding(char reason) {
  const int saved = errno;
  [[maybe_unused]] const ssize_t written = ::write(holdEndingPipe[1], &reason, 1);
  errno = saved;
}

void noteHoldEndingSignal(int) { noteHoldEnding(kEndedBySignal); }

// Installed before the request goes out, so that a signal sent as soon as
// the token is out ends the hold cleanly rather than killing tnctl.
void catchHoldEndingSignals() {
  if (::pipe2(holdEndingPipe, O_CLOEXEC) != 0) fail(fmt::format("cannot make a pipe: {}", std::strerror(errno)));
  // The handler must never block, however many signals come.
  ::fcntl(holdEndingPipe[1], F_SETFL, ::fcntl(holdEndingPipe[1], F_GETFL) | O_NONBLOCK);
  struct sigaction action {};
  action.sa_handler = noteHoldEndingSignal;
  sigemptyset(&action.sa_mask);
  action.sa_flags = SA_RESTART;
  for (const int signal : kHoldEndingSignals) ::sigaction(signal, &action, nullptr);
}

// Waits for a signal; a connection that breaks meanwhile (the daemon
// stopped or restarted) has ended the hold, which fails the command.
void awaitHoldEndingSignal(tn::TNDaemonClient& client) {
  client.setConnectionLostHandler([] { noteHoldEnding(kEndedByLostConnection); });
  std::fprintf(stderr, "tnctl: holding until SIGINT or SIGTERM\n");
  char byte = 0;
  while (::read(holdEndingPipe[0], &byte, 1) < 0 && errno == EINTR) {
  }
  if (byte == kEndedByLostConnection) fail("the connection to tenond broke; the hold ended with it");
}

// A refusal for busy plug-ins names each busy one by its identifier.
void printBusyConflicts(const tn::TNDaemonClient&, const tn::Value& reply) {
  const tn::Array* conflicts = reply["conflicts"].array();
  if (conflicts == nullptr) return;
  for (const tn::Value& conflict : *conflicts) {
    const std::string* identifier = conflict[tn::keys::kBundleIdentifier].string();
    fmt::print("busy: {}\n", identifier ? *identifier : conflict.description());
  }
}

void addHoldCommand(CLI::App& app, const GlobalOptions& options) {
  auto arguments = std::make_shared<HoldOptions>();
  CLI::App* command = app.add_subcommand(
      "hold",
      "Put plug-ins on hold and print the hold's token. A hold lasts while the tnctl that placed it runs: "
      "without --wait it ends as tnctl exits; with --wait it lasts until SIGINT or SIGTERM, "
      "or until tnctl release TOKEN");
  command->add_option("PATH", arguments->paths, "Application bundles, all of whose plug-ins are held (or, with "
                                                "--plugins, plug-in bundles)")
      ->required();
  command->add_flag("--plugins", arguments->plugInPaths, "The paths are plug-in bundles, not applications");
  command->add_flag("--unless-busy", arguments->unlessBusy,
                    "Refuse (error 14) when any of the plug-ins is busy; the busy ones are printed");
  command->add_flag("--terminate", arguments->terminate,
                    "Terminate the plug-ins' running instances before the hold is reported");
  command->add_flag("--wait", arguments->wait,
                    "After printing the token, keep the hold until SIGINT or SIGTERM, then exit 0 (1 if tenond "
                    "stops meanwhile: the hold ends with it)");
  command->callback([&options, arguments] {
    const std::vector<std::string> paths = absolutePaths(arguments->paths);
    if (arguments->wait) catchHoldEndingSignals();
    ReplyHandling handling;
    handling.readableFailure = printBusyConflicts;
    if (arguments->wait) handling.whileConnected = awaitHoldEndingSignal;
    runClientOperation(
        options,
        [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
          client.holdPlugins(paths, arguments->flags(), std::move(reply));
        },
        handling);
  });
}

void addReleaseCommand(CLI::App& app, const GlobalOptions& options) {
  auto token = std::make_shared<std::string>();
  CLI::App* command = app.add_subcommand(
      "release", "End the hold with this token (any holder of the token may; an unknown token is no error)");
  command->add_option("TOKEN", *token, "The hold's token, as tnctl hold printed it")->required();
  command->callback([&options, token] {
    const std::optional<tn::UUID> value = tn::UUID::parse(*token);
    if (!value) fail(fmt::format("invalid hold token: {} (a token is a UUID, as tnctl hold prints it)", *token));
    runClientOperation(
        options,
        [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
          client.releaseHold(*value, std::move(reply));
        },
        "released");
  });
}

}  // namespace

void addHoldCommands(CLI::App& app, const GlobalOptions& options) {
  addHoldCommand(app, options);
  addReleaseCommand(app, options);
}

}  // namespace tnctl
