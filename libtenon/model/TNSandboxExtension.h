#pragma once

// Sandbox extensions as the plug-in model uses them: issuing a file
// extension for a URL and a service-lookup extension for a plug-in's service
// name, and TNSandboxExtension, the holder of one token that consumes it into
// this process and releases it again.
//
// The tokens come from platform/sandbox (Extensions.h); errors carry the
// sandbox's errno-style code, which callers log as the failure's code.

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <string_view>

#include "platform/value/Result.h"
#include "platform/value/URL.h"

namespace tn {

// The class of every service-lookup extension the daemon issues.
inline constexpr std::string_view kPlugInServiceExtensionClass = "com.ostrel.tenon.plugin-service";

// A read-only file extension for the URL's path, naming its canonical path.
// Logged at debug level on "sandbox" when issued; a failure is the caller's
// to log.
Result<std::string> issueFileExtension(const URL& url);

// The canonical path of a resource a plug-in's manifest names inside its
// bundle, or why it is refused. resource must be "." (the bundle itself) or
// a relative path without NUL and without ".." components, and its
// canonical path (links resolved) must be the bundle's canonical path or lie
// below it. Refusals are errors of domain "Sandbox" with code EPERM and a
// message saying why; a resource that does not exist (or cannot be
// resolved) is the errno of the resolution (ENOENT, ...).
Result<std::string> bundleResourcePath(std::string_view bundlePath, std::string_view resource);

// A read-only file extension for a resource of the bundle: the token names
// exactly the canonical path bundleResourcePath() checked, so a link changed
// afterwards cannot widen it. Errors as bundleResourcePath's, or the
// issuer's. Logged like issueFileExtension.
Result<std::string> issueBundleResourceExtension(const URL& bundle, std::string_view resource);

// The same for a canonical path that bundleResourcePath() has already
// answered (a caller that keeps those answers resolves each only once).
Result<std::string> issueCheckedResourceExtension(std::string_view canonicalPath);

// A service-lookup extension of class "com.ostrel.tenon.plugin-service" for
// the service name. Logged like issueFileExtension.
Result<std::string> issueServiceExtension(std::string_view serviceName);

// One extension token and, once consumed, the handle of its grant. A holder
// is consumed and released by one thread at a time; destroying a consumed
// holder releases it.
class TNSandboxExtension {
 public:
  static constexpr int64_t kNotConsumed = -1;

  // A holder of token, not consumed.
  explicit TNSandboxExtension(std::string token);
  ~TNSandboxExtension();
  TNSandboxExtension(const TNSandboxExtension&) = delete;
  TNSandboxExtension& operator=(const TNSandboxExtension&) = delete;

  const std::string& token() const { return token_; }
  int64_t handle() const { return handle_.load(); }
  bool isConsumed() const { return handle() != kNotConsumed; }

  // Consumes the token unless it is consumed already. A refused token leaves
  // the holder not consumed (logged with the error code), so it may be tried
  // again.
  void consume();

  // Releases a consumed token; does nothing otherwise. The holder is not
  // consumed afterwards, whether or not the release succeeded (a failure is
  // logged; the handle is not kept for a retry).
  void expel();

  // Equal tokens, whatever the handles.
  bool isEqual(const TNSandboxExtension* other) const { return other != nullptr && other->token_ == token_; }
  friend bool operator==(const TNSandboxExtension& a, const TNSandboxExtension& b) { return a.isEqual(&b); }

 private:
  const std::string token_;
  std::atomic<int64_t> handle_{kNotConsumed};
};

}  // namespace tn
