#include "tenond/database/AnnotationFileText.h"

#include <algorithm>
#include <string_view>

#include "platform/value/Document.h"

namespace tnd::annotationfile {
namespace {

// A one-entry map whose item is a single line, to find the writer's layout.
constexpr std::string_view kMarkerKey = "k";

// The text of `root` split around the line of the marker entry's item in
// its "data" map: the writer's layout of everything but the items.
struct Frame {
  std::string before;
  std::string after;
};

Frame frameOf(tn::Dictionary root) {
  root.set("data", tn::Value(tn::Dictionary{{std::string(kMarkerKey), tn::Value(0)}}));
  const std::string text = *tn::writeXmlDocument(tn::Value(std::move(root)));
  const size_t item = text.find("<item key=\"" + std::string(kMarkerKey) + "\">");
  const size_t lineStart = text.rfind('\n', item) + 1;
  const size_t lineEnd = text.find('\n', item) + 1;
  return {text.substr(0, lineStart), text.substr(lineEnd)};
}

// Around an item in a document holding only "data".
const Frame& itemFrame() {
  static const Frame frame = frameOf(tn::Dictionary());
  return frame;
}

}  // namespace

tn::Result<std::string> itemFor(const std::string& key, const tn::Value& entry) {
  tn::Result<std::string> text =
      tn::writeXmlDocument(tn::Value(tn::Dictionary{{"data", tn::Value(tn::Dictionary{{key, entry}})}}));
  if (!text) return text.error();
  const Frame& frame = itemFrame();
  std::string& whole = *text;
  if (!whole.starts_with(frame.before) || !whole.ends_with(frame.after) ||
      whole.size() < frame.before.size() + frame.after.size()) {
    return tn::Error(std::string(tn::kDocumentErrorDomain), 0, "the document writer changed its layout");
  }
  return whole.substr(frame.before.size(), whole.size() - frame.before.size() - frame.after.size());
}

tn::Result<std::string> document(int64_t version, const tn::Dictionary& entries, const Items& items) {
  const tn::Dictionary root{{"version", tn::Value(version)}};
  const bool complete = std::all_of(entries.begin(), entries.end(),
                                    [&](const tn::Dictionary::Entry& entry) { return items.contains(entry.first); });
  // An empty map has a layout of its own ("<map/>"); one with an entry the
  // writer failed on gets the writer's own answer.
  if (entries.empty() || !complete) {
    tn::Dictionary whole = root;
    whole.set("data", tn::Value(entries));
    return tn::writeXmlDocument(tn::Value(std::move(whole)));
  }
  const Frame frame = frameOf(root);
  size_t size = frame.before.size() + frame.after.size();
  for (const auto& [key, item] : items) size += item.size();
  std::string text;
  text.reserve(size);
  text += frame.before;
  for (const auto& entry : entries) text += items.find(entry.first)->second;
  text += frame.after;
  return text;
}

}  // namespace tnd::annotationfile
