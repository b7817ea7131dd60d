#include "tools/tnctl/Outcome.h"

#include <cstdio>

#include <fmt/format.h>

#include "platform/value/Document.h"
#include "tools/tnctl/DisplayDate.h"

namespace tnctl {
namespace {

bool gJson = false;             // set by main before commands run
bool gDocumentPrinted = false;  // a JSON document is on stdout already

}  // namespace

void setJsonOutcome(bool json) { gJson = json; }
bool jsonOutcome() { return gJson; }

void printJsonDocument(const tn::Value& document) {
  tn::Result<std::string> text = tn::writeJsonDocument(withDisplayDates(document));
  if (!text) {
    // Only values tnctl did not check can get here (a date out of range in
    // a reply): report that instead of printing half a document.
    fail(fmt::format("cannot write the output as JSON: {}", text.error().localizedDescription()));
  }
  std::fputs(text->c_str(), stdout);
  std::fflush(stdout);
  gDocumentPrinted = true;
}

void fail(const std::string& message, const tn::Dictionary& details, int status) {
  fmt::print(stderr, "tnctl: {}\n", message);
  if (gJson && !gDocumentPrinted) {
    tn::Dictionary document{{"ok", false}, {"error", message}};
    for (const auto& [key, value] : details) document.set(key, value);
    gDocumentPrinted = true;  // whatever happens below, never a second one
    if (tn::Result<std::string> text = tn::writeJsonDocument(tn::Value(std::move(document)))) {
      std::fputs(text->c_str(), stdout);
      std::fflush(stdout);
    }
  }
  throw CommandFailed{status};
}

void failUsage(const std::string& message) { fail(message, tn::Dictionary{{"usage", true}}, kUsageStatus); }

}  // namespace tnctl
