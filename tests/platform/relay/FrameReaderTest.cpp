#include "platform/relay/FrameReader.h"

#include <gtest/gtest.h>

#include <cstdint>
#include <span>
#include <vector>

#include "platform/relay/Frame.h"
#include "platform/relay/RelayError.h"
#include "platform/value/Cbor.h"
#include "tests/platform/relay/RawFrames.h"

namespace relay {
namespace {

using test::rawFrame;

struct Collected {
  std::vector<RawFrame> frames;
  tn::Result<void> result;
};

// Feeds `bytes` in pieces of `piece` bytes (the whole at once when 0).
Collected feed(const tn::Bytes& bytes, std::size_t piece = 0) {
  FrameReader reader;
  Collected collected{{}, tn::Result<void>()};
  const FrameReader::FrameSink sink = [&](RawFrame&& frame) {
    collected.frames.push_back(std::move(frame));
    return true;
  };
  const std::size_t step = piece == 0 ? bytes.size() : piece;
  for (std::size_t at = 0; at < bytes.size() && collected.result.ok(); at += step) {
    const std::size_t size = std::min(step, bytes.size() - at);
    collected.result = reader.consume(std::span(bytes).subspan(at, size), sink);
  }
  return collected;
}

bool isViolation(const tn::Result<void>& result) {
  return !result.ok() && isRelayError(result.error(), RelayErrorCode::ProtocolViolation);
}

TEST(FrameCodec, EncodedFrameHasHeaderFieldsAndDecodableBody) {
  const tn::Value body(tn::Dictionary{{"request", "match"}, {"version", 3}});
  tn::Result<tn::Bytes> frame = encodeFrame(body, 9, 7);
  ASSERT_TRUE(frame.ok());
  ASSERT_GE(frame->size(), kFrameHeaderSize);
  EXPECT_EQ(loadBigEndian32(frame->data()), frame->size() - kFrameLengthSize);
  EXPECT_EQ(loadBigEndian64(frame->data() + 4), 7u);
  EXPECT_EQ(loadBigEndian64(frame->data() + 12), 9u);
  setFrameId(*frame, 0x0102030405060708u);
  EXPECT_EQ((*frame)[4], 0x01);
  EXPECT_EQ((*frame)[11], 0x08);
  tn::Result<tn::Value> decoded = decodeFrameBody(std::span(*frame).subspan(kFrameHeaderSize));
  ASSERT_TRUE(decoded.ok());
  EXPECT_TRUE(tn::Value::identical(*decoded, tn::Value(tn::Dictionary{{"request", "match"}, {"version", 3u}})));
}

TEST(FrameCodec, RefusesBodiesThatAreNotMessagesOrTooLarge) {
  EXPECT_TRUE(isRelayError(encodeFrame(tn::Value(tn::Array{1, 2}), 0).error(), RelayErrorCode::NotAMessage));
  tn::Bytes big(kMaxBodySize, 0x41);
  EXPECT_TRUE(isRelayError(encodeFrame(tn::Value(tn::Dictionary{{"blob", big}}), 0).error(),
                           RelayErrorCode::MessageTooLarge));
  // The largest body that fits: the map head, key and byte-string head take 11 bytes.
  big.resize(kMaxBodySize - 11);
  tn::Result<tn::Bytes> largest = encodeFrame(tn::Value(tn::Dictionary{{"blob", big}}), 0);
  ASSERT_TRUE(largest.ok()) << largest.error().description();
  EXPECT_EQ(loadBigEndian32(largest->data()), kMaxFrameLength);
}

TEST(FrameReader, ReadsFramesSplitAtEveryPossiblePoint) {
  tn::Bytes stream;
  for (uint64_t id = 1; id <= 3; ++id) {
    const tn::Bytes frame = rawFrame(id * 10, id == 2 ? 5 : 0, tn::Value(tn::Dictionary{{"n", id}}));
    stream.insert(stream.end(), frame.begin(), frame.end());
  }
  for (std::size_t piece = 1; piece <= stream.size(); ++piece) {
    const Collected collected = feed(stream, piece);
    ASSERT_TRUE(collected.result.ok()) << "piece " << piece;
    ASSERT_EQ(collected.frames.size(), 3u) << "piece " << piece;
    for (uint64_t i = 0; i < 3; ++i) {
      EXPECT_EQ(collected.frames[i].id, (i + 1) * 10);
      tn::Result<tn::Value> body = decodeFrameBody(collected.frames[i].body);
      ASSERT_TRUE(body.ok());
      EXPECT_EQ((*body)["n"], tn::Value(i + 1));
    }
    EXPECT_EQ(collected.frames[1].replyTo, 5u);
    EXPECT_EQ(collected.frames[0].replyTo, 0u);
  }
}

TEST(FrameReader, LengthIsCheckedBeforeTheRestOfTheHeaderArrives) {
  tn::Bytes tooLong(4);
  storeBigEndian32(tooLong.data(), kMaxFrameLength + 1);
  EXPECT_TRUE(isViolation(feed(tooLong).result));
  tn::Bytes tooShort(4);
  storeBigEndian32(tooShort.data(), kFrameIdsSize - 1);
  EXPECT_TRUE(isViolation(feed(tooShort).result));
  tn::Bytes limit(4);
  storeBigEndian32(limit.data(), kMaxFrameLength);
  EXPECT_TRUE(feed(limit).result.ok());
}

TEST(FrameReader, RefusesZeroAndNonIncreasingIds) {
  EXPECT_TRUE(isViolation(feed(rawFrame(0, 0, tn::Value(tn::Dictionary{}))).result));

  tn::Bytes repeated = rawFrame(4, 0, tn::Value(tn::Dictionary{}));
  const tn::Bytes again = rawFrame(4, 0, tn::Value(tn::Dictionary{}));
  repeated.insert(repeated.end(), again.begin(), again.end());
  const Collected collected = feed(repeated);
  EXPECT_TRUE(isViolation(collected.result));
  EXPECT_EQ(collected.frames.size(), 1u);  // frames before the bad one still count

  tn::Bytes decreasing = rawFrame(9, 0, tn::Value(tn::Dictionary{}));
  const tn::Bytes lower = rawFrame(8, 0, tn::Value(tn::Dictionary{}));
  decreasing.insert(decreasing.end(), lower.begin(), lower.end());
  EXPECT_TRUE(isViolation(feed(decreasing).result));
}

TEST(FrameReader, StaysFailedAndStopsWhenTheSinkSaysSo) {
  FrameReader reader;
  tn::Bytes bad(4);
  storeBigEndian32(bad.data(), 3);
  const FrameReader::FrameSink sink = [](RawFrame&&) { return true; };
  EXPECT_FALSE(reader.consume(bad, sink).ok());
  EXPECT_TRUE(reader.stopped());
  EXPECT_FALSE(reader.consume(rawFrame(1, 0, tn::Value(tn::Dictionary{})), sink).ok());

  FrameReader stopping;
  int seen = 0;
  tn::Bytes two = rawFrame(1, 0, tn::Value(tn::Dictionary{}));
  const tn::Bytes second = rawFrame(2, 0, tn::Value(tn::Dictionary{}));
  two.insert(two.end(), second.begin(), second.end());
  EXPECT_TRUE(stopping.consume(two, [&](RawFrame&&) { return ++seen < 1; }).ok());
  EXPECT_EQ(seen, 1);
  EXPECT_TRUE(stopping.stopped());
}

TEST(FrameReader, MemoryFollowsTheBytesThatArrivedNotTheAnnouncedLength) {
  FrameReader reader;
  tn::Bytes header(kFrameHeaderSize);
  storeBigEndian32(header.data(), kMaxFrameLength);
  storeBigEndian64(header.data() + 4, 1);
  const FrameReader::FrameSink sink = [](RawFrame&&) { return true; };
  ASSERT_TRUE(reader.consume(header, sink).ok());
  const tn::Bytes some(100, 0);
  ASSERT_TRUE(reader.consume(some, sink).ok());
  EXPECT_EQ(reader.bufferedBytes(), kFrameHeaderSize + 100);
}

TEST(FrameBody, RefusesWhatIsNotOneWellFormedMap) {
  const auto refused = [](const tn::Bytes& body) {
    tn::Result<tn::Value> decoded = decodeFrameBody(body);
    return !decoded.ok() && isRelayError(decoded.error(), RelayErrorCode::ProtocolViolation);
  };
  EXPECT_TRUE(refused({}));                          // empty body
  EXPECT_TRUE(refused({0x82, 0x01, 0x02}));          // an array
  EXPECT_TRUE(refused({0xa0, 0x00}));                // trailing byte
  EXPECT_TRUE(refused({0xbf, 0xff}));                // indefinite-length map
  EXPECT_TRUE(refused({0xa1, 0x01, 0x02}));          // integer key
  EXPECT_TRUE(refused(test::nestedBody(65)));
  EXPECT_FALSE(refused(test::nestedBody(64)));
}

}  // namespace
}  // namespace relay
