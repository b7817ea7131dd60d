#pragma once

// TaskHandle: a process together with the entitlements it was found to have
// when the handle was made. The daemon makes one per connection, from the
// identity the connection layer captured at accept time and the file the
// process runs (opened through /proc/<pid>/exe); entitlements are loaded
// once, then, so a document changing later does not change what an open
// connection may do. Whether the process still runs that file is for the
// owner of the handle to check (it knows the process, this folder does not).

#include <string_view>

#include "platform/codesign/ProcessIdentity.h"
#include "platform/codesign/TrustSettings.h"
#include "platform/value/Result.h"
#include "platform/value/Value.h"

namespace codesign {

class TaskHandle {
 public:
  // Loads the entitlements of the file open as executableFd (loadEntitlements;
  // -1 when the process's executable could not be opened: no entitlements),
  // with the settings of the environment or the ones given, and records that
  // file's identity in identity().executableFile. Never fails: what cannot
  // be trusted is logged and left out. executableFd is not kept.
  TaskHandle(ProcessIdentity identity, int executableFd);
  TaskHandle(ProcessIdentity identity, int executableFd, const TrustSettings& settings);

  const ProcessIdentity& identity() const { return identity_; }

  // Every entitlement granted: a dictionary value, possibly empty.
  const tn::Value& entitlements() const { return entitlements_; }

 private:
  ProcessIdentity identity_;
  tn::Value entitlements_;
};

// The value of entitlement key for the process: null when it is not granted.
// A NoExecutable error (kCodesignErrorDomain) when the handle was made
// without an executable (no path, or a file that could not be opened), so
// the question could not be asked at all.
tn::Result<tn::Value> entitlementValue(const TaskHandle& task, std::string_view key);

}  // namespace codesign
