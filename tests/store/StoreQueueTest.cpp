#include "platform/linux/store/StoreQueue.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

class StoreQueueTest : public StoreTest {
 protected:
  static constexpr std::size_t kRecord = sizeof(StoreRecord);
  StoreQueueTest() { p.clock.steady = Monotonic(1s); }  // past for the machine: nothing waits
  bool append(std::size_t bytes = 0) { return queue.append({1.0, power(1)}, bytes); }
  // What the writer's next turn is; of a batch, how many records it has.
  std::string take() {
    const StoreQueue::Turn turn = queue.tryTake(batch, heldSince);
    if (turn == StoreQueue::Turn::Batch)
      return std::to_string(batch.records.size()) + (batch.urgent ? " urgent" : "");
    return turn == StoreQueue::Turn::Jobs ? "jobs" : turn == StoreQueue::Turn::End ? "end" : "";
  }
  bool flush() {
    FlushHandler handler = [](const std::optional<Error>&) {};
    const bool taken = queue.appendFlush(handler);
    EXPECT_EQ(static_cast<bool>(handler), !taken);
    return taken;
  }
  StoreQueue queue{
      {.queueBytes = 20 * kRecord, .commit = {.rows = 3, .bytes = 1000000, .interval = 200ms}},
      p.clock};
  std::optional<Monotonic> heldSince;
  StoreBatch batch;
};

TEST_F(StoreQueueTest, BatchIsDueByRowsBytesOrTime) {
  EXPECT_EQ(take(), "");
  append();
  append();
  EXPECT_EQ(take(), "");
  append();
  EXPECT_EQ(take(), "3");
  EXPECT_EQ(batch.bytes, 3 * kRecord);
  append(1000000 - kRecord - 1);
  EXPECT_EQ(take(), "");
  append();
  EXPECT_EQ(take(), "2");
  p.clock.advance(10s);
  append();
  p.clock.advance(199ms);
  append();  // the first one's time counts
  EXPECT_EQ(take(), "");
  p.clock.advance(1ms);
  EXPECT_EQ(take(), "2");
  EXPECT_EQ(take(), "");
}

TEST_F(StoreQueueTest, FlushIsDueAtOnceAndKnowsItsPlace) {
  append();
  EXPECT_TRUE(flush());
  append();
  EXPECT_EQ(take(), "2 urgent");
  ASSERT_EQ(batch.flushes.size(), 1u);
  EXPECT_EQ(batch.flushes[0].records, 1u);
  append();
  EXPECT_EQ(take(), "");  // the hurry is over
  EXPECT_TRUE(flush());
  EXPECT_EQ(take(), "1 urgent");
}

TEST_F(StoreQueueTest, HeldEventsAreDueWhenTheyWouldBeInTheQueue) {
  heldSince = p.clock.monotonic();
  p.clock.advance(199ms);
  append();
  EXPECT_EQ(take(), "");
  p.clock.advance(1ms);
  EXPECT_EQ(take(), "1");
  append();
  queue.close({});
  EXPECT_FALSE(append());
  EXPECT_FALSE(flush());
  EXPECT_EQ(take(), "1 urgent");
  EXPECT_EQ(take(), "0 urgent");  // for the held ones
  heldSince.reset();
  EXPECT_EQ(take(), "end");
}

TEST_F(StoreQueueTest, CongestedAboveTheBoundUntilHalfIsReleased) {
  append(19 * kRecord);
  EXPECT_FALSE(queue.isCongested());
  take();
  append(0);
  EXPECT_TRUE(queue.isCongested());
  EXPECT_FALSE(queue.release(11 * kRecord - 1));
  EXPECT_TRUE(queue.isCongested());
  EXPECT_TRUE(queue.release(1));
  EXPECT_FALSE(queue.isCongested());
  EXPECT_FALSE(queue.release(kRecord));
}

TEST_F(StoreQueueTest, JobsComeFirstAndRetriesEndWithTheDeadlineOfTheClose) {
  const Monotonic now = p.clock.monotonic();
  append();
  flush();
  int ran = 0;
  queue.runSoon([&] { ++ran; });
  EXPECT_EQ(queue.waitBeforeRetry(now + 1h), StoreQueue::Retry::JobsFirst);
  EXPECT_EQ(take(), "jobs");
  for (const auto& job : queue.takeJobs()) job();
  EXPECT_EQ(ran, 1);
  EXPECT_EQ(take(), "1 urgent");
  EXPECT_EQ(queue.waitBeforeRetry(now), StoreQueue::Retry::Now);
  queue.close(now + 1s);
  queue.close(now + 2s);  // the first one counts
  EXPECT_EQ(queue.waitBeforeRetry(now + 1h), StoreQueue::Retry::Now);
  p.clock.advance(1s);
  EXPECT_EQ(queue.waitBeforeRetry(now + 1h), StoreQueue::Retry::NoMore);
}

}  // namespace
}  // namespace vx::lnx
