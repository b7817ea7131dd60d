// "annotate" and "bulk-annotate": the user's choices about plug-ins (the
// election and an extension dictionary), stored through the database.
//
// Any client may send them. Neither is atomic: a request that fails
// half-way keeps what it stored for the plug-ins before the failure, but
// posts no change notification. Every change a request made is in the
// annotation file before its reply leaves (and before its notification):
// the request defers the saves of its stores and writes the file once, in
// done() at the latest.

#include <variant>

#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"
#include "tenond/database/TNDAnnotationStore.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDRelayClient.h"
#include "tenond/server/TNDServer.h"

namespace tnd {
namespace {

const char* const kBadAnnotations = "invalid request format (bad annotations dictionary)";

// The change "annotate" applies: `election` (a number) and `extension` (a
// dictionary) taken from the request's dictionary, any other key ignored.
// Else the message of the first check that fails. An extension the
// annotation file could not carry (too large, too deep, a date without a
// written form) fails like one of the wrong type, before anything is stored.
std::variant<tn::Dictionary, std::string> annotationChange(const tn::Dictionary& annotations) {
  tn::Dictionary change;
  if (const tn::Value* election = annotations.find("election")) {
    if (!election->isNumber()) return std::string("invalid request format (annotation election)");
    change.set("election", *election);
  }
  if (const tn::Value* extension = annotations.find("extension")) {
    if (!extension->isDictionary()) return std::string("invalid request format (annotation extension)");
    change.set("extension", *extension);
    const tn::Result<size_t> size = TNDAnnotationStore::encodedEntrySize(change);
    if (!size || *size > TNDAnnotationStore::kMaxEntrySize) {
      return std::string("invalid request format (annotation extension)");
    }
  }
  return change;
}

// The request's `annotations` as an in-memory dictionary; none, with the
// request failed, when it is absent or not a dictionary.
std::optional<tn::Value> annotationsOf(Transaction& transaction) {
  const tn::Dictionary* annotations = relay_dictionary_get_dictionary(transaction.request(), "annotations");
  if (!annotations) {
    transaction.fail(kErrorInvalidRequest, std::string(kBadAnnotations));
    return std::nullopt;
  }
  return tn::convertMessageToMemory(tn::Value(*annotations));
}

}  // namespace

std::optional<tn::Error> Transaction::storeAnnotation(const tn::Dictionary& change, const TNDPlugIn& plugIn) {
  annotationsUnsaved_ = true;
  return server()->setAnnotation(change, plugIn, TNDatabase::AnnotationSave::Deferred);
}

void Transaction::saveStoredAnnotations() {
  if (!annotationsUnsaved_) return;
  annotationsUnsaved_ = false;
  server()->saveAnnotations();
}

void Transaction::annotatePlugIns() {
  const std::optional<tn::Value> annotations = annotationsOf(*this);
  if (!annotations) return;
  std::variant<tn::Dictionary, std::string> checked = annotationChange(*annotations->dictionary());
  if (const std::string* message = std::get_if<std::string>(&checked)) {
    fail(kErrorInvalidRequest, *message);
    return;
  }
  const tn::Dictionary& change = std::get<tn::Dictionary>(checked);
  if (change.empty()) {  // nothing to do: `uuids` is not even read
    done();
    return;
  }
  const tn::Value described(change);
  const bool walked = processUuidList([&](const std::shared_ptr<TNDPlugIn>& plugIn) {
    TN_LOG_DEBUG(tn::log::ops(), "client {} plug-in {}({}) annotation change: {}", client_->pid(),
                 plugIn->identifierText(), plugIn->uuidText(), described);
    if (const tn::Value* election = change.find("election")) {
      TN_LOG_INFO(tn::log::ops(), "client {} plug-in {}({}) election := {}", client_->pid(), plugIn->identifierText(),
                  plugIn->uuidText(), *election);
    }
    if (std::optional<tn::Error> refused = storeAnnotation(change, *plugIn)) {
      fail(kErrorInvalidRequest, refused->message());
      return false;
    }
    return true;
  });
  if (!walked) return;
  saveStoredAnnotations();
  server()->notifyAnnotationChange();
  done();
}

void Transaction::bulkAnnotatePlugIns() {
  const std::optional<tn::Value> annotations = annotationsOf(*this);
  if (!annotations) return;
  TN_LOG_DEBUG(tn::log::ops(), "bulk change requested for {} plug-ins", annotations->dictionary()->size());
  for (const auto& [key, value] : *annotations->dictionary()) {
    if (!value.isDictionary()) {
      fail(kErrorBadValue, std::string("annotations values must be dictionaries"));
      return;
    }
    const std::optional<tn::UUID> uuid = tn::UUID::parse(key);  // either letter case
    if (!uuid) {
      fail(kErrorBadValue, std::string("invalid plug-in UUID value"));
      return;
    }
    const std::shared_ptr<TNDPlugIn> plugIn = server()->findPlugIn(*uuid);
    if (!plugIn) {
      fail(kErrorRegistration, std::string("no plug-in with the requested uuid"));
      return;
    }
    TN_LOG_DEBUG(tn::log::ops(), "client {} bulk plug-in {}({}) annotation change: {}", client_->pid(),
                 plugIn->identifierText(), plugIn->uuidText(), value);
    // Only `extension` is replaced; the stored election stays.
    if (std::optional<tn::Error> refused = storeAnnotation(tn::Dictionary{{"extension", value}}, *plugIn)) {
      fail(kErrorBadValue, refused->message());
      return;
    }
  }
  saveStoredAnnotations();
  server()->notifyAnnotationChange();
  done();
}

}  // namespace tnd
