#include "tools/tnctl/ReplyPrinter.h"

#include <cstdio>
#include <string>
#include <vector>

#include <fmt/format.h>
#include <fmt/ranges.h>

#include "platform/value/Document.h"
#include "tools/tnctl/Command.h"
#include "tools/tnctl/DisplayDate.h"

namespace tnctl {
namespace {

std::string formLine(const tn::Value& form) {
  std::vector<std::string> fields;
  for (const char* key : {"identifier", "version", "uuid"}) {
    if (const std::string* text = form[key].string()) fields.push_back(*text);
  }
  const tn::Value& election = form["annotations"]["election"];
  return fmt::format("{} {}", fields.empty() ? form.description() : fmt::format("{}", fmt::join(fields, " ")),
                     election.isNull() ? std::string("no election") : fmt::format("election {}", election));
}

void printForms(const tn::Value& forms) {
  if (!forms.isArray()) {  // "find": one form
    fmt::print("{}\n", formLine(forms));
    return;
  }
  if (forms.array()->empty()) fmt::print("no plug-ins matched\n");
  for (const tn::Value& form : *forms.array()) fmt::print("{}\n", formLine(form));
}

void printEntry(const tn::TNDaemonClient& client, const std::string& key, const tn::Value& value) {
  if (key == "matches") {
    const tn::Value forms = client.convertFromRelay(value);
    if (!forms.isNull()) return printForms(forms);
  } else if (key == "extensions" && value.isArray()) {
    for (const tn::Value& token : *value.array()) fmt::print("{}\n", token.string() ? *token.string() : token.description());
    return;
  } else if (key == "uuids" && value.uuid()) {
    fmt::print("{}\n", *value.uuid());
    return;
  }
  fmt::print("{}: {}\n", key, withDisplayDates(value));
}

void printReadable(const tn::TNDaemonClient& client, const tn::Dictionary& reply, bool succeeded,
                   const std::string& emptySuccess) {
  bool printed = false;
  for (const auto& [key, value] : reply) {
    if (key == "errorcode" || key == "error") continue;
    printEntry(client, key, value);
    printed = true;
  }
  if (!printed && succeeded) fmt::print("{}\n", emptySuccess);
}

// The reply with `matches` decoded, for programs.
tn::Value decodedForJson(const tn::TNDaemonClient& client, const tn::Dictionary& reply) {
  tn::Dictionary decoded = reply;
  if (const tn::Value* matches = reply.find("matches")) {
    tn::Value forms = client.convertFromRelay(*matches);
    if (!forms.isNull()) decoded.set("matches", std::move(forms));
  }
  return tn::Value(std::move(decoded));
}

void printJson(const tn::TNDaemonClient& client, const tn::Dictionary& reply) {
  printJsonDocument(decodedForJson(client, reply));
}

}  // namespace

void printReply(const tn::TNDaemonClient& client, const tn::Value& reply, bool json, bool succeeded,
                const std::string& emptySuccess) {
  static const tn::Dictionary kEmpty;
  const tn::Dictionary& dictionary = reply.dictionary() ? *reply.dictionary() : kEmpty;
  if (json) {
    printJson(client, dictionary);
  } else {
    printReadable(client, dictionary, succeeded, emptySuccess);
  }
  std::fflush(stdout);
}

}  // namespace tnctl
