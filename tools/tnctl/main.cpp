#include <cstdio>
#include <cstdlib>
#include <memory>

#include "platform/log/Log.h"
#include "tools/tnctl/Command.h"

namespace {

// tnctl reports in its own lines; the client library's log lines (lookups,
// communications errors) appear only when TENON_LOG asks for logging.
class DiscardSink : public tn::log::Sink {
 public:
  void write(const tn::log::Record&) override {}
};

void quietLibraryLogs() {
  const char* settings = std::getenv("TENON_LOG");
  if (!settings || !*settings) tn::log::setSink(std::make_shared<DiscardSink>());
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"tnctl: inspect and drive the Tenon plug-in registry", "tnctl"};
  app.require_subcommand(1);
  // Global options may also follow a subcommand's own arguments.
  app.fallthrough();
  tnctl::GlobalOptions options;
  app.add_flag("--json", options.json, "Write machine-readable JSON output");
  app.add_option("--service", options.service, "The relay service name of tenond")->capture_default_str();
  app.add_option("--timeout", options.timeoutSeconds, "Seconds to wait for tenond's reply")->capture_default_str();

  tnctl::addDocumentCommand(app, options);
  tnctl::addRegistryCommands(app, options);
  tnctl::addConsentCommands(app, options);
  tnctl::addLintCommand(app, options);
  tnctl::addRegistrationCommands(app, options);
  tnctl::addLookupCommands(app, options);
  tnctl::addDiscoveryCommands(app, options);
  tnctl::addReadinessCommands(app, options);
  tnctl::addAnnotationCommands(app, options);
  tnctl::addHoldCommands(app, options);
  tnctl::addRequestCommand(app, options);
  tnctl::addWardenCommands(app, options);
  tnctl::addStartCommand(app, options);

  quietLibraryLogs();
  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    return app.exit(e);
  } catch (const tnctl::CommandFailed& failed) {
    return failed.status;
  }
  return 0;
}
