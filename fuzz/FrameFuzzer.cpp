// Feeds arbitrary bytes to the frame reader as a peer's socket would deliver
// them, and decodes every body it hands out, as the relay does.
//
// The first input byte picks how the rest is cut into reads, so the fuzzer
// explores split points too. Checked on every input, besides crashes and
// sanitizer reports:
//   - the frames and the verdict do not depend on how the bytes were split
//     (the whole input in one read gives the same result);
//   - every frame has a non-zero id above the previous one and a body that
//     fits the length limit;
//   - a decoded body is a dictionary;
//   - a reply is accepted only for an id still awaiting one (ids 1 to 8 are
//     taken as sent, as a connection's pending replies would hold them),
//     and only once;
//   - descriptors given with one of the reads (bits 3-4 of the first byte
//     say how many, up to the reader's limit and one beyond it) reach at
//     most one frame, and every one of them is closed once the reader and
//     its frames are gone, whatever the bytes did.

#include <fcntl.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <optional>
#include <set>
#include <utility>
#include <span>
#include <vector>

#include "platform/relay/Frame.h"
#include "platform/relay/FrameReader.h"

namespace {

struct Outcome {
  std::vector<relay::RawFrame> frames;
  bool failed = false;
  bool stopped = false;
};

[[noreturn]] void fail(const char* what) {
  std::fprintf(stderr, "relay_frames: %s\n", what);
  std::abort();
}

// Reads `input` in pieces whose sizes come from `cuts` (cycled), with the
// reply rule of a connection applied by the sink.
// With `descriptors`, they come with the read whose index is its first.
Outcome readAll(std::span<const uint8_t> input, std::span<const uint8_t> cuts,
                std::pair<std::size_t, relay::Descriptors>* descriptors = nullptr) {
  Outcome outcome;
  relay::FrameReader reader;
  reader.setMaxDescriptorsPerFrame(2);
  std::set<uint64_t> awaiting{1, 2, 3, 4, 5, 6, 7, 8};
  const relay::FrameReader::FrameSink sink = [&](relay::RawFrame&& frame) {
    if (frame.replyTo != 0 && awaiting.erase(frame.replyTo) == 0) {
      outcome.stopped = true;
      return false;  // a reply nobody waits for ends the connection
    }
    outcome.frames.push_back(std::move(frame));
    return true;
  };
  std::size_t cut = 0;
  for (std::size_t read = 0; !input.empty(); ++read) {
    std::size_t size = input.size();
    if (!cuts.empty()) size = std::min<std::size_t>(input.size(), 1 + cuts[cut++ % cuts.size()]);
    relay::Descriptors arriving;
    if (descriptors != nullptr && descriptors->first == read) arriving = std::move(descriptors->second);
    if (!reader.consume(input.first(size), std::move(arriving), sink).ok()) {
      outcome.failed = true;
      break;
    }
    input = input.subspan(size);
  }
  return outcome;
}

void checkFrames(const Outcome& outcome) {
  uint64_t previous = 0;
  for (const relay::RawFrame& frame : outcome.frames) {
    if (frame.id == 0 || frame.id <= previous) fail("frame ids not strictly increasing");
    previous = frame.id;
    if (frame.body.size() > relay::kMaxBodySize) fail("body beyond the frame limit");
    tn::Result<tn::Value> body = relay::decodeFrameBody(frame.body);
    if (body.ok() && !body->isDictionary()) fail("decoded body is not a dictionary");
  }
}

// Runs the reader with descriptors at one read and checks that none leaks.
void checkDescriptors(std::span<const uint8_t> stream, std::span<const uint8_t> cuts, uint8_t choice) {
  const std::size_t count = 1 + ((choice >> 3) & 3u) % 3;  // 1 to 3, against a limit of 2
  std::pair<std::size_t, relay::Descriptors> descriptors;
  descriptors.first = (choice >> 5) & 3u;
  std::vector<int> numbers;
  for (std::size_t i = 0; i < count; ++i) {
    descriptors.second.emplace_back(::open("/dev/null", O_RDONLY | O_CLOEXEC));
    numbers.push_back(descriptors.second.back().get());
  }
  {
    const Outcome outcome = readAll(stream, cuts, &descriptors);
    std::size_t delivered = 0;
    for (const relay::RawFrame& frame : outcome.frames) {
      if (!frame.descriptors.empty()) ++delivered;
      if (frame.descriptors.size() > 2) fail("a frame got more descriptors than the limit");
    }
    if (delivered > 1) fail("descriptors of one read reached two frames");
  }
  descriptors.second.clear();
  for (const int fd : numbers) {
    if (::fcntl(fd, F_GETFD) != -1) fail("a descriptor was leaked");
  }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  if (size == 0) return 0;
  // First byte: how many of the following bytes describe read sizes (0-7).
  const std::size_t cutCount = std::min<std::size_t>(data[0] & 7u, size - 1);
  const std::span<const uint8_t> cuts(data + 1, cutCount);
  const std::span<const uint8_t> stream(data + 1 + cutCount, size - 1 - cutCount);

  const Outcome pieces = readAll(stream, cuts);
  const Outcome whole = readAll(stream, {});
  checkFrames(pieces);
  if (pieces.failed != whole.failed || pieces.stopped != whole.stopped) fail("verdict depends on split points");
  if (pieces.frames.size() != whole.frames.size()) fail("frame count depends on split points");
  for (std::size_t i = 0; i < pieces.frames.size(); ++i) {
    const relay::RawFrame& a = pieces.frames[i];
    const relay::RawFrame& b = whole.frames[i];
    if (a.id != b.id || a.replyTo != b.replyTo || a.body != b.body) fail("frame differs with split points");
  }
  checkDescriptors(stream, cuts, data[0]);
  return 0;
}
