#include "tools/tnctl/Outcome.h"

#include <cstdio>
#include <optional>

#include <fmt/format.h>

#include "platform/value/Document.h"
#include "tools/tnctl/DisplayDate.h"

namespace tnctl {
namespace {

bool gJson = false;             // set by main before commands run
bool gDocumentPrinted = false;  // a JSON document is on stdout already

// Writes the run's one document; the writer's error when it cannot.
std::optional<tn::Error> writeDocument(const tn::Value& document) {
  tn::Result<std::string> text = tn::writeJsonDocument(document);
  if (!text) return text.error();
  std::fputs(text->c_str(), stdout);
  std::fflush(stdout);
  gDocumentPrinted = true;
  return std::nullopt;
}

}  // namespace

void setJsonOutcome(bool json) { gJson = json; }
bool jsonOutcome() { return gJson; }

void printJsonDocument(const tn::Value& document) {
  // Only values tnctl did not check can fail (a date out of range in a
  // reply): that is reported instead of half a document.
  if (const std::optional<tn::Error> error = writeDocument(withDisplayDates(document)))
    fail(fmt::format("cannot write the output as JSON: {}", error->localizedDescription()));
}

void fail(const std::string& message, const tn::Dictionary& details, int status) {
  fmt::print(stderr, "tnctl: {}\n", message);
  if (gJson && !gDocumentPrinted) {
    tn::Dictionary document{{"ok", false}, {"error", message}};
    for (const auto& [key, value] : details) document.set(key, value);
    gDocumentPrinted = true;  // whatever happens below, never a second one
    (void)writeDocument(tn::Value(std::move(document)));
  }
  throw CommandFailed{status};
}

void failUsage(const std::string& message) { fail(message, tn::Dictionary{{"usage", true}}, kUsageStatus); }

}  // namespace tnctl
