// tnctl consent grant APP SERVICE    records that the user granted SERVICE to
//                                    the application APP
// tnctl consent revoke APP SERVICE   records that the user refused it
// tnctl consent list [APP]           the records of APP, or of every
//                                    application
//
// The consent store is a file of the platform ($TENON_ROOT/var/lib/tenon/
// consent.manifest, docs/consent.md), read and written directly: no daemon
// is needed, and the daemon reads the change on its next question. Only root
// and the daemon's user may change it; anyone may list it.

#include <memory>
#include <string>

#include <fmt/format.h>

#include "platform/privy/ConsentStore.h"
#include "platform/value/Document.h"
#include "tools/tnctl/Command.h"

namespace tnctl {
namespace {

struct ConsentArguments {
  std::string application;
  std::string service;
};

void change(const ConsentArguments& arguments, bool granted) {
  const tn::Result<void> changed = privy::ConsentStore().setConsent(arguments.application, arguments.service, granted);
  if (!changed.ok()) fail(changed.error().localizedDescription());
  // Silent for people, as a changed setting is; a document for scripts.
  if (jsonOutcome()) printJsonDocument(tn::Dictionary{{"ok", true}});
}

tn::Value describe(const std::vector<privy::ConsentRecord>& records) {
  tn::Array list;
  for (const privy::ConsentRecord& record : records) {
    list.push_back(tn::Dictionary{{"service", record.service}, {"granted", record.granted}});
  }
  return list;
}

void list(const GlobalOptions& options, const std::string& only) {
  const tn::Result<privy::ConsentRecords> records = privy::ConsentStore().read();
  if (!records.ok()) fail(records.error().localizedDescription());
  tn::Dictionary shown;
  for (const auto& [application, entries] : *records) {
    if (only.empty() || application == only) shown.set(application, describe(entries));
  }
  if (options.json) {
    printJsonDocument(tn::Value(shown));
    return;
  }
  for (const auto& [application, entries] : *records) {
    if (!only.empty() && application != only) continue;
    for (const privy::ConsentRecord& record : entries) {
      fmt::print("{} {} {}\n", application, record.service, record.granted ? "granted" : "refused");
    }
  }
}

}  // namespace

void addConsentCommands(CLI::App& app, const GlobalOptions& options) {
  CLI::App* consent = app.add_subcommand("consent", "Show or change the privacy services granted to applications");
  consent->require_subcommand(1);

  auto grantArguments = std::make_shared<ConsentArguments>();
  CLI::App* grant = consent->add_subcommand("grant", "Grant a privacy service to an application (root only)");
  grant->add_option("APP", grantArguments->application, "The application's bundle identifier")->required();
  grant->add_option("SERVICE", grantArguments->service, "The privacy service's identifier")->required();
  grant->callback([grantArguments] { change(*grantArguments, true); });

  auto revokeArguments = std::make_shared<ConsentArguments>();
  CLI::App* revoke = consent->add_subcommand("revoke", "Refuse a privacy service to an application (root only)");
  revoke->add_option("APP", revokeArguments->application, "The application's bundle identifier")->required();
  revoke->add_option("SERVICE", revokeArguments->service, "The privacy service's identifier")->required();
  revoke->callback([revokeArguments] { change(*revokeArguments, false); });

  auto listed = std::make_shared<std::string>();
  CLI::App* listCommand = consent->add_subcommand("list", "List the consent records");
  listCommand->add_option("APP", *listed, "Only this application's records");
  listCommand->callback([&options, listed] { list(options, *listed); });
}

}  // namespace tnctl
