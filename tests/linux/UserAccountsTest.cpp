#include <gtest/gtest.h>

#include "platform/linux/execution/UserAccounts.h"

namespace vx::lnx {
namespace {

// Looked at after each byte.
class UserAccountsTest : public ::testing::Test {
 protected:
  UserAccountsTest() {
    accounts.adoptThread();
    accounts.setResumedHandler([this] { ++resumed; });
  }
  void add(UserIndex user, std::size_t bytes) { accounts.add(user, MemoryKind::Waiting, bytes); }
  void done(UserIndex user, std::size_t bytes) {
    std::thread([&] { accounts.remove(user, MemoryKind::Waiting, bytes); }).join();
  }
  UserAccounts accounts{{.maxUserBytes = 2000,
                         .maxBytes = 3500,
                         .maxUserWaitingBytes = 500,
                         .maxWaitingBytes = 1000}};
  const UserIndex a = accounts.enter(501).value();
  const UserIndex b = accounts.enter(502).value();
  const UserIndex c = accounts.enter(503).value();
  int resumed = 0;
};

TEST_F(UserAccountsTest, BeyondHisBoundAUserWaitsForHalfOfItAndNobodyElseDoes) {
  add(a, 500);
  add(b, 100);
  EXPECT_FALSE(accounts.isPaused(a));
  add(a, 1);
  EXPECT_TRUE(accounts.isPaused(a));
  EXPECT_FALSE(accounts.isPaused(b));
  done(a, 250);
  EXPECT_TRUE(accounts.isPaused(a));
  done(b, 100);
  EXPECT_EQ(resumed, 0);
  done(a, 1);
  EXPECT_EQ(resumed, 1);
  EXPECT_FALSE(accounts.isPaused(a));
  done(a, 250);
  EXPECT_EQ(resumed, 1);
  EXPECT_EQ(accounts.total(MemoryKind::Waiting), 0);
}

TEST_F(UserAccountsTest, WhenTooMuchWaitsTheBoundIsAnEqualShare) {
  add(kServiceItself, 300);  // has no share, and is never paused
  add(a, 400);
  add(b, 100);
  add(c, 150);
  EXPECT_FALSE(accounts.isPaused(a));
  EXPECT_FALSE(accounts.isTooMuchWaiting());
  add(c, 51);
  add(a, 1);
  EXPECT_TRUE(accounts.isTooMuchWaiting());
  EXPECT_TRUE(accounts.isPaused(a));  // 333 are his
  EXPECT_FALSE(accounts.isPaused(b));
  EXPECT_FALSE(accounts.isPaused(c));
  EXPECT_FALSE(accounts.isPaused(kServiceItself));
  done(a, 235);
  EXPECT_EQ(resumed, 1);
}

TEST_F(UserAccountsTest, WhoHoldsTooMuchOfAllKindsIsFullUntilHeHoldsLess) {
  accounts.add(a, MemoryKind::Kept, 1500);
  accounts.add(a, MemoryKind::Unread, 500);
  add(a, 400);
  EXPECT_FALSE(accounts.isFull(a)) << "what waits is bounded by itself";
  accounts.add(b, MemoryKind::Delayed, 1400);
  accounts.add(a, MemoryKind::Kept, 1);
  EXPECT_TRUE(accounts.isFull(a));
  accounts.add(c, MemoryKind::Kept, 99);
  accounts.remove(a, MemoryKind::Kept, 1);
  EXPECT_FALSE(accounts.isFull(a)) << "although nothing more was added, which was refused";
  accounts.add(kServiceItself, MemoryKind::Kept, 2);
  add(b, 1);
  EXPECT_TRUE(accounts.isFull(b)) << "a third of all is his";
  EXPECT_FALSE(accounts.isFull(c));
  EXPECT_FALSE(accounts.isFull(kServiceItself));
  EXPECT_TRUE(accounts.mayHold(c, MemoryKind::Frames, 5000)) << "the first one";
  accounts.add(c, MemoryKind::Frames, 400);
  EXPECT_TRUE(accounts.mayHold(c, MemoryKind::Frames, 100));
  EXPECT_FALSE(accounts.mayHold(c, MemoryKind::Frames, 101));
}

TEST_F(UserAccountsTest, AnAccountIsAnothersOnceItsUserHoldsNothing) {
  accounts.add(b, MemoryKind::Delayed, 1);
  accounts.leave(b);
  EXPECT_NE(accounts.enter(504), b);
  EXPECT_EQ(accounts.enter(502), b);
  EXPECT_EQ(accounts.connections(b), 1u);
  accounts.leave(b);
  accounts.remove(b, MemoryKind::Delayed, 1);
  EXPECT_EQ(accounts.enter(505), b);
  EXPECT_EQ(accounts.enter(501), a);
  EXPECT_EQ(accounts.connections(a), 2u);
  for (uid_t user = 1000; accounts.enter(user); ++user) ASSERT_LT(user, 5096u);
  EXPECT_EQ(accounts.enter(501), a) << "who is there already may come once more";
}

}  // namespace
}  // namespace vx::lnx
