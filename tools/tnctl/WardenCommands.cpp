// tnctl warden list [--warden-service NAME]
//   the supervisor's registrations and running plug-in instances: every one
//   for a privileged user, the caller's own otherwise. Readable, one line
//   each, or the reply as one JSON document with --json.
// tnctl warden busy BUNDLE-IDENTIFIER... [--vigil-service NAME]
//   the running instances of those bundles that declared themselves busy
//   (privileged users only), as the daemon sees them before a hold.

#include <fmt/format.h>

#include <cstdio>
#include <memory>
#include <string>
#include <vector>

#include "libtenon/client/BlockingReply.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "platform/value/Document.h"
#include "tools/tnctl/Command.h"

namespace tnctl {
namespace {

std::string wardenField(const tn::Value& value) {
  if (const std::string* string = value.string()) return *string;
  return value.description();
}

void printWardenListing(const tn::Value& reply) {
  const tn::Array* registrations = reply["registrations"].array();
  const tn::Array* instances = reply["instances"].array();
  std::printf("registrations: %zu\n", registrations ? registrations->size() : 0);
  for (const tn::Value& entry : registrations ? *registrations : tn::Array{}) {
    std::printf("  host %s  %s %s  %s  profile %s\n", wardenField(entry["host"]).c_str(),
                wardenField(entry["BNBundleIdentifier"]).c_str(), wardenField(entry["BNBundleVersion"]).c_str(),
                wardenField(entry["executable"]).c_str(), wardenField(entry["profile"]).c_str());
  }
  std::printf("instances: %zu\n", instances ? instances->size() : 0);
  for (const tn::Value& entry : instances ? *instances : tn::Array{}) {
    std::printf("  pid %s  host %s  uid %s  %s %s  profile %s\n", wardenField(entry["pid"]).c_str(),
                wardenField(entry["host"]).c_str(), wardenField(entry["uid"]).c_str(), wardenField(entry["BNBundleIdentifier"]).c_str(),
                wardenField(entry["BNBundleVersion"]).c_str(), wardenField(entry["profile"]).c_str());
  }
}

tn::Value askService(const std::string& service, tn::Value request, unsigned timeoutSeconds) {
  const auto queue = tn::dispatch::SerialQueue::create("tnctl.warden");
  auto connection = relay::Connection::connectToService(service, queue);
  if (!connection.ok()) fail(fmt::format("cannot reach {}: {}", service, connection.error().localizedDescription()));
  (*connection)->setEventHandler([](const relay::Event&) {});
  (*connection)->resume();
  tn::BlockingReply pending;
  (*connection)->sendWithReply(std::move(request), queue, pending.block());
  relay::Reply reply = pending.wait(std::chrono::seconds(timeoutSeconds));
  (*connection)->cancel();
  if (!reply.ok()) fail(fmt::format("{}: {}", service, reply.error().localizedDescription()));
  if ((*reply)["errorcode"].uint64()) fail(fmt::format("{}: {}", service, wardenField((*reply)["error"])));
  return *reply;
}

void printJsonReply(const tn::Value& reply) { printJsonDocument(reply); }

void addBusyCommand(CLI::App& warden, const GlobalOptions& options) {
  struct BusyOptions {
    std::vector<std::string> identifiers;
    std::string service = "com.ostrel.tenon.vigil";
  };
  auto arguments = std::make_shared<BusyOptions>();
  CLI::App* busy = warden.add_subcommand("busy", "Running plug-in instances that declared themselves busy");
  busy->add_option("BUNDLE-IDENTIFIER", arguments->identifiers, "Bundle identifiers of plug-ins")->required();
  busy->add_option("--vigil-service", arguments->service, "The busy-assertion service")->capture_default_str();
  busy->callback([&options, arguments] {
    tn::Array identifiers;
    for (const std::string& identifier : arguments->identifiers) identifiers.push_back(tn::Value(identifier));
    const tn::Value reply = askService(
        arguments->service, tn::Dictionary{{"request", "busy-instances"}, {"identifiers", std::move(identifiers)}},
        options.timeoutSeconds);
    if (options.json) return printJsonReply(reply);
    const tn::Array* instances = reply["instances"].array();
    std::printf("busy instances: %zu\n", instances ? instances->size() : 0);
    for (const tn::Value& entry : instances ? *instances : tn::Array{}) {
      std::printf("  pid %s  %s %s\n", wardenField(entry["pid"]).c_str(), wardenField(entry["BNBundleIdentifier"]).c_str(),
                  wardenField(entry["BNBundleVersion"]).c_str());
    }
  });
}

}  // namespace

void addWardenCommands(CLI::App& app, const GlobalOptions& options) {
  CLI::App* warden = app.add_subcommand("warden", "The process supervisor");
  warden->require_subcommand(1);
  auto service = std::make_shared<std::string>("com.ostrel.tenon.warden");
  CLI::App* list = warden->add_subcommand("list", "Registrations and running plug-in instances");
  list->add_option("--warden-service", *service, "The supervisor's relay service")->capture_default_str();
  list->callback([&options, service] {
    const tn::Value reply = askService(*service, tn::Dictionary{{"request", "list"}}, options.timeoutSeconds);
    if (!options.json) return printWardenListing(reply);
    printJsonReply(reply);
  });
  addBusyCommand(*warden, options);
}

}  // namespace tnctl
