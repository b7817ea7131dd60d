#include "tenond/requests/Transaction.h"

#include <climits>
#include <cstdlib>
#include <cstring>

#include "platform/log/Escape.h"
#include "platform/log/Log.h"
#include "platform/log/LogContext.h"
#include "platform/relay/RelayError.h"
#include "platform/value/MessageValue.h"
#include "tenond/server/TNDRelayClient.h"
#include "tenond/server/TNDServer.h"

namespace tnd {

// The request types, tested in this order by exact byte equality.
const Transaction::Route Transaction::kRoutes[] = {
    {"add", &Transaction::addPlugIns},     {"remove", &Transaction::removePlugIns},
    {"bulk", &Transaction::bulkPlugIns},   {"match", &Transaction::matchPlugIns},
    {"ready", &Transaction::readyPlugIns}, {"access", &Transaction::accessPlugIns},
    {"annotate", &Transaction::annotatePlugIns}, {"bulk-annotate", &Transaction::bulkAnnotatePlugIns},
    {"lock", &Transaction::lockDownPlugIns}, {"find", &Transaction::findPlugIn},
    // Tenon's own, beyond the ten request types: why a plug-in is or is not
    // offered to a host.
    {"explain", &Transaction::explainPlugIn},
};

Transaction::Transaction(relay::Message request, std::shared_ptr<TNDRelayClient> client)
    : client_(std::move(client)), request_(std::move(request)) {}

std::shared_ptr<TNDServer> Transaction::server() const { return client_->server(); }
std::shared_ptr<relay::Connection> Transaction::connection() const { return client_->connection(); }

void Transaction::dispatch() {
  // Lines logged for this request are rate-limited per client (docs/logging.md).
  const tn::log::ContextScope logContext(static_cast<tn::log::ContextId>(client_->pid()));
  const std::string* type = relay_dictionary_get_string(request(), "request");
  version_ = relay_dictionary_get_uint64(request(), "version").value_or(0);

  // The version test comes first, so even a dead client's request gets its
  // (undeliverable) version error.
  if ((version_ & ~uint64_t{1}) != 2) {
    fail(kErrorProtocolVersion, fmt::format("unsupported protocol version {} (current {})",
                                            static_cast<int32_t>(version_), kCurrentProtocolVersion));
    return;
  }
  if (!client_->acceptWork()) return;

  TN_LOG_DEBUG(tn::log::ops(), "client {} requested {}", client_->pid(), type ? *type : std::string("(null)"));
  TN_PROBE_REQUEST(client_->pid(), type ? type->c_str() : nullptr);
  route(type);
}

void Transaction::route(const std::string* type) {
  if (!type) {
    fail(kErrorInvalidRequest, std::string("invalid request format (missing type)"));
    return;
  }
  for (const Route& r : kRoutes) {
    if (*type == r.type) {
      (this->*r.operation)();
      return;
    }
  }
  unrecognized();
}

void Transaction::unrecognized() { fail(kErrorInvalidRequest, std::string("unrecognized request")); }

namespace {

// Replies whose payload reaches this size are encoded and written on the
// connection's queue; smaller ones at once. Handing a reply to another queue
// costs a thread wake-up, more than encoding and writing a few kilobytes
// (docs/performance.md): a lookup's reply (one form, 1-2 KB) is sent where
// it was made, while a discovery of thousands of plug-ins (megabytes) does
// not hold the queue every client shares while its bytes are copied.
constexpr std::size_t kInlineReplyBytes = 16 * 1024;

// The bytes a reply's top-level strings and data carry: what its encoding
// costs, near enough, since forms travel as data (the typed encoding).
std::size_t payloadBytes(const tn::Dictionary& reply) {
  std::size_t bytes = 0;
  for (const auto& [key, value] : reply) {
    bytes += key.size();
    if (const tn::Bytes* data = value.data()) bytes += data->size();
    if (const std::string* text = value.string()) bytes += text->size();
    if (const tn::Array* array = value.array()) bytes += array->size() * 64;
  }
  return bytes;
}

}  // namespace

void Transaction::done() {
  saveStoredAnnotations();
  const bool large = payloadBytes(reply_) >= kInlineReplyBytes;
  tn::Value reply(reply_);
  TN_PROBE_REQUEST_OUTPUT(client_->pid(), [&] { return reply.description(); });
  const std::shared_ptr<relay::Connection> c = connection();
  if (!c) {
    request_.charge.reset();
    return;
  }
  std::atomic<uint32_t>& queued = client_->queuedReplies();
  if (!large && queued.load() == 0) {
    sendReply(*c, std::move(reply));
    return;
  }
  ++queued;
  c->eventQueue()->async([self = shared_from_this(), c, reply = std::move(reply)]() mutable {
    self->sendReply(*c, std::move(reply));
    --self->client_->queuedReplies();
  });
}

void Transaction::sendReply(relay::Connection& connection, tn::Value reply) {
  tn::Result<void> sent = connection.trySendReply(request_, std::move(reply));
  if (!sent && relay::isRelayError(sent.error(), relay::RelayErrorCode::MessageTooLarge)) {
    sendReplyTooLarge(connection, sent.error());
  }
  request_.charge.reset();
}

void Transaction::sendReplyTooLarge(relay::Connection& connection, const tn::Error& error) {
  const std::string* type = relay_dictionary_get_string(request(), "request");
  TN_LOG_ERROR(tn::log::ops(), "reply to client {} for {} not sent: {}", client_->pid(),
               type ? *type : std::string("(null)"), error.localizedDescription());
  const tn::Dictionary replacement{
      {"errorcode", tn::Value(uint64_t{kErrorReplyTooLarge})},
      {"error", tn::Value(fmt::format("reply too large: {}; ask for less", error.localizedDescription()))}};
  TN_PROBE_REQUEST_OUTPUT(client_->pid(), [&] { return tn::Value(replacement).description(); });
  (void)connection.trySendReply(request_, tn::Value(replacement));
}

void Transaction::fail(uint64_t code, const std::optional<std::string>& message) {
  reply_.set("errorcode", code);
  if (message) reply_.set("error", *message);
  done();
}

void Transaction::fail(uint64_t defaultCode, const tn::Error& error) {
  if (error.domain() == tn::kTenonErrorDomain)
    fail(static_cast<uint64_t>(error.code()), error.message());
  else
    fail(defaultCode, error.localizedDescription());
}

bool Transaction::marshalPaths(const PathOperation& operation) {
  const tn::Array* paths = relay_dictionary_get_array(request(), "paths");
  if (!paths) {
    fail(kErrorInvalidRequest, std::string("invalid request format"));
    return false;
  }
  for (const tn::Value& element : *paths) {
    const std::string* path = element.string();
    if (!path) {
      fail(kErrorInvalidRequest, std::string("invalid request format"));
      return false;
    }
    if (path->empty() || path->front() != '/') {
      fail(kErrorBadPath, fmt::format("absolute path required: {}", tn::log::escapeText(*path)));
      return false;
    }
    // A path that does not exist, or whose canonical form would not fit the
    // 1024 bytes the daemon allows, goes on unresolved. So does a path with
    // a NUL: it names nothing, and realpath would see only its first part.
    char resolved[PATH_MAX];
    const bool ok = path->find('\0') == std::string::npos && realpath(path->c_str(), resolved) != nullptr &&
                    std::strlen(resolved) < 1024;
    if (!operation(ok ? std::string(resolved) : *path, ok)) return false;
  }
  return true;
}

bool Transaction::processPaths(const PathOperation& operation) {
  if (!marshalPaths(operation)) return false;
  done();
  return true;
}

}  // namespace tnd
