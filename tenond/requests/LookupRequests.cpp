// "find": one known plug-in by UUID or by bundle URL, without matching or
// policy, as its form with the user's annotation and the sandbox extensions
// a host needs. And the walk over a request's `uuids` array that the
// requests acting on listed plug-ins share.

#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDServer.h"

namespace tnd {
namespace {

std::string describe(const TNDPlugIn& plugIn) {
  return fmt::format("{} {} {}", plugIn.identifierText(), plugIn.uuidText(), plugIn.path().value_or(""));
}

// The `paths` array that may stand in for unknown UUIDs: only one with as
// many elements as `uuids`.
const tn::Array* fallbackPaths(const tn::Value& request, size_t uuidCount) {
  const tn::Value* paths = request.dictionary() ? request.dictionary()->find("paths") : nullptr;
  if (paths == nullptr) return nullptr;
  if (!paths->isArray()) {
    TN_LOG_DEFAULT(tn::log::traffic(), "Paths present but not an array (ignoring values)");
    return nullptr;
  }
  if (paths->array()->size() != uuidCount) {
    TN_LOG_DEFAULT(tn::log::traffic(), "Paths present but has different count than UUIDs (ignoring)");
    return nullptr;
  }
  return paths->array();
}

}  // namespace

std::shared_ptr<TNDPlugIn> Transaction::findPlugInByUUID(const tn::UUID& uuid) {
  return server()->findPlugIn(uuid);
}

std::shared_ptr<TNDPlugIn> Transaction::findPlugInByPathURL(const std::string& text) {
  const std::optional<tn::URL> url = tn::URL::parse(text);
  if (!url) return nullptr;
  return server()->findPlugInAtPath(*url);
}

tn::Dictionary Transaction::annotationForForm(const TNDPlugIn& plugIn) {
  std::optional<tn::Dictionary> annotation = server()->annotationForPlugIn(plugIn);
  if (annotation) return std::move(*annotation);
  return pluginShouldBeAutoEnabled(plugIn) ? tn::Dictionary{{"election", tn::Value(1)}} : tn::Dictionary();
}

std::shared_ptr<TNDPlugIn> Transaction::findPlugInByFallbackPath(const tn::UUID& uuid, const tn::Value& path) {
  TN_LOG_INFO(tn::log::traffic(), "Failed to find plugin by {}", uuid.string());
  const std::string* text = path.string();
  if (!text) return nullptr;
  TN_LOG_INFO(tn::log::traffic(), "Looking for plugin {} by path {}", uuid.string(), *text);
  // A file-system path, unlike "find"'s URL. Only an absolute one without a
  // NUL names a bundle: the daemon's working directory means nothing to the
  // client.
  if (text->empty() || text->front() != '/' || text->find('\0') != std::string::npos) return nullptr;
  return server()->findPlugInAtPath(tn::URL::fileURLWithPath(*text));
}

bool Transaction::processUuidList(const PlugInOperation& operation) {
  const tn::Array* uuids = relay_dictionary_get_array(request(), "uuids");
  if (!uuids) {
    fail(kErrorInvalidRequest, std::string("invalid request format (uuid)"));
    return false;
  }
  const tn::Array* paths = fallbackPaths(request(), uuids->size());
  for (size_t i = 0; i < uuids->size(); ++i) {
    // A UUID value always holds its 16 bytes, so "invalid request (uuid
    // allocation failure)" cannot happen here.
    const std::optional<tn::UUID> uuid = (*uuids)[i].uuid();
    if (!uuid) {
      fail(kErrorInvalidRequest, std::string("invalid request (bad uuid array)"));
      return false;
    }
    std::shared_ptr<TNDPlugIn> plugIn = server()->findPlugIn(*uuid);
    if (!plugIn && paths) plugIn = findPlugInByFallbackPath(*uuid, (*paths)[i]);
    if (!plugIn) {
      fail(kErrorInvalidRequest, std::string("no such plugin (uuid not found)"));
      return false;
    }
    if (!operation(plugIn)) return false;
  }
  return true;
}

bool Transaction::pluginShouldBeAutoEnabled(const TNDPlugIn& /*plugIn*/) { return false; }

void Transaction::findPlugIn() {
  std::shared_ptr<TNDPlugIn> plugIn;
  if (const std::optional<tn::UUID> uuid = relay_dictionary_get_uuid(request(), "uuids")) {
    plugIn = findPlugInByUUID(*uuid);
  }
  // When both are given, the path decides.
  if (const std::string* path = relay_dictionary_get_string(request(), "paths")) plugIn = findPlugInByPathURL(*path);
  if (!plugIn) {
    TN_LOG_DEFAULT(tn::log::ops(), "plugin not found");
    fail(kErrorNotFound, std::string("Cannot locate PlugIn"));
    return;
  }
  TN_LOG_DEFAULT(tn::log::ops(), "plugin found {}", describe(*plugIn));

  // The record keeps everything of its form but the annotation.
  const tn::Value encoded = plugIn->encodedForm(annotationForForm(*plugIn));
  if (version() == kCurrentProtocolVersion) reply().set("matches", encoded);
  done();
}

}  // namespace tnd
