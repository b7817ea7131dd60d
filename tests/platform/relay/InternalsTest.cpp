// The bookkeeping behind a connection, without sockets.

#include <gtest/gtest.h>

#include <array>
#include <chrono>
#include <string>
#include <vector>

#include "platform/relay/ConnectionLimit.h"
#include "platform/relay/InboundBudget.h"
#include "platform/relay/OutgoingBuffer.h"

namespace relay::detail {
namespace {

std::string pending(const OutgoingBuffer& buffer, std::size_t maxPieces = 8) {
  std::array<iovec, 8> pieces{};
  std::string text;
  for (std::size_t i = 0, n = buffer.gather(std::span(pieces).first(maxPieces)); i < n; ++i) {
    text.append(static_cast<const char*>(pieces[i].iov_base), pieces[i].iov_len);
  }
  return text;
}

tn::Bytes bytes(std::string_view text) { return tn::Bytes(text.begin(), text.end()); }

TEST(OutgoingBuffer, KeepsFramesWholeAndInOrderAcrossPartialWrites) {
  OutgoingBuffer buffer;
  buffer.append(bytes("abcdef"), 2);  // the kernel took "ab" already
  buffer.append(bytes("ghi"));
  buffer.append(bytes("jk"));
  EXPECT_EQ(buffer.size(), 9u);
  EXPECT_EQ(pending(buffer), "cdefghijk");
  EXPECT_EQ(pending(buffer, 2), "cdefghi");
  buffer.consume(5);
  EXPECT_EQ(pending(buffer), "hijk");
  buffer.consume(4);
  EXPECT_TRUE(buffer.empty());
}

TEST(InboundBudget, PausesAtALimitAndExactlyOneReleaseResumesAtHalf) {
  InboundBudget budget(InboundLimits{4, 1000});
  for (int i = 0; i < 4; ++i) budget.charge(10);
  ASSERT_TRUE(budget.exhausted());
  EXPECT_TRUE(budget.pause());
  EXPECT_FALSE(budget.release(10));  // 3 of 4: still above half
  EXPECT_TRUE(budget.release(10));
  EXPECT_FALSE(budget.release(10));

  InboundBudget caughtUp(InboundLimits{2, 1000});
  caughtUp.charge(1000);
  ASSERT_TRUE(caughtUp.exhausted()) << "the byte limit counts as well";
  caughtUp.release(1000);
  EXPECT_FALSE(caughtUp.pause()) << "the owner caught up before the pause: keep reading";
}

TEST(ConnectionLimit, CountsLeasesPerUserUntilTheyAreGiven) {
  const auto limit = std::make_shared<ConnectionLimit>(ConnectionLimits{1});
  auto lease = limit->acquire(1000);
  ASSERT_TRUE(lease);
  ConnectionLimit::Refusal why = ConnectionLimit::Refusal::None;
  EXPECT_FALSE(limit->acquire(1000, &why));
  EXPECT_EQ(why, ConnectionLimit::Refusal::PerUser);
  EXPECT_TRUE(limit->acquire(1001));
  lease.reset();
  EXPECT_TRUE(limit->acquire(1000));
  EXPECT_EQ(limit->count(1000), 0u) << "a refused user leaves no entry behind";
}

TEST(ConnectionLimit, KeepsTheLastPlacesOfTheTotalForRoot) {
  const auto limit = std::make_shared<ConnectionLimit>(ConnectionLimits{10, 4, 1});
  std::vector<std::shared_ptr<void>> leases;
  for (uid_t uid = 2000; uid < 2003; ++uid) leases.push_back(limit->acquire(uid));
  for (const auto& lease : leases) ASSERT_TRUE(lease);
  ConnectionLimit::Refusal why = ConnectionLimit::Refusal::None;
  EXPECT_FALSE(limit->acquire(2003, &why)) << "the fourth place is root's";
  EXPECT_EQ(why, ConnectionLimit::Refusal::Total);
  auto rootLease = limit->acquire(0);
  ASSERT_TRUE(rootLease);
  EXPECT_FALSE(limit->acquire(0)) << "and then the total is reached for everybody";
  EXPECT_EQ(limit->total(), 4u);
  leases.clear();
  EXPECT_EQ(limit->total(), 1u);
  EXPECT_TRUE(limit->acquire(2003));
}

TEST(ConnectionLimit, NamesARefusedUserAtMostOnceAMinute) {
  const auto limit = std::make_shared<ConnectionLimit>(ConnectionLimits{});
  const auto start = std::chrono::steady_clock::now();
  EXPECT_TRUE(limit->refusalWorthLogging(65534, start));
  EXPECT_FALSE(limit->refusalWorthLogging(65534, start + std::chrono::seconds(59)));
  EXPECT_TRUE(limit->refusalWorthLogging(1000, start + std::chrono::seconds(59))) << "another user is named";
  EXPECT_TRUE(limit->refusalWorthLogging(65534, start + std::chrono::seconds(61)));
}

}  // namespace
}  // namespace relay::detail
