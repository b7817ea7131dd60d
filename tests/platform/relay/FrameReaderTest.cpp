#include "platform/relay/FrameReader.h"

#include <gtest/gtest.h>

#include "platform/relay/RelayError.h"
#include "tests/platform/relay/RelayTestSupport.h"

namespace relay {
namespace {

using test::numbered;
using test::rawFrame;

struct Read {
  std::vector<RawFrame> frames;
  tn::Result<void> result;
};

// Feeds `bytes` in pieces of `piece` bytes (all at once when 0).
Read feed(const tn::Bytes& bytes, std::size_t piece = 0) {
  FrameReader reader;
  Read read{{}, {}};
  const FrameReader::FrameSink sink = [&](RawFrame&& frame) {
    read.frames.push_back(std::move(frame));
    return true;
  };
  const std::size_t step = piece == 0 ? bytes.size() : piece;
  for (std::size_t at = 0; at < bytes.size() && read.result.ok(); at += step) {
    read.result = reader.consume(std::span(bytes).subspan(at, std::min(step, bytes.size() - at)), sink);
  }
  return read;
}

bool violates(const tn::Bytes& bytes) {
  const tn::Result<void> result = feed(bytes).result;
  return !result.ok() && isRelayError(result.error(), RelayErrorCode::ProtocolViolation);
}

// The first four bytes of a frame: its length, and nothing else yet.
tn::Bytes lengthPrefix(uint32_t length) {
  tn::Bytes bytes(4);
  storeBigEndian32(bytes.data(), length);
  return bytes;
}

tn::Bytes concat(tn::Bytes a, const tn::Bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

TEST(FrameCodec, WritesTheHeaderAndKeepsBodiesWithinTheLimit) {
  tn::Result<tn::Bytes> frame = encodeFrame(numbered(3), 9, 7);
  ASSERT_TRUE(frame.ok());
  EXPECT_EQ(loadBigEndian32(frame->data()), frame->size() - 4);
  EXPECT_EQ(loadBigEndian64(frame->data() + 4), 7u);
  EXPECT_EQ(loadBigEndian64(frame->data() + 12), 9u);
  setFrameId(*frame, 0x0102030405060708u);
  EXPECT_EQ((*frame)[4], 0x01);
  EXPECT_EQ((*frame)[11], 0x08);
  // The largest body that fits: map head, key and byte-string head take 11 bytes.
  tn::Bytes blob(kMaxBodySize - 11);
  tn::Result<tn::Bytes> largest = encodeFrame(tn::Value(tn::Dictionary{{"blob", blob}}), 0);
  ASSERT_TRUE(largest.ok());
  EXPECT_EQ(loadBigEndian32(largest->data()), kMaxFrameLength);
  blob.push_back(0);
  EXPECT_TRUE(isRelayError(encodeFrame(tn::Value(tn::Dictionary{{"blob", blob}}), 0).error(),
                           RelayErrorCode::MessageTooLarge));
}

TEST(FrameReader, ReadsTheSameFramesWhereverTheStreamIsSplit) {
  const tn::Bytes stream =
      concat(concat(rawFrame(10, 0, numbered(0)), rawFrame(20, 5, numbered(1))), rawFrame(30, 0, numbered(2)));
  for (std::size_t piece = 1; piece <= stream.size(); ++piece) {
    const Read read = feed(stream, piece);
    ASSERT_TRUE(read.result.ok());
    ASSERT_EQ(read.frames.size(), 3u) << "piece " << piece;
    for (uint64_t i = 0; i < 3; ++i) {
      EXPECT_EQ(read.frames[i].id, (i + 1) * 10);
      EXPECT_EQ(read.frames[i].replyTo, i == 1 ? 5u : 0u);
      EXPECT_EQ(decodeFrameBody(read.frames[i].body).value()["n"], tn::Value(i));
    }
  }
}

TEST(FrameReader, RefusesBadLengthsBeforeTheRestOfTheFrameAndBadIds) {
  EXPECT_TRUE(violates(lengthPrefix(kMaxFrameLength + 1)));
  EXPECT_TRUE(violates(lengthPrefix(15)));
  EXPECT_FALSE(violates(lengthPrefix(kMaxFrameLength)));
  EXPECT_TRUE(violates(rawFrame(0, 0, numbered(0))));
  EXPECT_TRUE(violates(concat(rawFrame(5, 0, numbered(0)), rawFrame(4, 0, numbered(0)))));
  const Read repeated = feed(concat(rawFrame(5, 0, numbered(0)), rawFrame(5, 0, numbered(0))));
  EXPECT_FALSE(repeated.result.ok());
  EXPECT_EQ(repeated.frames.size(), 1u) << "the frame before the bad one still counts";
}

TEST(FrameReader, StopsForGoodOnAViolationOrWhenTheSinkSaysSo) {
  FrameReader failed;
  const FrameReader::FrameSink accept = [](RawFrame&&) { return true; };
  EXPECT_FALSE(failed.consume(lengthPrefix(3), accept).ok());
  EXPECT_FALSE(failed.consume(rawFrame(1, 0, numbered(0)), accept).ok());

  FrameReader stopped;
  int seen = 0;
  const tn::Bytes two = concat(rawFrame(1, 0, numbered(0)), rawFrame(2, 0, numbered(0)));
  EXPECT_TRUE(stopped.consume(two, [&](RawFrame&&) { return ++seen < 1; }).ok());
  EXPECT_EQ(seen, 1);
  EXPECT_TRUE(stopped.stopped());
}

TEST(FrameReader, HoldsWhatArrivedNotWhatWasAnnounced) {
  FrameReader reader;
  tn::Bytes start = test::rawFrameWithBody(1, 0, tn::Bytes(100));
  storeBigEndian32(start.data(), kMaxFrameLength);
  ASSERT_TRUE(reader.consume(start, [](RawFrame&&) { return true; }).ok());
  EXPECT_EQ(reader.bufferedBytes(), start.size());
}

TEST(FrameBody, MustBeOneWellFormedMap) {
  const auto refused = [](const tn::Bytes& body) {
    const tn::Result<tn::Value> decoded = decodeFrameBody(body);
    return !decoded.ok() && isRelayError(decoded.error(), RelayErrorCode::ProtocolViolation);
  };
  EXPECT_TRUE(refused({}));
  EXPECT_TRUE(refused({0x82, 0x01, 0x02}));  // an array
  EXPECT_TRUE(refused({0xa0, 0x00}));        // a trailing byte
  EXPECT_TRUE(refused({0xbf, 0xff}));        // an indefinite-length map
  EXPECT_TRUE(refused(test::nestedBody(65)));
  EXPECT_FALSE(refused(test::nestedBody(64)));
}

}  // namespace
}  // namespace relay
