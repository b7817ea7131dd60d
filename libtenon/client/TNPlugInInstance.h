#pragma once

// TNPlugInInstance: what a plug-in program started by the supervisor uses
// to talk to the platform about itself.
//
//   tn::TNPlugInInstance instance;
//   int socket = tn::TNPlugInInstance::hostSocket();   // from TENON_PLUGIN_SOCKET
//   instance.declareBusy();   // while working on a request
//   instance.declareIdle();
//
// Busy and idle go to the busy-assertion service ("com.ostrel.tenon.vigil"),
// which knows the instance by its process: only processes the supervisor
// started are accepted. The assertion lasts until declareIdle(), the
// object's destruction (its connection closes) or the process's exit.
//
// Threads: one thread at a time; each call waits for the service's answer.

#include <chrono>
#include <memory>
#include <optional>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "platform/value/Result.h"

namespace tn {

class TNPlugInInstance {
 public:
  TNPlugInInstance();
  ~TNPlugInInstance();
  TNPlugInInstance(const TNPlugInInstance&) = delete;
  TNPlugInInstance& operator=(const TNPlugInInstance&) = delete;

  // The descriptor TENON_PLUGIN_SOCKET names: the plug-in's end of the
  // socket whose other end its host holds. None when the variable is
  // missing or not a descriptor number.
  static std::optional<int> hostSocket();

  // Errors: the relay's (the service cannot be reached), or the service's
  // refusal (domain "vigil", code and message from its reply).
  Result<void> declareBusy();
  Result<void> declareIdle();

 private:
  Result<void> declare(const char* request);

  std::shared_ptr<dispatch::SerialQueue> queue_;
  std::shared_ptr<relay::Connection> connection_;
};

}  // namespace tn
