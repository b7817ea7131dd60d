#pragma once

// InternalInconsistency: the one exception of the codebase.
//
// Everywhere else failures are values. This one is different in kind: it
// reports that tenond broke its own protocol (a reply with an `error`
// message but no `errorcode`), which no caller can handle meaningfully and
// which must not be mistaken for success or for an ordinary daemon error.
// TNDaemonClient::errorInReply throws it so that the contract violation
// surfaces at once: thrown inside a reply block, it ends the process with a
// message naming the reply queue (SerialQueue aborts on a block that
// throws); a tool may catch it and report it as a failure.

#include <stdexcept>

namespace tn {

class InternalInconsistency : public std::logic_error {
 public:
  using std::logic_error::logic_error;
};

}  // namespace tn
