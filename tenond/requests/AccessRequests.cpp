// "access": a read-only sandbox file extension for the bundle of each named
// plug-in, in the order of the request's `uuids`. It checks neither holds nor
// host authorization: a host that names a plug-in may read its files. Not
// atomic: tokens issued before a failure stay issued and are not returned.

#include <fmt/format.h>

#include "libtenon/model/TNSandboxExtension.h"
#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"
#include "tenond/plugin/TNDPlugIn.h"
#include "tenond/requests/Transaction.h"

namespace tnd {

void Transaction::accessPlugIns() {
  tn::Array tokens;
  const bool walked = processUuidList([&](const std::shared_ptr<TNDPlugIn>& plugIn) {
    const std::optional<tn::URL> bundle = plugIn->url();
    tn::Result<std::string> token =
        bundle ? tn::issueFileExtension(*bundle)
               : tn::Result<std::string>(tn::Error(std::string(tn::kTenonErrorDomain), ENOENT, "no bundle"));
    if (!token) {
      fail(kErrorInvalidRequest, fmt::format("cannot create file extension to {}: {}",
                                             bundle ? bundle->path() : std::string("(null)"), token.error().code()));
      return false;
    }
    tokens.push_back(tn::Value(std::move(*token)));
    return true;
  });
  if (!walked) return;
  reply().set("extensions", tn::convertMemoryToMessage(tn::Value(std::move(tokens))));
  done();
}

}  // namespace tnd
