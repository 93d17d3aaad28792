#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <thread>
#include <vector>

#include "platform/linux/execution/Executor.h"
#include "tests/linux/Latch.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;

Monotonic soon() { return std::chrono::steady_clock::now() + 30s; }

class ExecutorTest : public ::testing::Test {
 protected:
  ~ExecutorTest() override { executor.stop(soon()); }
  Executor executor;
};

TEST_F(ExecutorTest, InteractiveWorkRunsOnlyWhenDrainedAndInOrder) {
  executor.adoptInteractiveThread();
  const auto a = executor.makeSerial("a", QualityOfService::UserInteractive);
  std::vector<int> ran;
  a->async([&] {
    EXPECT_TRUE(a->isCurrent());
    ran.push_back(1);
    a->async([&] { ran.push_back(3); });
  });
  a->async([&] { ran.push_back(2); });
  EXPECT_TRUE(ran.empty());
  EXPECT_FALSE(executor.prepareToSleep());
  EXPECT_FALSE(executor.runInteractive(100));
  EXPECT_EQ(ran, (std::vector<int>{1, 2, 3}));
  EXPECT_TRUE(executor.prepareToSleep());
}

TEST_F(ExecutorTest, SleepingLoopIsWokenOncePerSleep) {
  std::atomic<int> wakes{0};
  executor.setInteractiveWaker([&] { ++wakes; });
  executor.adoptInteractiveThread();
  const auto a = executor.makeSerial("a", QualityOfService::UserInteractive);
  EXPECT_TRUE(executor.prepareToSleep());
  std::thread([&] {
    for (int i = 0; i < 10; ++i) a->async([] {});
  }).join();
  EXPECT_EQ(wakes, 1);
  executor.runInteractive(100);
  a->async([] {});  // from the thread itself: it is awake
  EXPECT_EQ(wakes, 1);
}

TEST_F(ExecutorTest, DelayedInteractiveWorkJoinsWhenDue) {
  const auto a = executor.makeSerial("a", QualityOfService::UserInteractive);
  bool ran = false;
  a->asyncAfter(20ms, [&] { ran = true; });
  EXPECT_FALSE(executor.runInteractive(10));
  const auto due = executor.nextInteractiveDue();
  ASSERT_TRUE(due);
  EXPECT_FALSE(ran);
  std::this_thread::sleep_until(
      std::chrono::time_point_cast<std::chrono::steady_clock::duration>(*due));
  executor.runInteractive(10);
  EXPECT_TRUE(ran);
  EXPECT_FALSE(executor.nextInteractiveDue());
}

TEST_F(ExecutorTest, ManyQueuesKeepTheirOrderAcrossThreads) {
  constexpr int kQueues = 500;
  constexpr int kItems = 40;
  std::vector<std::shared_ptr<WorkQueue>> queues;
  std::vector<std::vector<int>> seen(kQueues);
  for (int q = 0; q < kQueues; ++q)
    queues.push_back(executor.makeSerial("q", QualityOfService::Utility));
  auto produce = [&](int from, int to) {
    for (int i = 0; i < kItems; ++i) {
      for (int q = from; q < to; ++q) queues[q]->async([&seen, q, i] { seen[q].push_back(i); });
    }
  };
  std::thread first(produce, 0, kQueues / 2);
  std::thread second(produce, kQueues / 2, kQueues);
  first.join();
  second.join();
  ASSERT_TRUE(executor.drain(soon()));
  EXPECT_EQ(executor.utilityBacklog(), 0u);
  for (const auto& order : seen) {
    ASSERT_EQ(order.size(), static_cast<std::size_t>(kItems));
    EXPECT_TRUE(std::is_sorted(order.begin(), order.end()));
  }
}

TEST_F(ExecutorTest, BlockedQueuesDelayNobody) {
  constexpr int kBlocked = 200;
  Latch release;
  std::atomic<int> done{0};
  std::vector<std::shared_ptr<WorkQueue>> queues;
  for (int i = 0; i < kBlocked; ++i) {
    queues.push_back(executor.makeSerial("blocked", QualityOfService::Utility));
    queues.back()->async([&] {
      Blocking blocking(executor);
      if (release.wait()) ++done;
    });
  }
  Latch served;
  const auto other = executor.makeSerial("other", QualityOfService::Utility);
  other->async([&] { served.open(); });
  EXPECT_TRUE(served.wait());
  EXPECT_EQ(done, 0);
  release.open();
  EXPECT_TRUE(executor.drain(soon()));
  EXPECT_EQ(done, kBlocked);
}

TEST_F(ExecutorTest, LowWaterIsToldWhenABacklogFalls) {
  std::atomic<int> told{0};
  executor.setUtilityLowWater(10, [&] { ++told; });
  const auto queue = executor.makeSerial("q", QualityOfService::Utility);
  Latch go;
  queue->async([&] { go.wait(); });
  for (int i = 0; i < 100; ++i) queue->async([] {});
  EXPECT_GE(executor.utilityBacklog(), 100u);
  EXPECT_EQ(told, 0);
  go.open();
  EXPECT_TRUE(executor.drain(soon()));
  EXPECT_EQ(told, 1);
}

TEST_F(ExecutorTest, UndueWorkIsDroppedAtTheEndAndLateWorkAtOnce) {
  auto witness = std::make_shared<int>(0);
  const std::weak_ptr<int> dropped = witness;
  executor.background().asyncAfter(1h, [witness = std::move(witness)] { ++*witness; });
  executor.stop(soon());
  EXPECT_TRUE(dropped.expired());
  auto late = std::make_shared<int>(0);
  executor.background().async([late] { ++*late; });
  executor.background().asyncAfter(1h, [late] { ++*late; });
  EXPECT_EQ(late.use_count(), 1);
}

TEST_F(ExecutorTest, OneBusyQueueLetsTheOthersHaveTheirTurn) {
  executor.adoptInteractiveThread();
  const auto busy = executor.makeSerial("busy", QualityOfService::UserInteractive);
  const auto other = executor.makeSerial("other", QualityOfService::UserInteractive);
  int before = 0;
  bool ran = false;
  for (int i = 0; i < 1000; ++i) busy->async([&] { before += ran ? 0 : 1; });
  other->async([&] { ran = true; });
  EXPECT_TRUE(executor.runInteractive(10));
  EXPECT_EQ(before, 10);
  EXPECT_FALSE(ran);
  executor.runInteractive(64 + 1);
  EXPECT_TRUE(ran);
  EXPECT_FALSE(executor.runInteractive(2000));
  EXPECT_FALSE(executor.runInteractive(1));
}

}  // namespace
}  // namespace vx::lnx
