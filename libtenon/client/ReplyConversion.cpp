// Reading replies: the error a reply reports, and the typed encoding of the
// plug-in forms that "find" and "match" return.

#include <fmt/format.h>

#include "libtenon/client/InternalInconsistency.h"
#include "libtenon/client/TNDaemonClient.h"
#include "platform/log/Log.h"
#include "platform/value/MessageValue.h"
#include "platform/value/TypedEncoding.h"

namespace tn {
namespace {

// The code a failed connection reports, like a malformed request: the
// request did not get an answer from the daemon.
constexpr int64_t kConnectionErrorCode = 4;

}  // namespace

std::optional<Error> TNDaemonClient::errorInReply(const relay::Reply& reply) {
  if (!reply) return TNMakeError(kConnectionErrorCode, reply.error().localizedDescription());

  const uint64_t code = relay_dictionary_get_uint64(*reply, "errorcode").value_or(0);
  const std::string* message = relay_dictionary_get_string(*reply, "error");
  if (code == 0 && !message) return std::nullopt;
  if (code == 0) {
    // A message without a code is neither a success nor an error the caller
    // could act on: the daemon broke the protocol (see InternalInconsistency.h).
    throw InternalInconsistency(fmt::format("tenond reported error without a code: {}", *message));
  }
  if (!message) return TNMakeError(static_cast<int64_t>(code), std::string("unknown error returned by Tenon subsystem"));
  return TNMakeError(static_cast<int64_t>(code), *message);
}

Value TNDaemonClient::convertFromRelay(const Value& message) const {
  if (protocolVersion_ != kCurrentProtocolVersion || message.isNull()) return Value();
  Result<Value> decoded = decodeTyped(message);
  if (!decoded) {
    TN_LOG_ERROR(log::ops(), "cannot decode typed value from tenond: {}", decoded.error());
    return Value();
  }
  return std::move(decoded).value();
}

Value TNDaemonClient::convertToRelay(const Value& value, uint64_t version) {
  if (version != kCurrentProtocolVersion) return Value();
  return encodeTyped(value);
}

}  // namespace tn
