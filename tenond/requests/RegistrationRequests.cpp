// "add", "remove" and "bulk": clients acting on the registrar directly.
// Each walks its paths in order and stops at the first failure; what was
// done for earlier paths stays done.

#include "platform/log/Escape.h"
#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"
#include "platform/value/URL.h"
#include "tenond/requests/Transaction.h"
#include "tenond/server/TNDRelayClient.h"
#include "tenond/server/TNDServer.h"

namespace tnd {

void Transaction::addPlugIns() {
  processPaths([this](const std::string& path, bool resolved) {
    if (!resolved) {
      fail(kErrorBadPath, fmt::format("invalid plugin path: {}", tn::log::escapeText(path)));
      return false;
    }
    TN_PROBE_PLUGIN_ADD(path.c_str());
    if (server()->addPlugIn(tn::URL::fileURLWithPath(path))) {
      TN_LOG_DEFAULT(tn::log::ops(), "failed to register plug-in at {}", path);
      fail(kErrorRegistration, fmt::format("unable to register plug-in at {}", path));
      return false;
    }
    return true;
  });
}

void Transaction::removePlugIns() {
  processPaths([this](const std::string& path, bool resolved) {
    TN_PROBE_PLUGIN_REMOVE(path.c_str(), resolved);
    // The program must hold the manager entitlement and its user be
    // privileged; both refusals look alike to the peer.
    if (!client_->mayManage()) {
      TN_LOG_DEFAULT(tn::log::defaultLog(),
                     "refused request from pid={} to remove plug-in at {} - client lacks required entitlement",
                     client_->pid(), path);
      fail(kErrorNotPermitted, std::string("caller lacks entitlement for this operation"));
      return false;
    }
    // A path with a NUL names nothing; the registrar never sees it.
    const bool namesNothing = !resolved && path.find('\0') != std::string::npos;
    if (namesNothing || server()->removePlugIn(tn::URL::fileURLWithPath(path))) {
      fail(kErrorBadPath, fmt::format("no plugin at {}", tn::log::escapeText(path)));
      return false;
    }
    return true;
  });
}

void Transaction::bulkPlugIns() {
  const uint64_t flags = relay_dictionary_get_uint64(request(), "flags").value_or(0);
  TN_LOG_INFO(tn::log::ops(), "bulk options {:#x} not supported", flags);
  done();
}

}  // namespace tnd
