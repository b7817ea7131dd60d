// "find": one known plug-in by UUID or by bundle URL, without matching or
// policy, as its form with the user's annotation and the sandbox extensions
// a host needs.

#include "libtenon/client/TNDaemonClient.h"
#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDServer.h"

namespace tnd {
namespace {

std::string describe(const TNDPlugIn& plugIn) {
  return fmt::format("{} {} {}", plugIn.identifier().value_or("(null)"),
                     plugIn.uuid() ? plugIn.uuid()->string() : std::string("(null)"), plugIn.path().value_or(""));
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

void Transaction::addAnnotationForPlugIn(const TNDPlugIn& plugIn, tn::Dictionary& form) {
  std::optional<tn::Dictionary> annotation = server()->annotationForPlugIn(plugIn);
  if (!annotation) {
    annotation = pluginShouldBeAutoEnabled(plugIn) ? tn::Dictionary{{"election", tn::Value(1)}} : tn::Dictionary();
  }
  form.set("annotations", tn::Value(std::move(*annotation)));
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

  tn::Dictionary form;
  if (tn::Result<tn::Dictionary> exported = plugIn->exportForm(); exported.ok()) {
    form = std::move(*exported);
  } else {
    TN_LOG_ERROR(tn::log::ops(), "failed to export matching plug-in {}: {}",
                 plugIn->uuid() ? plugIn->uuid()->string() : std::string("(null)"), exported.error().description());
  }
  addAnnotationForPlugIn(*plugIn, form);
  plugIn->augmentForm(form);
  const tn::Value encoded = tn::TNDaemonClient::convertToRelay(tn::Value(std::move(form)), version());
  if (!encoded.isNull()) reply().set("matches", encoded);
  done();
}

}  // namespace tnd
