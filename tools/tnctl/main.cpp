#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <memory>

#include "platform/log/Log.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/UsageErrors.h"

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

// --json decides the form of every outcome, usage errors included, so it is
// known before the parser can fail (it may follow a subcommand's arguments).
bool asksForJson(int argc, char** argv) {
  for (int i = 1; i < argc; ++i) {
    if (std::strcmp(argv[i], "--") == 0) return false;
    if (std::strcmp(argv[i], "--json") == 0) return true;
  }
  return false;
}

void addCommands(CLI::App& app, tnctl::GlobalOptions& options) {
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
}

}  // namespace

int main(int argc, char** argv) {
  CLI::App app{"tnctl: inspect and drive the Tenon plug-in registry", "tnctl"};
  app.require_subcommand(1);
  // Global options may also follow a subcommand's own arguments.
  app.fallthrough();
  app.set_version_flag("--version", std::string("tnctl ") + TENON_VERSION, "Print tnctl's version and exit");
  tnctl::GlobalOptions options;
  app.add_flag("--json", options.json, "Write every outcome, errors included, as one JSON document");
  app.add_option("--service", options.service, "The relay service name of tenond")->capture_default_str();
  app.add_option("--timeout", options.timeoutSeconds, "Seconds to wait for tenond's reply")->capture_default_str();
  addCommands(app, options);

  quietLibraryLogs();
  tnctl::setJsonOutcome(asksForJson(argc, argv));
  try {
    try {
      app.parse(argc, argv);
    } catch (const CLI::CallForHelp& help) {
      return app.exit(help);
    } catch (const CLI::CallForAllHelp& help) {
      return app.exit(help);
    } catch (const CLI::CallForVersion& version) {
      return app.exit(version);
    } catch (const CLI::ParseError& error) {
      tnctl::failUsage(tnctl::usageMessage(app, error));
    }
  } catch (const tnctl::CommandFailed& failed) {
    return failed.status;
  }
  return 0;
}
