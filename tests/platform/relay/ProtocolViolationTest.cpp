// A peer that breaks a frame rule loses its own connection and nothing
// else: the server connection sees ConnectionInvalid, the peer sees its
// socket close, and another client is served before and after.

#include <gtest/gtest.h>

#include <atomic>
#include <thread>

#include "platform/dispatch/Semaphore.h"
#include "platform/relay/Frame.h"
#include "platform/relay/RelayError.h"
#include "tests/platform/relay/RelayTestSupport.h"

namespace relay {
namespace {

using test::Client;
using test::numbered;
using test::pathOf;
using test::RawClient;
using test::rawFrame;
using test::rawFrameWithBody;
using test::Recorder;
using test::Server;
using tn::dispatch::SerialQueue;

tn::Bytes concat(std::initializer_list<tn::Bytes> parts) {
  tn::Bytes all;
  for (const tn::Bytes& part : parts) all.insert(all.end(), part.begin(), part.end());
  return all;
}

tn::Bytes headerWithLength(uint32_t length) {
  tn::Bytes bytes = rawFrameWithBody(1, 0, {});
  storeBigEndian32(bytes.data(), length);
  return bytes;
}

struct Violation {
  const char* name;
  tn::Bytes bytes;
};

const tn::Value kEmpty = tn::Value(tn::Dictionary{});

class ProtocolViolationTest : public test::RelayTest, public ::testing::WithParamInterface<Violation> {};

TEST_P(ProtocolViolationTest, EndsOnlyTheOffendingConnection) {
  Server server("strict", Server::echo);
  Client good("strict");
  ASSERT_TRUE(good.request(numbered(1)).ok());
  RawClient bad(pathOf("strict"));
  bad.write(GetParam().bytes);
  EXPECT_TRUE(bad.waitForClose());
  ASSERT_TRUE(server.events(1).waitForKind(Event::Kind::ConnectionInvalid));
  const std::string reason = server.events(1).snapshot().back().reason;
  EXPECT_TRUE(log_->contains("traffic", tn::log::Level::Error, reason)) << reason;
  EXPECT_TRUE(good.request(numbered(2)).ok());
  EXPECT_EQ(server.events(0).count(Event::Kind::ConnectionInvalid), 0);
}

INSTANTIATE_TEST_SUITE_P(
    Frames, ProtocolViolationTest,
    ::testing::Values(Violation{"LengthBeyond16MiB", headerWithLength(kMaxFrameLength + 1)},
                      Violation{"LengthAtU32Maximum", headerWithLength(0xffffffffu)},
                      Violation{"LengthBelow16", headerWithLength(15)},
                      Violation{"IdZero", rawFrame(0, 0, kEmpty)},
                      Violation{"IdRepeated", concat({rawFrame(5, 0, kEmpty), rawFrame(5, 0, kEmpty)})},
                      Violation{"IdDecreasing", concat({rawFrame(5, 0, kEmpty), rawFrame(4, 0, kEmpty)})},
                      Violation{"TruncatedCbor", rawFrameWithBody(1, 0, {0xa1, 0x61})},
                      Violation{"EmptyBody", rawFrameWithBody(1, 0, {})},
                      Violation{"BodyNotAMap", rawFrame(1, 0, tn::Value(tn::Array{1, 2}))},
                      Violation{"NestedDeeperThan64", rawFrameWithBody(1, 0, test::nestedBody(65))},
                      Violation{"ReplyToUnknownId", rawFrame(1, 77, kEmpty)}),
    [](const ::testing::TestParamInfo<Violation>& param) { return param.param.name; });

class ProtocolTest : public test::RelayTest {};

TEST_F(ProtocolTest, FramesBeforeAViolationAreDeliveredAndNoneAfterIt) {
  Server server("cutoff", nullptr);
  RawClient raw(pathOf("cutoff"));
  raw.write(concat({rawFrame(1, 0, numbered(1)), rawFrameWithBody(2, 0, {0xff}), rawFrame(3, 0, numbered(3))}));
  ASSERT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  server.connection(0)->eventQueue()->sync([] {});
  EXPECT_EQ(server.events(0).kinds(), (std::vector{Event::Kind::Message, Event::Kind::ConnectionInvalid}));
}

// The server asks the raw client something and gets `answers` back.
void askRawClient(Server& server, RawClient& raw, Recorder<Reply>& replies,
                  const std::function<tn::Bytes(uint64_t requestId)>& answers) {
  server.connection(0)->sendWithReply(numbered(1), SerialQueue::create("q"), [&](Reply r) { replies.add(r); });
  const std::optional<RawFrame> request = raw.readFrame();
  EXPECT_TRUE(request.has_value());
  if (request) raw.write(answers(request->id));
}

TEST_F(ProtocolTest, ASecondReplyToOneRequestEndsTheConnection) {
  Server server("twice", nullptr);
  RawClient raw(pathOf("twice"));
  Recorder<Reply> replies;
  askRawClient(server, raw, replies, [](uint64_t id) {
    return concat({rawFrame(1, id, numbered(10)), rawFrame(2, id, numbered(11))});
  });
  ASSERT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  EXPECT_EQ((*replies.waitFor(1).at(0))["n"], tn::Value(10));
  EXPECT_TRUE(raw.waitForClose());
}

TEST_F(ProtocolTest, AMalformedReplyFailsItsHandlerAndEndsTheConnection) {
  Server server("bad-reply", nullptr);
  RawClient raw(pathOf("bad-reply"));
  Recorder<Reply> replies;
  askRawClient(server, raw, replies, [](uint64_t id) { return rawFrame(1, id, tn::Value("not a map")); });
  const Reply reply = replies.waitFor(1).at(0);
  EXPECT_TRUE(!reply.ok() && isRelayError(reply.error(), RelayErrorCode::ConnectionInvalid));
  EXPECT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  EXPECT_TRUE(raw.waitForClose());
}

TEST_F(ProtocolTest, APeerThatStopsReadingIsDroppedWithoutHoldingUpOthers) {
  Server server("unread", Server::echo);
  RawClient raw(pathOf("unread"));  // never reads
  const auto accepted = server.connection(0);
  Client good("unread");
  const tn::Value chunk(tn::Dictionary{{"blob", tn::Bytes(1024 * 1024, 7)}});
  for (int i = 0; i < 80 && accepted->send(chunk); ++i) {  // 80 MiB > the 64 MiB allowed
  }
  ASSERT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  EXPECT_NE(server.events(0).snapshot().back().reason.find("unread"), std::string::npos);
  EXPECT_TRUE(good.request(numbered(1)).ok());
}

TEST_F(ProtocolTest, ASlowOwnerPausesReadingInsteadOfBufferingWithoutLimit) {
  tn::dispatch::Semaphore gate;
  std::atomic<uint64_t> handled{0};
  std::atomic<bool> ordered{true};
  Server server("slow", [&](const Message& message) {
    if (handled == 0) gate.wait();
    ordered = ordered && message.body["n"] == tn::Value(handled.load());
    ++handled;
    return tn::Value();
  });
  RawClient raw(pathOf("slow"));
  server.connection(0);
  // ~3 MB of small frames: far beyond the inbound limit (1024 frames), one
  // read and the kernel's socket buffers together.
  constexpr uint64_t kCount = 100000;
  tn::Bytes all;
  for (uint64_t n = 0; n < kCount; ++n) {
    const tn::Bytes frame = rawFrame(n + 1, 0, numbered(n));
    all.insert(all.end(), frame.begin(), frame.end());
  }
  std::atomic<bool> written{false};
  std::thread writer([&] {
    raw.write(all);
    written = true;
  });
  // While the owner is stuck on the first request, the writer must stall.
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  EXPECT_FALSE(written.load()) << "the server kept reading while its owner did not keep up";
  gate.signal();
  writer.join();
  EXPECT_TRUE(test::eventually([&] { return handled.load() == kCount; }));
  EXPECT_TRUE(ordered.load());
}

}  // namespace
}  // namespace relay
