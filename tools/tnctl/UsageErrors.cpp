#include "tools/tnctl/UsageErrors.h"

#include <fmt/format.h>

namespace tnctl {
namespace {

// The deepest subcommand the command line selected, or the application.
const CLI::App* selectedCommand(const CLI::App& app) {
  const CLI::App* command = &app;
  for (;;) {
    const std::vector<const CLI::App*> chosen = command->get_subcommands([](const CLI::App* sub) {
      return sub->parsed();
    });
    if (chosen.empty()) return command;
    command = chosen.front();
  }
}

std::string commandName(const CLI::App& app, const CLI::App& command) {
  std::string name;
  for (const CLI::App* level = &command; level != nullptr && level != &app; level = level->get_parent()) {
    name = level->get_name() + (name.empty() ? "" : " " + name);
  }
  return name.empty() ? "tnctl" : "tnctl " + name;
}

// The words the parser did not expect, in order.
std::vector<std::string> unexpectedWords(const CLI::App& app) {
  std::vector<std::string> words = app.remaining(/*recurse=*/true);
  std::erase(words, "--");
  return words;
}

std::string unexpectedMessage(const CLI::App& app, const CLI::App& command) {
  const std::vector<std::string> words = unexpectedWords(app);
  const std::string where = commandName(app, command);
  if (words.empty()) return fmt::format("unexpected arguments for {}", where);
  const std::string& first = words.front();
  std::string message;
  if (first.starts_with("-") && first.size() > 1) {
    message = fmt::format("unknown option \"{}\" for {}", first, where);
  } else if (!command.get_subcommands([](const CLI::App*) { return true; }).empty()) {
    message = fmt::format("unknown subcommand \"{}\"{}", first, &command == &app ? "" : " for " + where);
  } else {
    message = fmt::format("unexpected argument \"{}\" for {}", first, where);
  }
  if (words.size() > 1) message += fmt::format(" (and {} more)", words.size() - 1);
  return message;
}

}  // namespace

std::string usageMessage(const CLI::App& app, const CLI::ParseError& error) {
  const CLI::App& command = *selectedCommand(app);
  const std::string help = fmt::format("; see {} --help", commandName(app, command));
  if (dynamic_cast<const CLI::ExtrasError*>(&error) != nullptr) return unexpectedMessage(app, command) + help;
  const bool hasSubcommands = !command.get_subcommands([](const CLI::App*) { return true; }).empty();
  if (dynamic_cast<const CLI::RequiredError*>(&error) != nullptr && hasSubcommands) {
    // The parser reports a word that names no subcommand as a missing one.
    if (!unexpectedWords(app).empty()) return unexpectedMessage(app, command) + help;
    return (&command == &app ? std::string("a subcommand is required")
                             : fmt::format("{} needs a subcommand", commandName(app, command))) +
           help;
  }
  // The parser's own text names the option or argument at fault
  // ("BUNDLE is required", "Could not convert: --timeout = x").
  return fmt::format("{}: {}{}", commandName(app, command), error.what(), help);
}

}  // namespace tnctl
