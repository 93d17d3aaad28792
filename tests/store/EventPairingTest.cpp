#include "platform/linux/store/EventPairing.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

using Sharing = StoreRecord::Sharing;

class EventPairingTest : public StoreTest {
 protected:
  void add(StoreRecord::What what, double time = 10) { batch.push_back({time, std::move(what)}); }
  // The places of the events behind the message in a place.
  std::vector<uint32_t> sharersOf(std::size_t place) {
    std::vector<uint32_t> places;
    for (uint32_t i = batch[place].nextSharer; i != StoreRecord::kNone; i = batch[i].nextSharer)
      places.push_back(i);
    return places;
  }
  void nextBatch() {
    batch.clear();
    pairing.join(batch);
  }
  StoreRecords batch;
  EventPairing pairing;
};

TEST_F(EventPairingTest, EventsFindTheirMessageInTheirOrder) {
  const Payload a = numbered(1);
  const Payload b = numbered(1);  // equal, another one
  add(event("e", tagged(a), a));
  add(message(a));
  add(message(b));
  add(message(Payload()));
  add(message(a));  // to a second session
  add(event("e", tagged(a), a));
  add(event("e", tagged(b), b));
  add(event("e", tagged(Payload()), Payload()));
  pairing.pair(batch);
  EXPECT_THAT(sharersOf(1), ElementsAre(0, 5));
  EXPECT_THAT(sharersOf(2), ElementsAre(6));
  EXPECT_THAT(sharersOf(3), IsEmpty());
  EXPECT_THAT(sharersOf(4), IsEmpty());
  EXPECT_EQ(batch[7].sharing, Sharing::No);
}

TEST_F(EventPairingTest, EachOfManyMessagesIsFound) {
  std::vector<Payload> payloads;
  for (int i = 0; i < 700; ++i) payloads.push_back(numbered(i));
  for (const Payload& payload : payloads) add(message(payload));
  for (const Payload& payload : payloads) add(event("e", payload, payload));
  pairing.pair(batch);
  for (uint32_t i = 0; i < 700; ++i) ASSERT_THAT(sharersOf(i), ElementsAre(700 + i));
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
  EXPECT_EQ(EventPairing::unwrittenRows(batch, 0), 2u);
  nextBatch();
  EXPECT_EQ(pairing.heldSince(), std::nullopt);
  add(message(late));
  pairing.pair(batch);
  EXPECT_THAT(sharersOf(2), ElementsAre(0));
  pairing.hold(batch, 10, Monotonic(6s));
  EXPECT_EQ(pairing.heldSince(), std::nullopt);  // not twice
  EXPECT_EQ(EventPairing::unwrittenRows(batch, 0), 3u);
}

TEST_F(EventPairingTest, WhatIsWrittenIsNeitherLostNorKept) {
  const Payload a = numbered(1);
  add(message(a));
  add(message(numbered(2)));
  add(event("e", a, a));
  pairing.pair(batch);
  EXPECT_EQ(EventPairing::unwrittenRows(batch, 0), 3u);
  EventPairing::markWritten(batch, 0, 1);
  EXPECT_EQ(EventPairing::unwrittenRows(batch, 1), 1u);
  EXPECT_EQ(std::get<RelayMessageRecord>(batch[0].what).payload.identity(), nullptr);
  EXPECT_NE(std::get<RelayMessageRecord>(batch[1].what).payload.identity(), nullptr);
}

}  // namespace
}  // namespace vx::lnx
