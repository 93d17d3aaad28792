#include <gmock/gmock.h>
#include <gtest/gtest.h>

#include "platform/linux/ipc/ReadTurns.h"
#include "tests/fakes/FakeExecution.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;

// Readers that take a time of their own choosing; nobody sleeps.
class ReadTurnsTest : public testing::Test {
 protected:
  ReadTurnsTest() { executor.adoptInteractiveThread(); }
  struct Reader : TurnTaker {
    Reader(ReadTurnsTest& test, uid_t user, char name, std::chrono::nanoseconds takes, int more)
        : test(test), user(user), name(name), takes(takes), more(more) {}
    void takeTurn(ReadTurn& turn) override {
      test.took += name;
      // What it queues is its own cost.
      test.queue->async([this] { test.clock.advance(takes); });
      (void)turn.goOn();
      if (more-- > 0) test.turns.add(user, test.self(*this));
    }
    void turnsEnded() override { test.told += name; }
    ReadTurnsTest& test;
    uid_t user;
    char name;
    std::chrono::nanoseconds takes;
    int more;
  };

  std::shared_ptr<TurnTaker> self(Reader& reader) {
    for (const auto& known : readers)
      if (known.get() == &reader) return known;
    return nullptr;
  }
  void add(uid_t user, char name, std::chrono::nanoseconds takes, int more) {
    readers.push_back(std::make_shared<Reader>(*this, user, name, takes, more));
    turns.add(user, readers.back());
  }
  // What one round gave to whom.
  std::string round() {
    took.clear();
    somebodyLeft = turns.runRound();
    return took;
  }

  fakes::FakeClock clock;
  UserAccounts accounts;
  Executor executor{accounts};
  std::shared_ptr<WorkQueue> queue = executor.makeSerial("work", QualityOfService::UserInteractive);
  ReadTurns turns{executor, clock};
  std::vector<std::shared_ptr<Reader>> readers;
  std::string took;
  std::string told;
  bool somebodyLeft = false;
};

TEST_F(ReadTurnsTest, ConnectionsDoNotBuyTime) {
  for (int i = 0; i < 20; ++i) add(0, 'a', 200us, 100);  // as many connections as one likes
  add(1, 'b', 10us, 1);
  EXPECT_EQ(round(), "aaab");  // 500 us, and then the other's turn
  EXPECT_EQ(round(), "aab");   // 100 us were too much before
  EXPECT_TRUE(somebodyLeft);
}

TEST_F(ReadTurnsTest, EachConnectionHasItsTurnBeforeOneHasTwo) {
  add(0, 'a', 1us, 5);
  add(0, 'b', 1us, 0);
  EXPECT_EQ(round(), "ab");
  EXPECT_EQ(round(), "a");
}

TEST_F(ReadTurnsTest, WhatWasTakenTooMuchIsOwedWhileOthersWait) {
  add(0, 'a', 1600us, 100);
  add(1, 'b', 10us, 3);
  EXPECT_EQ(round(), "ab");
  EXPECT_EQ(round(), "b");
  EXPECT_EQ(round(), "b");
  EXPECT_EQ(round(), "ab");  // 1100 us are paid for
  EXPECT_EQ(round(), "a");   // who is alone owes nobody
  EXPECT_TRUE(somebodyLeft);
}

TEST_F(ReadTurnsTest, AfterTheEndNobodyReads) {
  add(0, 'a', 1us, 1);
  turns.end();
  add(1, 'b', 1us, 1);
  EXPECT_EQ(round(), "");
  EXPECT_FALSE(somebodyLeft);
  EXPECT_EQ(told, "a");
}

}  // namespace
}  // namespace vx::lnx
