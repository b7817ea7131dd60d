// tnctl document FILE [--to xml|json]
//
// Reads a structured-value document in either encoding (XML in Tenon's
// vocabulary, or JSON) and writes it to stdout in the chosen one. Plug-in
// authors use it to check a manifest: a bad file gives one line naming the
// file, the line and the reason, and exit status 1. Under --json, without
// --to, the document is written as JSON, so that stdout is one JSON
// document whatever the outcome.

#include <fmt/format.h>

#include "platform/value/Document.h"
#include "tools/tnctl/Command.h"

namespace tnctl {
namespace {

struct DocumentOptions {
  std::string file;
  std::string to = "xml";
};

void runDocument(const DocumentOptions& options) {
  tn::Result<tn::Value> document = tn::readDocumentFile(options.file);
  if (!document) fail(document.error().localizedDescription());

  tn::Result<std::string> text =
      options.to == "json" ? tn::writeJsonDocument(*document) : tn::writeXmlDocument(*document);
  if (!text) fail(fmt::format("{}: cannot write as {}: {}", options.file, options.to,
                              text.error().localizedDescription()));
  fmt::print("{}", *text);
}

}  // namespace

void addDocumentCommand(CLI::App& app, const GlobalOptions& /*options*/) {
  auto options = std::make_shared<DocumentOptions>();
  CLI::App* command = app.add_subcommand("document", "Read a document (XML or JSON) and write it as XML or JSON");
  command->add_option("FILE", options->file, "The document to read")->required();
  command->add_option("--to", options->to, "Encoding to write")
      ->check(CLI::IsMember({"xml", "json"}))
      ->capture_default_str();
  command->callback([options, command] {
    DocumentOptions chosen = *options;
    if (jsonOutcome() && command->count("--to") == 0) chosen.to = "json";
    runDocument(chosen);
  });
}

}  // namespace tnctl
