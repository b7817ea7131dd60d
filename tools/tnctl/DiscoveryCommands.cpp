// tnctl match [--rules JSON|@FILE] [--flags FLAGS]
//     the plug-ins this process would be offered ("match"), as a table
// tnctl explain (--uuid U | --path P) [--rules JSON|@FILE] [--flags FLAGS] [--host EXECUTABLE]
//     why one plug-in is or is not offered ("explain"), as a checklist
//
// FLAGS: a number (decimal or 0x hexadecimal) or names joined by commas:
// all-versions, duplicates, system-only, all.

#include <algorithm>
#include <filesystem>
#include <memory>
#include <string>
#include <vector>

#include <fmt/format.h>

#include "tools/tnctl/Arguments.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DaemonSession.h"

namespace tnctl {
namespace {

struct DiscoveryOptions {
  std::string rules;
  std::string flags = "0";
  std::string uuid;
  std::string path;
  std::string host;
};

const std::vector<std::pair<std::string, uint64_t>>& flagNames() {
  static const std::vector<std::pair<std::string, uint64_t>> names{
      {"all-versions", 0x1}, {"duplicates", 0x4}, {"system-only", 0x8}, {"all", 0x200}};
  return names;
}

// A number, or names joined by commas.
uint64_t parseDiscoveryFlags(const std::string& text) {
  if (!text.empty() && std::isdigit(static_cast<unsigned char>(text.front())) != 0) return parseFlags(text);
  uint64_t flags = 0;
  size_t start = 0;
  while (start <= text.size()) {
    const size_t comma = std::min(text.find(',', start), text.size());
    const std::string name = text.substr(start, comma - start);
    const auto found = std::find_if(flagNames().begin(), flagNames().end(),
                                    [&](const auto& entry) { return entry.first == name; });
    if (found == flagNames().end()) {
      fail(fmt::format("unknown discovery flag \"{}\" (use a number or all-versions, duplicates, system-only, all)",
                       name));
    }
    flags |= found->second;
    start = comma + 1;
  }
  return flags;
}

std::string text(const tn::Value& value, const char* missing = "-") {
  if (const std::string* string = value.string()) return *string;
  return value.isNull() ? missing : value.description();
}

std::string location(const tn::Value& form) {
  if (form["systemResident"] == tn::Value(true)) return "system";
  if (const std::string* containing = form["containingPath"].string()) return *containing;
  return text(form["path"]);
}

std::string replacement(const tn::Value& form) {
  std::string marks;
  if (const std::string* by = form["overrider"].string()) marks += "replaced by " + *by;
  if (const std::string* of = form["overriding"].string()) marks += (marks.empty() ? "" : "; ") + ("replaces " + *of);
  return marks;
}

void printMatches(const tn::TNDaemonClient& client, const tn::Value& reply) {
  const tn::Value forms = client.convertFromRelay(reply["matches"]);
  const tn::Array* list = forms.array();
  if (list == nullptr || list->empty()) {
    fmt::print("no plug-ins offered\n");
    return;
  }
  fmt::print("{:<40} {:<8} {:<8} {:<36} {}\n", "IDENTIFIER", "VERSION", "ELECTION", "UUID", "LOCATION");
  for (const tn::Value& form : *list) {
    const std::string marks = replacement(form);
    fmt::print("{:<40} {:<8} {:<8} {:<36} {}{}\n", text(form["identifier"]), text(form["version"]),
               text(form["annotations"]["election"]), text(form["uuid"]), location(form),
               marks.empty() ? "" : "  (" + marks + ")");
  }
}

void printExplanation(const tn::TNDaemonClient&, const tn::Value& reply) {
  const tn::Value explanation = reply["explanation"];
  const bool offered = explanation["offered"] == tn::Value(true);
  fmt::print("{} {}\n", text(explanation["identifier"]), text(explanation["plugin"]));
  fmt::print("  at {}\n", text(explanation["path"]));
  fmt::print("  for host {}\n", text(explanation["host"], "(unknown executable)"));
  fmt::print("{}\n", offered ? "OFFERED" : "NOT OFFERED");
  if (const tn::Array* steps = explanation["steps"].array()) {
    for (const tn::Value& step : *steps) {
      fmt::print("  [{}] {:<27} {}\n", step["passed"] == tn::Value(true) ? "ok" : "NO", text(step["step"]),
                 text(step["reason"], ""));
      if (const tn::Array* rules = step["rules"].array()) {
        for (const tn::Value& rule : *rules) {
          fmt::print("        {} {} = {}\n", rule["passed"] == tn::Value(true) ? "ok" : "NO", text(rule["key"]),
                     rule["pattern"].description());
        }
      }
    }
  }
}

tn::Dictionary rulesOf(const DiscoveryOptions& arguments) {
  return arguments.rules.empty() ? tn::Dictionary() : readDictionaryArgument(arguments.rules, "--rules");
}

void addMatchCommand(CLI::App& app, const GlobalOptions& options) {
  auto arguments = std::make_shared<DiscoveryOptions>();
  CLI::App* command = app.add_subcommand("match", "Discover the plug-ins this process would be offered for rules");
  command->add_option("--rules", arguments->rules, "Rules dictionary: JSON, or @FILE");
  command->add_option("--flags", arguments->flags,
                      "Discovery flags: a number, or names joined by commas (all-versions, duplicates, "
                      "system-only, all)")
      ->capture_default_str();
  command->callback([&options, arguments] {
    const tn::Dictionary rules = rulesOf(*arguments);
    const uint64_t flags = parseDiscoveryFlags(arguments->flags);
    runClientOperation(
        options,
        [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
          client.matchPlugIns(rules, flags, std::move(reply));
        },
        printMatches);
  });
}

void addExplainCommand(CLI::App& app, const GlobalOptions& options) {
  auto arguments = std::make_shared<DiscoveryOptions>();
  CLI::App* command = app.add_subcommand(
      "explain", "Say why a plug-in is or is not offered to a host, step by step (for this process, or with "
                 "--host for another program, which needs a manager)");
  CLI::Option* uuid = command->add_option("--uuid", arguments->uuid, "The plug-in's UUID");
  CLI::Option* path = command->add_option("--path", arguments->path, "The plug-in bundle's path");
  uuid->excludes(path);
  command->add_option("--rules", arguments->rules, "Rules dictionary: JSON, or @FILE");
  command->add_option("--flags", arguments->flags, "Discovery flags, as for match")->capture_default_str();
  command->add_option("--host", arguments->host, "The host program's executable (absolute path)");
  command->callback([&options, arguments] {
    if (arguments->uuid.empty() && arguments->path.empty()) fail("explain: give the plug-in with --uuid or --path");
    tn::TNDaemonClient::ExplainedPlugIn plugIn;
    if (!arguments->uuid.empty()) plugIn.uuid = parseUUID(arguments->uuid);
    if (!arguments->path.empty()) plugIn.path = std::filesystem::absolute(arguments->path).lexically_normal().string();
    const tn::Dictionary rules = rulesOf(*arguments);
    const uint64_t flags = parseDiscoveryFlags(arguments->flags);
    const std::optional<std::string> host =
        arguments->host.empty() ? std::nullopt
                                : std::optional<std::string>(std::filesystem::absolute(arguments->host).string());
    runClientOperation(
        options,
        [&](tn::TNDaemonClient& client, tn::TNDaemonClient::ReplyBlock reply) {
          client.explainPlugIn(plugIn, rules, flags, host, std::move(reply));
        },
        printExplanation);
  });
}

}  // namespace

void addDiscoveryCommands(CLI::App& app, const GlobalOptions& options) {
  addMatchCommand(app, options);
  addExplainCommand(app, options);
}

}  // namespace tnctl
