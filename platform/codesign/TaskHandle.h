#pragma once

// TaskHandle: a process together with the entitlements it was found to have
// when the handle was made. The connection layer makes one per connection,
// from the identity it captured at accept time; entitlements are loaded
// once, then, so a document changing later does not change what an open
// connection may do.

#include <string_view>

#include "platform/codesign/ProcessIdentity.h"
#include "platform/codesign/TrustSettings.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace codesign {

class TaskHandle {
 public:
  // Loads the entitlements of identity.executablePath (loadEntitlements), with
  // the settings of the environment or the ones given. Never fails: what
  // cannot be trusted is logged and left out.
  explicit TaskHandle(ProcessIdentity identity);
  TaskHandle(ProcessIdentity identity, const TrustSettings& settings);

  const ProcessIdentity& identity() const { return identity_; }

  // Every entitlement granted: a dictionary value, possibly empty.
  const tn::Value& entitlements() const { return entitlements_; }

 private:
  ProcessIdentity identity_;
  tn::Value entitlements_;
};

// The value of entitlement key for the process: null when it is not granted.
// A NoExecutable error (kCodesignErrorDomain) when the handle was made
// without an executable path, so the question could not be asked at all.
tn::Result<tn::Value> entitlementValue(const TaskHandle& task, std::string_view key);

}  // namespace codesign
