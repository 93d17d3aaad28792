#include "platform/linux/store/StoreQueue.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

using Turn = StoreQueue::Turn;

class StoreQueueTest : public StoreTest {
 protected:
  static constexpr std::size_t kRecord = sizeof(StoreRecord);
  StoreQueueTest() {
    options.commit = {.rows = 3, .bytes = 1000000, .interval = 200ms};
    p.clock.steady = Monotonic(1s);  // past for the machine: nothing really waits
  }
  bool append(std::size_t bytes = 0) { return queue().append(power(1), bytes); }
  Turn take() { return queue().tryTake(batch, heldSince); }
  bool flush() {
    FlushHandler handler = [this](const std::optional<Error>&) { ++flushed; };
    const bool taken = queue().appendFlush(handler);
    EXPECT_EQ(static_cast<bool>(handler), !taken);
    return taken;
  }
  StoreQueue& queue() {
    if (!made) made.emplace(options, p.clock);
    return *made;
  }
  StoreOptions options;
  std::optional<StoreQueue> made;
  std::optional<Monotonic> heldSince;
  StoreBatch batch;
  int flushed = 0;
};

TEST_F(StoreQueueTest, BatchIsDueByRowsBytesOrTime) {
  EXPECT_EQ(take(), Turn::Nothing);
  append();
  append();
  EXPECT_EQ(take(), Turn::Nothing);
  append();
  EXPECT_EQ(take(), Turn::Batch);
  EXPECT_EQ(batch.records.size(), 3u);
  EXPECT_EQ(batch.bytes, 3 * kRecord);
  append(1000000 - kRecord - 1);
  EXPECT_EQ(take(), Turn::Nothing);
  append();
  EXPECT_EQ(take(), Turn::Batch);
  p.clock.advance(10s);
  append();
  p.clock.advance(199ms);
  append();  // the first one's time counts
  EXPECT_EQ(take(), Turn::Nothing);
  p.clock.advance(1ms);
  EXPECT_EQ(take(), Turn::Batch);
  EXPECT_FALSE(batch.urgent);
  EXPECT_EQ(take(), Turn::Nothing);
}

TEST_F(StoreQueueTest, FlushIsDueAtOnceAndKnowsItsPlace) {
  append();
  EXPECT_TRUE(flush());
  append();
  EXPECT_EQ(take(), Turn::Batch);
  EXPECT_TRUE(batch.urgent);
  ASSERT_EQ(batch.flushes.size(), 1u);
  EXPECT_EQ(batch.flushes[0].records, 1u);
  append();
  EXPECT_EQ(take(), Turn::Nothing);  // the hurry is over
  EXPECT_TRUE(flush());
  EXPECT_EQ(take(), Turn::Batch);
}

TEST_F(StoreQueueTest, HeldEventsAreDueWhenTheyWouldBeInTheQueueAndAtItsClose) {
  heldSince = p.clock.monotonic();
  p.clock.advance(199ms);
  append();
  EXPECT_EQ(take(), Turn::Nothing);
  p.clock.advance(1ms);
  EXPECT_EQ(take(), Turn::Batch);
  append();
  queue().close({});
  EXPECT_FALSE(append());
  EXPECT_EQ(queue().lostRows(), 1u);
  EXPECT_FALSE(flush());
  for (const std::size_t records : {1, 0}) {  // the second is for the held ones
    EXPECT_EQ(take(), Turn::Batch);
    EXPECT_EQ(batch.records.size(), records);
    EXPECT_TRUE(batch.urgent);
  }
  heldSince.reset();
  EXPECT_EQ(take(), Turn::End);
}

TEST_F(StoreQueueTest, WhatWaitsIsOnTheAccountsOfWhoCausedItUntilItIsReleased) {
  UserAccounts accounts;
  queue().setAccounts(accounts);
  const Cause causes[] = {{}, {.user = accounts.enter(501).value()}};
  for (const Cause* cause : {&causes[1], &causes[0], &causes[1]}) {
    const CauseScope scope(*cause);
    append(kRecord);
  }
  const auto waiting = [&] {
    return std::pair(accounts.bytes(0, MemoryKind::Waiting) / kRecord,
                     accounts.bytes(causes[1].user, MemoryKind::Waiting) / kRecord);
  };
  take();
  EXPECT_EQ(waiting(), std::pair(2ul, 4ul));
  queue().release(batch, 1, 2);
  EXPECT_EQ(waiting(), std::pair(1ul, 2ul));
  queue().release(batch, 1, 1);
  EXPECT_EQ(waiting(), std::pair(0ul, 0ul));
  queue().close({});
  append();
  EXPECT_EQ(accounts.total(MemoryKind::Waiting), 0);
}

TEST_F(StoreQueueTest, JobsComeFirst) {
  append();
  flush();
  int ran = 0;
  queue().runSoon([&] { ++ran; });
  EXPECT_EQ(take(), Turn::Jobs);
  for (const auto& job : queue().takeJobs()) job();
  EXPECT_EQ(ran, 1);
  EXPECT_EQ(take(), Turn::Batch);
}

// What is refused then, or was not taken by then, leaves its call undone.
TEST_F(StoreQueueTest, RetriesEndWithTheDeadlineOfTheClose) {
  const Monotonic now = p.clock.monotonic();
  EXPECT_TRUE(queue().waitBeforeRetry(now));
  within({recorded(), {}}, [&] { append(); });
  queue().close(now + 1s);
  queue().close(now + 2s);  // the first one counts
  within({recorded(), {}}, [&] { EXPECT_FALSE(append()); });
  EXPECT_EQ(queue().lostRows(), 0u);
  EXPECT_TRUE(queue().waitBeforeRetry(now + 1h));
  p.clock.advance(1s);
  EXPECT_FALSE(queue().waitBeforeRetry(now + 1h));
  made.reset();
  EXPECT_EQ(undone(), 2);
}

}  // namespace
}  // namespace vx::lnx
