// A peer that breaks a frame rule loses its own connection and nothing
// else: the server connection sees ConnectionInvalid, the peer sees its
// socket closed, and another client is served before and after.

#include <gtest/gtest.h>

#include <sys/socket.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/dispatch/Semaphore.h"
#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Connection.h"
#include "platform/relay/Frame.h"
#include "platform/relay/RelayError.h"
#include "tests/platform/relay/RawFrames.h"
#include "tests/platform/relay/RelayTestSupport.h"

namespace relay {
namespace {

using test::Client;
using test::RawClient;
using test::rawFrame;
using test::rawFrameWithBody;
using test::Recorder;
using test::RelayTest;
using test::Server;

tn::Value empty() { return tn::Value(tn::Dictionary{}); }
tn::Value numbered(uint64_t n) { return tn::Value(tn::Dictionary{{"n", n}}); }

tn::Bytes concat(std::initializer_list<tn::Bytes> parts) {
  tn::Bytes all;
  for (const tn::Bytes& part : parts) all.insert(all.end(), part.begin(), part.end());
  return all;
}

tn::Bytes lengthOnly(uint32_t length) {
  tn::Bytes bytes(kFrameHeaderSize);
  storeBigEndian32(bytes.data(), length);
  storeBigEndian64(bytes.data() + 4, 1);
  return bytes;
}

struct Violation {
  const char* name;
  tn::Bytes bytes;
};

std::vector<Violation> violations() {
  return {
      {"LengthBeyond16MiB", lengthOnly(kMaxFrameLength + 1)},
      {"LengthAtMaximumOfU32", lengthOnly(0xffffffffu)},
      {"LengthBelow16", lengthOnly(kFrameIdsSize - 1)},
      {"IdZero", rawFrame(0, 0, empty())},
      {"IdRepeated", concat({rawFrame(5, 0, empty()), rawFrame(5, 0, empty())})},
      {"IdDecreasing", concat({rawFrame(5, 0, empty()), rawFrame(4, 0, empty())})},
      {"TruncatedCbor", rawFrameWithBody(1, 0, {0xa1, 0x61})},
      {"EmptyBody", rawFrameWithBody(1, 0, {})},
      {"TrailingBytes", rawFrameWithBody(1, 0, {0xa0, 0xa0})},
      {"BodyNotAMap", rawFrame(1, 0, tn::Value(tn::Array{1, 2, 3}))},
      {"NestedDeeperThan64", rawFrameWithBody(1, 0, test::nestedBody(65))},
      {"ReplyToUnknownId", rawFrame(1, 77, empty())},
  };
}

class ProtocolViolationTest : public RelayTest, public ::testing::WithParamInterface<Violation> {};

TEST_P(ProtocolViolationTest, EndsOnlyTheOffendingConnection) {
  Server server("strict", Server::echo);
  Client good("strict");
  ASSERT_TRUE(good.request(numbered(1)).ok());
  ASSERT_NE(server.connection(0), nullptr);

  RawClient bad("strict");
  ASSERT_TRUE(bad.connected());
  bad.write(GetParam().bytes);
  EXPECT_TRUE(bad.waitForClose());
  ASSERT_TRUE(server.events(1).waitForKind(Event::Kind::ConnectionInvalid));
  const Event last = server.events(1).snapshot().back();
  EXPECT_EQ(last.kind, Event::Kind::ConnectionInvalid);
  EXPECT_FALSE(last.reason.empty());

  const Reply after = good.request(numbered(2));
  ASSERT_TRUE(after.ok()) << after.error().description();
  EXPECT_EQ((*after)["echo"]["n"], tn::Value(2));
  const auto goodKinds = server.events(0).kinds();
  EXPECT_EQ(std::count(goodKinds.begin(), goodKinds.end(), Event::Kind::ConnectionInvalid), 0);
}

INSTANTIATE_TEST_SUITE_P(Frames, ProtocolViolationTest, ::testing::ValuesIn(violations()),
                         [](const ::testing::TestParamInfo<Violation>& param) { return param.param.name; });

class ProtocolTest : public RelayTest {};

TEST_F(ProtocolTest, FramesBeforeAViolationAreDeliveredAndNoneAfterIt) {
  Server server("cutoff", nullptr);
  RawClient raw("cutoff");
  raw.write(concat({rawFrame(1, 0, numbered(1)), rawFrameWithBody(2, 0, {0xff}), rawFrame(3, 0, numbered(3))}));
  ASSERT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  server.connection(0)->eventQueue()->sync([] {});
  const auto events = server.events(0).snapshot();
  ASSERT_EQ(events.size(), 2u);
  EXPECT_EQ(events[0].kind, Event::Kind::Message);
  EXPECT_EQ(events[0].message.body["n"], tn::Value(1));
  EXPECT_EQ(events[1].kind, Event::Kind::ConnectionInvalid);
}

TEST_F(ProtocolTest, ASecondReplyToTheSameRequestEndsTheConnection) {
  Server server("twice", nullptr);
  RawClient raw("twice");
  const auto accepted = server.connection(0);
  Recorder<Reply> replies;
  accepted->sendWithReply(numbered(1), tn::dispatch::SerialQueue::create("replies"),
                          [&](Reply reply) { replies.add(std::move(reply)); });
  const std::optional<RawFrame> request = raw.readFrame();
  ASSERT_TRUE(request.has_value());
  EXPECT_EQ(request->replyTo, 0u);
  raw.write(concat({rawFrame(1, request->id, numbered(10)), rawFrame(2, request->id, numbered(11))}));
  ASSERT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  const auto got = replies.waitFor(1);
  ASSERT_EQ(got.size(), 1u);
  ASSERT_TRUE(got[0].ok());
  EXPECT_EQ((*got[0])["n"], tn::Value(10));
  EXPECT_TRUE(raw.waitForClose());
}

TEST_F(ProtocolTest, AMalformedReplyFailsItsHandlerAndEndsTheConnection) {
  Server server("bad-reply", nullptr);
  RawClient raw("bad-reply");
  Recorder<Reply> replies;
  server.connection(0)->sendWithReply(numbered(1), tn::dispatch::SerialQueue::create("replies"),
                                      [&](Reply reply) { replies.add(std::move(reply)); });
  const std::optional<RawFrame> request = raw.readFrame();
  ASSERT_TRUE(request.has_value());
  raw.write(rawFrame(1, request->id, tn::Value("not a map")));
  const auto got = replies.waitFor(1);
  ASSERT_EQ(got.size(), 1u);
  ASSERT_FALSE(got[0].ok());
  EXPECT_TRUE(isRelayError(got[0].error(), RelayErrorCode::ConnectionInvalid));
  EXPECT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  EXPECT_TRUE(raw.waitForClose());
}

TEST_F(ProtocolTest, APeerThatStopsReadingIsDroppedWithoutHoldingUpOthers) {
  Server server("unread", Server::echo);
  RawClient raw("unread");  // never reads
  const auto accepted = server.connection(0);
  Client good("unread");
  const tn::Value chunk(tn::Dictionary{{"blob", tn::Bytes(1024 * 1024, 7)}});
  // 80 MiB for a peer that reads nothing: beyond the 64 MiB it may leave unread.
  for (int i = 0; i < 80 && accepted->send(chunk); ++i) {
  }
  ASSERT_TRUE(server.events(0).waitForKind(Event::Kind::ConnectionInvalid));
  EXPECT_NE(server.events(0).snapshot().back().reason.find("unread"), std::string::npos)
      << server.events(0).snapshot().back().reason;
  EXPECT_TRUE(good.request(numbered(1)).ok());
}

TEST_F(ProtocolTest, ASlowOwnerPausesReadingInsteadOfBufferingWithoutLimit) {
  tn::dispatch::Semaphore gate;
  std::atomic<uint64_t> handled{0};
  std::atomic<bool> ordered{true};
  Server server("slow", [&](const Message& message) {
    if (handled == 0) gate.wait();
    if (message.body["n"] != tn::Value(handled.load())) ordered = false;
    ++handled;
    return tn::Value();
  });
  RawClient raw("slow");
  ASSERT_NE(server.connection(0), nullptr);
  // 100,000 small frames (~3 MB): far more than the inbound limit (1024
  // frames) plus a read and the kernel's socket buffers.
  constexpr uint64_t kCount = 100000;
  std::atomic<bool> writerDone{false};
  std::thread writer([&] {
    tn::Bytes all;
    for (uint64_t n = 0; n < kCount; ++n) {
      const tn::Bytes frame = rawFrame(n + 1, 0, numbered(n));
      all.insert(all.end(), frame.begin(), frame.end());
    }
    raw.write(all);
    writerDone = true;
  });
  // While the owner is stuck on the first request, the writer must stall.
  std::this_thread::sleep_for(std::chrono::milliseconds(300));
  EXPECT_FALSE(writerDone.load()) << "the server kept reading while its owner did not keep up";
  gate.signal();
  writer.join();
  EXPECT_TRUE(test::eventually([&] { return handled.load() == kCount; }));
  EXPECT_TRUE(ordered.load());
}

}  // namespace
}  // namespace relay
