#pragma once

// The annotation file's text, assembled from one piece per entry.
//
// Rewriting the whole file after every change is what keeps it simple and
// crash-safe, but serialising 10,000 entries each time costs far more than
// writing the bytes. So the store keeps, for every entry, the text of its
// <item> element exactly as the document writer writes it inside the
// file's "data" map, makes it anew only for the entry that changed, and
// saves by joining the pieces. The result is byte for byte the text the
// writer would make of the whole document {"version": v, "data": map}.

#include <cstdint>
#include <string>
#include <unordered_map>

#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace tnd::annotationfile {

// Entry key → its <item> element's text (with its indentation and final
// newline).
using Items = std::unordered_map<std::string, std::string>;

// The <item key="key"> element of `entry` as the file holds it. Fails as
// the document writer does (a date without a written form, nesting beyond
// the documents' limit).
tn::Result<std::string> itemFor(const std::string& key, const tn::Value& entry);

// The document {"version": version, "data": entries} from the entries'
// items, in the order of `entries`. When an entry has no item (the writer
// failed on it), the writer's own result for the whole document.
tn::Result<std::string> document(int64_t version, const tn::Dictionary& entries, const Items& items);

}  // namespace tnd::annotationfile
