// Descriptors that travel with frames: where the reader puts them, how the
// outgoing buffer keeps a frame with descriptors in a write of its own, and,
// over real sockets, that they arrive close-on-exec in both directions and
// that every descriptor of a refused frame is closed.

#include <dirent.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <array>
#include <cstring>

#include "platform/dispatch/SerialQueue.h"
#include "platform/relay/Descriptors.h"
#include "platform/relay/FrameReader.h"
#include "platform/relay/OutgoingBuffer.h"
#include "platform/relay/RelayError.h"
#include "tests/platform/relay/RelayTestSupport.h"

namespace relay {
namespace {

using test::Client;
using test::eventually;
using test::numbered;
using test::rawFrame;
using test::Recorder;
using test::Server;

std::size_t openDescriptorCount() {
  std::size_t count = 0;
  DIR* directory = ::opendir("/proc/self/fd");
  if (directory == nullptr) return 0;
  while (const dirent* entry = ::readdir(directory)) {
    if (entry->d_name[0] != '.') ++count;
  }
  ::closedir(directory);
  return count;
}

bool isOpen(int fd) { return ::fcntl(fd, F_GETFD) != -1; }

// `count` descriptors of /dev/null.
Descriptors nullDescriptors(std::size_t count) {
  Descriptors descriptors;
  for (std::size_t i = 0; i < count; ++i) descriptors.emplace_back(::open("/dev/null", O_RDONLY | O_CLOEXEC));
  return descriptors;
}

tn::Bytes concat(const tn::Bytes& a, const tn::Bytes& b) {
  tn::Bytes joined = a;
  joined.insert(joined.end(), b.begin(), b.end());
  return joined;
}

struct Collected {
  std::vector<RawFrame> frames;
  FrameReader::FrameSink sink() {
    return [this](RawFrame&& frame) {
      frames.push_back(std::move(frame));
      return true;
    };
  }
};

TEST(DescriptorPlacement, GoToTheLastFrameThatBeginsInTheRead) {
  FrameReader reader;
  reader.setMaxDescriptorsPerFrame(kMaxDescriptorsPerFrame);
  Collected got;
  const tn::Bytes first = rawFrame(1, 0, numbered(1));
  const tn::Bytes second = rawFrame(2, 0, numbered(2));
  // The tail of the first frame came in an earlier read.
  ASSERT_TRUE(reader.consume(std::span(first).first(5), got.sink()).ok());
  const tn::Bytes rest = concat(tn::Bytes(first.begin() + 5, first.end()), second);
  ASSERT_TRUE(reader.consume(rest, nullDescriptors(2), got.sink()).ok());
  ASSERT_EQ(got.frames.size(), 2u);
  EXPECT_TRUE(got.frames[0].descriptors.empty());
  EXPECT_EQ(got.frames[1].descriptors.size(), 2u);
}

TEST(DescriptorPlacement, WaitForTheirFrameToComplete) {
  FrameReader reader;
  reader.setMaxDescriptorsPerFrame(1);
  Collected got;
  const tn::Bytes whole = concat(rawFrame(1, 0, numbered(1)), rawFrame(2, 0, numbered(2)));
  const std::size_t cut = whole.size() - 3;  // the second frame lacks its last bytes
  ASSERT_TRUE(reader.consume(std::span(whole).first(cut), nullDescriptors(1), got.sink()).ok());
  ASSERT_EQ(got.frames.size(), 1u);
  EXPECT_TRUE(got.frames[0].descriptors.empty());
  ASSERT_TRUE(reader.consume(std::span(whole).subspan(cut), got.sink()).ok());
  ASSERT_EQ(got.frames.size(), 2u);
  EXPECT_EQ(got.frames[1].descriptors.size(), 1u);
}

TEST(DescriptorPlacement, RefusedReadsCloseTheirDescriptors) {
  const tn::Bytes frame = rawFrame(1, 0, numbered(1));
  struct Case {
    const char* what;
    std::size_t limit;
    std::size_t sent;
    std::size_t skip;  // bytes fed before, so the read starts mid-frame
    tn::Bytes input;
  };
  tn::Bytes oversized(4, 0xFF);  // a length far above the limit
  const std::vector<Case> cases = {
      {"more than the limit", 2, 3, 0, frame},
      {"a service that takes none", 0, 1, 0, frame},
      {"the middle of a frame", 4, 1, 4, tn::Bytes(frame.begin() + 4, frame.end())},
      {"a frame too large", 4, 1, 0, oversized},
  };
  for (const Case& c : cases) {
    SCOPED_TRACE(c.what);
    FrameReader reader;
    reader.setMaxDescriptorsPerFrame(c.limit);
    Collected got;
    if (c.skip > 0) {
      ASSERT_TRUE(reader.consume(std::span(frame).first(c.skip), got.sink()).ok());
    }
    Descriptors descriptors = nullDescriptors(c.sent);
    std::vector<int> numbers;
    for (const UniqueFd& fd : descriptors) numbers.push_back(fd.get());
    const tn::Result<void> result = reader.consume(c.input, std::move(descriptors), got.sink());
    ASSERT_FALSE(result.ok());
    EXPECT_TRUE(isRelayError(result.error(), RelayErrorCode::ProtocolViolation));
    for (const int fd : numbers) EXPECT_FALSE(isOpen(fd)) << "descriptor " << fd << " leaked";
  }
}

TEST(DescriptorPlacement, AFrameLeftIncompleteClosesItsDescriptorsWithTheReader) {
  std::vector<int> numbers;
  {
    FrameReader reader;
    reader.setMaxDescriptorsPerFrame(2);
    Collected got;
    const tn::Bytes frame = rawFrame(1, 0, numbered(1));
    Descriptors descriptors = nullDescriptors(2);
    for (const UniqueFd& fd : descriptors) numbers.push_back(fd.get());
    ASSERT_TRUE(reader.consume(std::span(frame).first(10), std::move(descriptors), got.sink()).ok());
    EXPECT_TRUE(got.frames.empty());
    for (const int fd : numbers) EXPECT_TRUE(isOpen(fd));
  }
  for (const int fd : numbers) EXPECT_FALSE(isOpen(fd));
}

TEST(DescriptorOutgoing, AFrameWithDescriptorsLeavesInAWriteOfItsOwn) {
  detail::OutgoingBuffer buffer;
  buffer.append(tn::Bytes(10, 1));
  buffer.append(tn::Bytes(20, 2), 0, nullptr, nullDescriptors(1));
  buffer.append(tn::Bytes(30, 3));
  std::array<iovec, 8> pieces{};
  ASSERT_EQ(buffer.gather(pieces), 1u);  // stops before the frame with descriptors
  EXPECT_TRUE(buffer.descriptorsToSend().empty());
  buffer.consume(10);
  ASSERT_EQ(buffer.gather(pieces), 1u);  // that frame alone
  EXPECT_EQ(pieces[0].iov_len, 20u);
  ASSERT_EQ(buffer.descriptorsToSend().size(), 1u);
  const int passed = buffer.descriptorsToSend()[0].get();
  buffer.consume(5);  // the kernel took the first bytes, and the descriptor with them
  EXPECT_FALSE(isOpen(passed));
  EXPECT_TRUE(buffer.descriptorsToSend().empty());
  EXPECT_EQ(buffer.gather(pieces), 2u);  // the rest joins the next frame again
}

class DescriptorTest : public test::RelayTest {};

// A pipe: [0] read end, [1] write end.
std::array<UniqueFd, 2> makePipe() {
  std::array<int, 2> ends{};
  EXPECT_EQ(::pipe2(ends.data(), O_CLOEXEC), 0);
  return {UniqueFd(ends[0]), UniqueFd(ends[1])};
}

std::string readAll(int fd) {
  std::string text;
  std::array<char, 64> buffer{};
  for (ssize_t n; (n = ::read(fd, buffer.data(), buffer.size())) > 0;) text.append(buffer.data(), n);
  return text;
}

TEST_F(DescriptorTest, RequestAndReplyCarryDescriptorsThatArriveCloseOnExec) {
  Server server("pipes", nullptr);
  auto limits = server.listener().limits();
  limits.descriptorsPerRequest = 1;
  server.listener().setLimits(limits);
  Client client("pipes");

  auto [requestRead, requestWrite] = makePipe();
  Descriptors outgoing;
  outgoing.push_back(std::move(requestWrite));
  Recorder<std::pair<bool, std::size_t>> replies;
  Recorder<std::string> replyText;
  client.connection->sendWithReply(
      numbered(1), std::move(outgoing), tn::dispatch::SerialQueue::create("replies"),
      [&](Reply reply, Descriptors descriptors) {
        if (descriptors.size() == 1) {
          const int fd = descriptors[0].get();
          EXPECT_EQ(::fcntl(fd, F_GETFD) & FD_CLOEXEC, FD_CLOEXEC);
          replyText.add(readAll(fd));
        }
        replies.add({reply.ok(), descriptors.size()});
      });

  const Event request = server.events(0).waitFor(1).at(0);
  ASSERT_TRUE(request.message.descriptors);
  ASSERT_EQ(request.message.descriptors->size(), 1u);
  const int received = request.message.descriptors->at(0).get();
  EXPECT_EQ(::fcntl(received, F_GETFD) & FD_CLOEXEC, FD_CLOEXEC);
  ASSERT_EQ(::write(received, "to the client", 13), 13);
  request.message.descriptors->clear();  // the server's copy of the write end
  EXPECT_EQ(readAll(requestRead.get()), "to the client");

  auto [replyRead, replyWrite] = makePipe();
  ASSERT_EQ(::write(replyWrite.get(), "to the server", 13), 13);
  replyWrite.reset();
  Descriptors answer;
  answer.push_back(std::move(replyRead));
  ASSERT_TRUE(server.connection(0)->trySendReply(request.message, tn::Value(tn::Dictionary{}), std::move(answer)).ok());
  EXPECT_EQ(replies.waitFor(1).at(0), std::make_pair(true, std::size_t{1}));
  EXPECT_EQ(replyText.waitFor(1).at(0), "to the server");
}

TEST_F(DescriptorTest, MoreThanTheCapIsRefusedBeforeSending) {
  Server server("cap", Server::echo);
  Client client("cap");
  Recorder<Reply> replies;
  client.connection->sendWithReply(numbered(1), nullDescriptors(kMaxDescriptorsPerFrame + 1),
                                   tn::dispatch::SerialQueue::create("replies"),
                                   [&](Reply reply, Descriptors) { replies.add(reply); });
  const Reply reply = replies.waitFor(1).at(0);
  ASSERT_FALSE(reply.ok());
  EXPECT_TRUE(isRelayError(reply.error(), RelayErrorCode::BadDescriptors));
}

// Sends `bytes` in one write, with `count` descriptors of /dev/null.
void sendWithDescriptors(int socket, const tn::Bytes& bytes, std::size_t count) {
  Descriptors descriptors = nullDescriptors(count);
  std::vector<char> control(CMSG_SPACE(sizeof(int) * count));
  iovec piece{const_cast<uint8_t*>(bytes.data()), bytes.size()};
  msghdr message{};
  message.msg_iov = &piece;
  message.msg_iovlen = 1;
  message.msg_control = control.data();
  message.msg_controllen = control.size();
  cmsghdr* header = CMSG_FIRSTHDR(&message);
  header->cmsg_level = SOL_SOCKET;
  header->cmsg_type = SCM_RIGHTS;
  header->cmsg_len = CMSG_LEN(sizeof(int) * count);
  for (std::size_t i = 0; i < count; ++i) {
    const int fd = descriptors[i].get();
    std::memcpy(CMSG_DATA(header) + i * sizeof(int), &fd, sizeof fd);
  }
  ASSERT_EQ(::sendmsg(socket, &message, MSG_NOSIGNAL), static_cast<ssize_t>(bytes.size()));
}

TEST_F(DescriptorTest, RefusedFramesLeaveNoDescriptorOpen) {
  Server server("refusing", Server::echo);  // takes no descriptors
  auto limits = server.listener().limits();
  limits.descriptorsPerRequest = 2;
  server.listener().setLimits(limits);
  struct Case {
    const char* what;
    std::size_t count;
  };
  // Three descriptors exceed this service's limit; eight also exceed what
  // the reader's control buffer holds (MSG_CTRUNC).
  std::size_t accepted = 0;
  for (const Case& c : {Case{"over the service's limit", 3}, Case{"over the cap", 8}}) {
    SCOPED_TRACE(c.what);
    std::size_t before = 0;
    {
      test::RawClient raw(test::pathOf("refusing"));
      ASSERT_TRUE(raw.connected());
      server.connection(accepted++);
      // Counted with both ends of the connection open; the server keeps
      // the connection object (and its pidfd) for the test.
      before = openDescriptorCount();
      sendWithDescriptors(raw.fd(), rawFrame(1, 0, numbered(1)), c.count);
      EXPECT_TRUE(raw.waitForClose());
    }
    EXPECT_TRUE(eventually([&] { return openDescriptorCount() <= before - 2; }))
        << openDescriptorCount() << " open, " << before << " before, both ends of the socket now closed";
  }
}

}  // namespace
}  // namespace relay
