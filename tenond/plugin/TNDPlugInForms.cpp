// The forms a daemon plug-in record answers with: the exported form kept per
// registrar knowledge, the sandbox extensions that complete it, and its
// typed encoding kept in two pieces around the one per-request entry, the
// user's annotation (see "Forms" in TNDPlugIn.h).

#include <cstring>
#include <memory>

#include "libtenon/model/PlugInKeys.h"
#include "libtenon/model/TNSandboxExtension.h"
#include "platform/log/Log.h"
#include "platform/value/Cbor.h"
#include "tenond/plugin/TNDPlugIn.h"

namespace tnd {
namespace {

constexpr std::string_view kSharedKey = "Shared";
constexpr std::string_view kBundleIdentifierKey = "BNBundleIdentifier";

// The system's text for an errno-coded sandbox failure.
std::string failureText(const tn::Error& error) {
  const char* text = strerrordesc_np(static_cast<int>(error.code()));
  return text ? text : error.localizedDescription();
}

}  // namespace

// What a record keeps of its form for one knowledge generation: only
// encoded bytes and the tokens, which cost a tenth of the memory the form's
// dictionary would (ten thousand records are kept).
struct TNDPlugIn::KeptForm {
  std::optional<tn::UUID> knowledge;
  // Why the form could not be exported; rare, so not kept inline.
  std::unique_ptr<const tn::Error> exportError;
  // Whether the augmentation's entries are part of `encoded`: only when
  // every token was issued; otherwise they are made again on every use.
  // Not kept as a dictionary too: the tokens are the same whenever they are
  // issued again, and ten thousand dictionaries of tokens took 7 MB.
  bool augmentationKept = false;
  // The encoded entries before "annotations", and those after it followed
  // by the augmentation's (only when the augmentation is kept), in one
  // buffer: before = [0, split), after = [split, end).
  tn::Bytes encoded;
  std::size_t split = 0;
  std::size_t beforeCount = 0;
  std::size_t afterCount = 0;
};

tn::Dictionary TNDPlugIn::issueResourceExtensions(const tn::Value& resources) const {
  bool complete = true;
  return issueResourceExtensions(resources, complete);
}

tn::Dictionary TNDPlugIn::issueResourceExtensions(const tn::Value& resources, bool& complete) const {
  tn::Array list;
  if (resources.isString()) {
    list.push_back(resources);
  } else if (const tn::Array* array = resources.array()) {
    list = *array;
  }
  tn::Dictionary tokens;
  const std::optional<tn::URL> bundle = url();
  if (!bundle) return tokens;
  for (const tn::Value& element : list) {
    const std::string* resource = element.string();
    if (resource == nullptr) continue;
    tn::Result<std::string> token = issueResourceExtension(*bundle, *resource);
    if (!token.ok()) complete = false;
    if (!token.ok() && token.error().code() == EPERM) {
      TN_LOG_INFO(tn::log::ops(), "refusing extension for resource {} of plug-in at {}: {}", *resource,
                  bundle->path(), token.error().localizedDescription());
      continue;
    }
    if (!token.ok()) {
      TN_LOG_INFO(tn::log::ops(), "failed to make extension for {} in plug-in at {}: {}", *resource,
                  bundle->path(), failureText(token.error()));
      continue;
    }
    tokens.set(*resource, tn::Value(*token));
  }
  return tokens;
}

tn::Result<std::string> TNDPlugIn::issueResourceExtension(const tn::URL& bundle, const std::string& resource) const {
  {
    std::lock_guard lock(resourcePathsMutex_);
    if (const auto known = resourcePaths_.find(resource); known != resourcePaths_.end()) {
      return tn::issueCheckedResourceExtension(known->second);
    }
  }
  tn::Result<std::string> path = tn::bundleResourcePath(bundle.path(), resource);
  if (!path) return path.error();
  {
    std::lock_guard lock(resourcePathsMutex_);
    resourcePaths_.emplace(resource, *path);
  }
  return tn::issueCheckedResourceExtension(*path);
}

TNDPlugIn::Augmentation TNDPlugIn::augmentation() const {
  Augmentation made;
  tn::Value resources = pluginKey(kSharedKey);
  if (isAppExtension()) resources = tn::Value(tn::Array{tn::Value(".")});
  if (!resources.isNull()) made.entries.set("extensions", tn::Value(issueResourceExtensions(resources, made.complete)));
  if (isData()) return made;
  const tn::Value bundleIdentifier = infoKey(kBundleIdentifierKey);
  const std::string name = bundleIdentifier.string() ? *bundleIdentifier.string() : std::string();
  tn::Result<std::string> token = tn::issueServiceExtension(name);
  if (token.ok()) {
    made.entries.set("service-extension", tn::Value(*token));
  } else {
    made.complete = false;
    TN_LOG_INFO(tn::log::ops(), "failed to make mach extension for {} in plug-in at {}: {}", name,
                path().value_or(""), failureText(token.error()));
  }
  return made;
}

TNDPlugIn::CurrentForm TNDPlugIn::makeKeptForm(const std::optional<tn::UUID>& knowledge) const {
  auto kept = std::make_shared<KeptForm>();
  kept->knowledge = knowledge;
  tn::Result<tn::Dictionary> exported = exportForm();
  if (!exported.ok()) {
    kept->exportError = std::make_unique<const tn::Error>(exported.error());
    exported = tn::Dictionary();
  }
  CurrentForm current;
  Augmentation augmented = augmentation();
  kept->augmentationKept = augmented.complete;
  tn::Bytes before;
  tn::Bytes& after = kept->encoded;
  bool afterAnnotations = false;
  for (const auto& [key, value] : *exported) {
    if (key == tn::formkeys::kAnnotations) {
      afterAnnotations = true;
      continue;
    }
    tn::appendCborEntry(afterAnnotations ? after : before, key, value, tn::CborDialect::Typed);
    ++(afterAnnotations ? kept->afterCount : kept->beforeCount);
  }
  if (kept->augmentationKept) {
    for (const auto& [key, value] : augmented.entries) {
      tn::appendCborEntry(after, key, value, tn::CborDialect::Typed);
      ++kept->afterCount;
    }
  } else {
    current.augmentation = std::move(augmented);
  }
  kept->split = before.size();
  after.insert(after.begin(), before.begin(), before.end());
  after.shrink_to_fit();
  current.kept = std::move(kept);
  return current;
}

TNDPlugIn::CurrentForm TNDPlugIn::currentForm() const {
  (void)bundleInfoDictionary();  // follows the registrar's knowledge first
  const std::optional<tn::UUID> knowledge = rgKnowledgeUUID();
  {
    const std::lock_guard lock(keptFormMutex_);
    if (keptForm_ && keptForm_->knowledge == knowledge) return CurrentForm{keptForm_, std::nullopt};
  }
  CurrentForm made = makeKeptForm(knowledge);
  const std::lock_guard lock(keptFormMutex_);
  keptForm_ = made.kept;
  return made;
}

tn::Dictionary TNDPlugIn::CurrentForm::augmentationEntries(const TNDPlugIn& plugIn) const {
  return augmentation ? augmentation->entries : plugIn.augmentation().entries;
}

void TNDPlugIn::augmentForm(tn::Dictionary& form) const {
  for (const auto& [key, value] : currentForm().augmentationEntries(*this)) form.set(key, value);
}

std::optional<tn::Error> TNDPlugIn::exportError() const {
  const CurrentForm current = currentForm();
  if (!current.kept->exportError) return std::nullopt;
  return *current.kept->exportError;
}

tn::Value TNDPlugIn::encodedForm(const tn::Dictionary& annotations, const tn::Dictionary& extra) const {
  tn::Bytes encoded;
  encoded.reserve(1024);
  appendEncodedForm(encoded, annotations, extra);
  return tn::Value(std::move(encoded));
}

void TNDPlugIn::appendEncodedForm(tn::Bytes& out, const tn::Dictionary& annotations,
                                  const tn::Dictionary& extra) const {
  const CurrentForm current = currentForm();
  const KeptForm* kept = current.kept.get();
  if (kept->exportError) {
    TN_LOG_ERROR(tn::log::ops(), "failed to export matching plug-in {}: {}", uuidText(),
                 kept->exportError->description());
  }
  // The extensions when they are not part of the kept encoding.
  const tn::Dictionary late = kept->augmentationKept ? tn::Dictionary() : current.augmentationEntries(*this);
  const auto split = kept->encoded.begin() + static_cast<std::ptrdiff_t>(kept->split);
  tn::appendCborMapHead(out, kept->beforeCount + 1 + kept->afterCount + late.size() + extra.size());
  out.insert(out.end(), kept->encoded.begin(), split);
  tn::appendCborEntry(out, tn::formkeys::kAnnotations, tn::Value(annotations), tn::CborDialect::Typed);
  out.insert(out.end(), split, kept->encoded.end());
  for (const auto& [key, value] : late) tn::appendCborEntry(out, key, value, tn::CborDialect::Typed);
  for (const auto& [key, value] : extra) tn::appendCborEntry(out, key, value, tn::CborDialect::Typed);
}

}  // namespace tnd
