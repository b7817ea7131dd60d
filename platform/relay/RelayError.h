// RelayError: the errors of the relay (domain "relay").
//
// Reply handlers receive them in place of a reply (ConnectionInvalid,
// ConnectionInterrupted, or a local refusal of the request), and the
// factories of listeners and connections return them.

#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "platform/value/Error.h"

namespace relay {

inline constexpr std::string_view kRelayErrorDomain = "relay";

// Error codes of domain kRelayErrorDomain. Stable: tests and clients compare them.
enum class RelayErrorCode : int64_t {
  ConnectionInvalid = 1,      // the connection ended for good (peer gone, cancelled, violation)
  ConnectionInterrupted = 2,  // a client connection lost its service; it reconnects on next send
  ProtocolViolation = 3,      // a frame broke the wire rules
  MessageTooLarge = 4,        // an outgoing body does not fit in one frame
  NotAMessage = 5,            // an outgoing body that is not a dictionary
  InvalidServiceName = 6,     // empty, ".", "..", contains '/' or NUL, or too long for a socket path
  ServiceUnavailable = 7,     // nothing listens on the service's socket
  SystemError = 8,            // a system call failed (the message names it and errno)
  PeerUnidentified = 9,       // the peer's identity could not be established
  BadDescriptors = 10,        // more than kMaxDescriptorsPerFrame outgoing descriptors, or an invalid one
};

tn::Error makeRelayError(RelayErrorCode code, std::string message);

// makeRelayError(SystemError) with "<what>: <strerror(errnoValue)>".
tn::Error makeSystemError(std::string_view what, int errnoValue);

// True when error is a relay error with that code.
bool isRelayError(const tn::Error& error, RelayErrorCode code);

}  // namespace relay
