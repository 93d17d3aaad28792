#include "platform/linux/store/EventPairing.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

class EventPairingTest : public StoreTest {
 protected:
  void add(StoreRecord::What what, double time = 10) { batch.push_back({time, std::move(what)}); }
  void addOf(const JournalTicket& call, StoreRecord::What what) {
    batch.push_back({10, std::move(what), {call, {}}});
  }
  // The place of the event that shares the text of the message in a place.
  uint32_t eventOf(std::size_t place) { return batch[place].event; }
  void nextBatch() {
    batch.clear();
    pairing.join(batch);
  }
  StoreRecords batch;
  EventPairing pairing;
};

TEST_F(EventPairingTest, EventOfAnotherCallIsNotInTheRow) {
  const Payload a = numbered(1);
  const JournalTicket first = recorded();
  addOf(first, message(a));
  addOf(recorded(), event("e", tagged(a), a));
  addOf(first, event("e", tagged(a), a));
  pairing.pair(batch);
  EXPECT_EQ(eventOf(0), 2u);
}

TEST_F(EventPairingTest, EachOfManyMessagesIsFound) {
  std::vector<Payload> payloads;
  for (int i = 0; i < 700; ++i) payloads.push_back(numbered(i));
  for (const Payload& payload : payloads) add(message(payload));
  for (const Payload& payload : payloads) add(event("e", payload, payload));
  pairing.pair(batch);
  for (uint32_t i = 0; i < 700; ++i) ASSERT_EQ(eventOf(i), 700 + i);
}

TEST_F(EventPairingTest, YoungEventWaitsOneBatchForItsMessage) {
  const Payload late = numbered(1);
  const Payload never = numbered(2);
  add(event("old", late, late), 9.9);
  add(event("late", late, late), 10);
  add(event("never", never, never), 11);
  add(event("nobody's", numbered(3)), 11);
  pairing.pair(batch);
  EXPECT_EQ(pairing.heldSince(), std::nullopt);
  pairing.hold(batch, 10, Monotonic(5s));
  EXPECT_EQ(pairing.heldSince(), Monotonic(5s));
  EXPECT_EQ(EventPairing::unwrittenRows(batch, 0).lost, 2u);
  nextBatch();
  EXPECT_EQ(pairing.heldSince(), std::nullopt);
  add(message(late));
  pairing.pair(batch);
  EXPECT_EQ(eventOf(2), 0u);
  pairing.hold(batch, 10, Monotonic(6s));
  EXPECT_EQ(pairing.heldSince(), std::nullopt);  // not twice
  EXPECT_EQ(EventPairing::unwrittenRows(batch, 0).lost, 3u);
}

TEST_F(EventPairingTest, WhatIsWrittenIsNeitherLostNorKeptAndItsCallIsDone) {
  const Payload a = numbered(1);
  const Payload b = numbered(2);
  addOf(recorded(), power(1));
  const JournalTicket call = recorded();
  addOf(call, event("early", b, b));
  addOf(call, message(a));
  addOf(call, message(b));
  addOf(recorded(), RelayEndRecord{row});
  addOf(call, event("e", a, a));
  pairing.pair(batch);
  EXPECT_EQ(EventPairing::unwrittenRows(batch, 0).recorded, 5u);
  EXPECT_EQ(EventPairing::markWritten(batch, 0, 3), 0u);
  const EventPairing::Unwritten left = EventPairing::unwrittenRows(batch, 3);
  EXPECT_EQ(left.recorded, 2u);  // with the early one
  EXPECT_EQ(left.lost, 0u);
  EXPECT_EQ(std::get<RelayMessageRecord>(batch[2].what).payload.identity(), nullptr);
  EXPECT_NE(std::get<RelayMessageRecord>(batch[3].what).payload.identity(), nullptr);
  EXPECT_FALSE(batch[5].cause.ticket);
  EXPECT_TRUE(batch[1].cause.ticket);  // its message is not
  EventPairing::abandon(batch, 3);
  batch.clear();
  EXPECT_EQ(undone(), 2);
}

}  // namespace
}  // namespace vx::lnx
