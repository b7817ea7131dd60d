#include <cstdio>

#include "tools/tnctl/Command.h"

int main(int argc, char** argv) {
  CLI::App app{"tnctl: inspect and drive the Tenon plug-in registry", "tnctl"};
  app.require_subcommand(1);
  tnctl::GlobalOptions options;
  app.add_flag("--json", options.json, "Write machine-readable JSON output");

  tnctl::addDocumentCommand(app, options);

  try {
    app.parse(argc, argv);
  } catch (const CLI::ParseError& e) {
    return app.exit(e);
  } catch (const tnctl::CommandFailed& failed) {
    return failed.status;
  }
  return 0;
}
