// The operations of TNDaemonClient: one request type each, built from the
// building blocks in TNDaemonClient.cpp. Argument dictionaries and arrays go
// out as message values made by the plain conversion.

#include <utility>

#include "libtenon/client/TNDaemonClient.h"
#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"

namespace tn {
namespace {

// Stores the plain conversion of `value` under `key`; a value without a
// message counterpart leaves the key out.
void setConverted(Dictionary& request, const char* key, const Value& value) {
  Value message = convertMemoryToMessage(value);
  if (!message.isNull()) request.set(key, std::move(message));
}

}  // namespace

void TNDaemonClient::addPlugIns(const std::vector<std::string>& paths, ReplyBlock reply) {
  send(request("add", paths), std::move(reply));
}

void TNDaemonClient::removePlugIns(const std::vector<std::string>& paths, ReplyBlock reply) {
  send(request("remove", paths), std::move(reply));
}

void TNDaemonClient::bulkPlugins(uint64_t flags, ReplyBlock reply) {
  Dictionary request = this->request("bulk");
  request.set("flags", Value(flags));
  send(std::move(request), std::move(reply));
}

void TNDaemonClient::readyPlugIns(const PlugInsByPath& plugins, uint64_t flags,
                                  const std::optional<Dictionary>& environment, ReplyBlock reply) {
  Dictionary request = this->request("ready");
  request.set("flags", Value(flags));
  // Only a given environment is sent: its mere presence asks the daemon for
  // the host entitlement that permits it.
  if (environment) setConverted(request, "environment", Value(*environment));
  set(request, plugins);
  send(std::move(request), std::move(reply));
}

void TNDaemonClient::accessPlugIns(const PlugInsByPath& plugins, uint64_t flags, ReplyBlock reply) {
  Dictionary request = this->request("access");
  request.set("flags", Value(flags));
  set(request, plugins);
  send(std::move(request), std::move(reply));
}

void TNDaemonClient::findPlugInByUUID(const UUID& uuid, ReplyBlock reply) {
  TN_LOG_DEFAULT(log::ops(), "findPlugInByUUID {}", uuid);
  Dictionary request = this->request("find");
  request.set("uuids", Value(uuid));
  send(std::move(request), std::move(reply));
}

void TNDaemonClient::findPlugInByPathURL(const URL& url, ReplyBlock reply) {
  TN_LOG_DEFAULT(log::ops(), "findPlugInByPathURL {}", url);
  Dictionary request = this->request("find");
  request.set("paths", Value(url.absoluteString()));
  send(std::move(request), std::move(reply));
}

void TNDaemonClient::matchPlugIns(const Dictionary& rules, uint64_t flags, ReplyBlock reply) {
  Dictionary request = this->request("match");
  setConverted(request, "rules", Value(rules));
  request.set("flags", Value(flags));
  send(std::move(request), std::move(reply));
}

void TNDaemonClient::explainPlugIn(const ExplainedPlugIn& plugIn, const Dictionary& rules, uint64_t flags,
                                   const std::optional<std::string>& hostExecutable, ReplyBlock reply) {
  Dictionary request = this->request("explain");
  if (plugIn.uuid) request.set("uuids", Value(*plugIn.uuid));
  if (plugIn.path) request.set("paths", Value(*plugIn.path));
  setConverted(request, "rules", Value(rules));
  request.set("flags", Value(flags));
  if (hostExecutable) request.set("host", Value(*hostExecutable));
  send(std::move(request), std::move(reply));
}

void TNDaemonClient::setPluginAnnotations(const std::vector<UUID>& uuids, const Dictionary& annotations,
                                          ReplyBlock reply) {
  Dictionary request = this->request("annotate");
  set(request, uuids);
  setConverted(request, "annotations", Value(annotations));
  send(std::move(request), std::move(reply));
}

void TNDaemonClient::bulkSetPluginAnnotations(const Dictionary& annotations, ReplyBlock reply) {
  Dictionary request = this->request("bulk-annotate");
  setConverted(request, "annotations", Value(annotations));
  send(std::move(request), std::move(reply));
}

void TNDaemonClient::holdPlugins(const std::vector<std::string>& paths, uint64_t flags, ReplyBlock reply) {
  Dictionary request = this->request("lock", paths);
  request.set("flags", Value(flags));
  send(std::move(request), std::move(reply));
}

void TNDaemonClient::releaseHold(const UUID& token, ReplyBlock reply) {
  Dictionary request = this->request("lock");
  set(request, std::vector<UUID>{token});
  send(std::move(request), std::move(reply));
}

}  // namespace tn
