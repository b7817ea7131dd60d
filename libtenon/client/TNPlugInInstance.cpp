#include "libtenon/client/TNPlugInInstance.h"

#include <charconv>
#include <cstdlib>
#include <cstring>

#include "libtenon/client/BlockingReply.h"

namespace tn {
namespace {

constexpr const char* kVigilService = "com.ostrel.tenon.vigil";
constexpr std::chrono::seconds kPatience{10};

}  // namespace

TNPlugInInstance::TNPlugInInstance() : queue_(dispatch::SerialQueue::create("plug-in instance")) {}

TNPlugInInstance::~TNPlugInInstance() {
  if (connection_) connection_->cancel();
}

std::optional<int> TNPlugInInstance::hostSocket() {
  const char* text = std::getenv("TENON_PLUGIN_SOCKET");
  if (text == nullptr) return std::nullopt;
  int fd = -1;
  const char* end = text + std::strlen(text);
  const auto [ptr, error] = std::from_chars(text, end, fd);
  if (error != std::errc() || ptr != end || fd < 0) return std::nullopt;
  return fd;
}

Result<void> TNPlugInInstance::declareBusy() { return declare("busy"); }

Result<void> TNPlugInInstance::declareIdle() { return declare("idle"); }

Result<void> TNPlugInInstance::declare(const char* request) {
  if (!connection_) {
    Result<std::shared_ptr<relay::Connection>> connected = relay::Connection::connectToService(kVigilService, queue_);
    if (!connected.ok()) return connected.error();
    connection_ = std::move(*connected);
    connection_->setEventHandler([](const relay::Event&) {});
    connection_->resume();
  }
  BlockingReply pending;
  connection_->sendWithReply(Dictionary{{"request", request}}, queue_, pending.block());
  relay::Reply reply = pending.wait(kPatience);
  if (!reply.ok()) return reply.error();
  if (const std::optional<uint64_t> code = (*reply)["errorcode"].uint64()) {
    const std::string* message = (*reply)["error"].string();
    return Error("vigil", static_cast<int64_t>(*code), message != nullptr ? *message : std::string());
  }
  return {};
}

}  // namespace tn
