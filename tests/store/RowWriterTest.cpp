#include <stdexcept>

#include "platform/linux/store/EventPairing.h"
#include "platform/linux/store/RowWriter.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

class BatchTest : public StoreTest {
 protected:
  void add(StoreRecord::What what, double time = 1.5) { batch.push_back({time, std::move(what)}); }
  void addOf(const JournalTicket& call, StoreRecord::What what) {
    batch.push_back({1.5, std::move(what), {call, {}}});
  }
  StoreRecords batch;
};

class RowWriterTest : public BatchTest {
 protected:
  static constexpr std::size_t kMostText = 100;

  // Writes what was added and begins the next batch.
  Status write(const std::vector<LedgerNote>& notes = {}) {
    EventPairing().pair(batch);
    const Result<RowWriter::Written> result = writer.write(batch, 0, batch.size(), notes);
    if (!result.ok()) return result.status();
    written = *result;
    batch.clear();
    return {};
  }
  Rows query(const std::string& sql) { return StoreTest::query(database.get(), sql); }
  // A payload whose text is so long.
  static Payload ofLength(std::size_t bytes) {
    return PayloadBuilder().set("f", std::string(bytes - 8, 'x')).build();
  }

  Database database = openStoreDatabase(":memory:", kEpoch).database;
  RowWriter writer{database.get(), kMostText, nullptr, p.clock};
  RowWriter::Written written;
};

TEST_F(RowWriterTest, EveryColumnIsWhatWasGivenAndOfItsKind) {
  const auto alone = std::make_shared<RelayRow>();
  add(opening(alone, {{kVyrReportingSessionInfoSessionID, int32_t{-1}}}, Payload()));
  add(RelayMessageRecord{alone, ofLength(100), 1, 1});
  for (const std::size_t allowance : {50, 101}) {  // both rows or none
    const auto cut = writer.write(batch, 0, 2, {}, allowance);
    EXPECT_EQ(cut->last, 1u);
    EXPECT_EQ(cut->wanted, 102u);
    EXPECT_EQ(cut->rows, 0u);
    EXPECT_EQ(query("SELECT count(*) FROM relay_sessions").at(0), "0");
  }
  EXPECT_TRUE(write().ok());
  EXPECT_EQ(written.rows, 2u);
  query("DELETE FROM relay_messages");
  add(opening(row, sessionInfo(int64_t{1} << 40)), 2);
  add(RelayMessageRecord{row, PayloadBuilder().set("x", 0.5).set("t", true).build(), 65535, 65534},
      2.5);
  add(event("name", numbered(1)), 3);
  add(PowerRecord{28, "Lumo_Haptics", numbered(2)}, 4);
  EXPECT_TRUE(write({{"what", "", 0, "why"}, {"what", "t", 3, "why"}}).ok());
  EXPECT_EQ(written.rows, 4u);
  EXPECT_THAT(query("SELECT * FROM relay_sessions"),
              ElementsAre("1|1.5|-1|null|null|||null|null|{}|null|null|null|null|null",
                          "2|2.0|1099511627776|19|2.5|c|s|1|0|{\"clientName\":\"c\","
                          "\"serviceName\":\"s\"}|null|null|null|null|null"));
  EXPECT_THAT(
      query("SELECT * FROM relay_messages"),
      ElementsAre("2|2.5|2|65535|65534|{\"x\":0.5,\"t\":true}|null|null|null|null|null|null|null"));
  EXPECT_THAT(query("SELECT * FROM analytics_events"),
              ElementsAre("3|3.0|1970-01-01 00:00:03.000|name|{\"i\":1}|null"));
  EXPECT_THAT(query("SELECT * FROM power_records"),
              ElementsAre("1|4.0|28|Lumo_Haptics|{\"i\":2}|null|null|null"));
  EXPECT_THAT(query("SELECT id, time = 1576800000, event, table_name, rows, detail "
                    "FROM store_ledger"),
              ElementsAre("1|1|what|null|0|why", "2|1|what|t|3|why"));
}

TEST_F(RowWriterTest, EventsShareTheTextOfTheirMessages) {
  const Payload own = PayloadBuilder().set("app", "client's").set("i", 5).build();
  const Payload messages[] = {numbered(1), numbered(2), numbered(3), Payload(), own};
  add(event("before", tagged(messages[0]), messages[0]));
  for (const Payload& each : messages) add(message(each));
  add(message(messages[1]));  // to a second session
  add(event("after", tagged(messages[1]), messages[1]));
  add(event("again", tagged(messages[1]), messages[1]));
  add(event("more", tagged(messages[1]), messages[1]));
  add(event("same", messages[2], messages[2]));
  add(event("empty", tagged(Payload()), Payload()));
  add(event("replaced", tagged(own), own));
  add(event("alone", tagged(numbered(6)), numbered(6)));
  add(AnalyticsRecord{"bad", Payload(), []() -> Payload { throw std::runtime_error("no"); }});
  EXPECT_TRUE(write().ok());
  EXPECT_EQ(written.rows, 14u);
  EXPECT_EQ(written.failedBuilders, 1u);
  EXPECT_THAT(
      query("SELECT id, name, payload FROM analytics_events ORDER BY name"),
      ElementsAre("2|after|{\"i\":2,\"app\":\"x\\\"y\"}", "7|again|{\"i\":2,\"app\":\"x\\\"y\"}",
                  "10|alone|{\"i\":6,\"app\":\"x\\\"y\"}", "1|before|{\"i\":1,\"app\":\"x\\\"y\"}",
                  "9|empty|{\"app\":\"x\\\"y\"}", "8|more|{\"i\":2,\"app\":\"x\\\"y\"}",
                  "6|replaced|{\"app\":\"x\\\"y\",\"i\":5}", "3|same|{\"i\":3}"));
  EXPECT_THAT(query("SELECT payload, event_tail FROM relay_messages WHERE event_tail IS NOT NULL"),
              ElementsAre("{\"i\":1}|,\"app\":\"x\\\"y\"}", "{\"i\":2}|,\"app\":\"x\\\"y\"}",
                          "{\"i\":3}|}", "{\"i\":2}|,\"app\":\"x\\\"y\"}"));
}

TEST_F(RowWriterTest, FailedWriteLeavesNothingAndCanBeRepeated) {
  query("CREATE TRIGGER refuse BEFORE INSERT ON power_records BEGIN SELECT RAISE(FAIL, 'no'); END");
  add(opening(row, sessionInfo(1)));
  add(message(numbered(1)));
  add(event("e", ofLength(kMostText + 1)));
  add(power(1));
  const Status failed = write({{"what", "", 0, "why"}});
  EXPECT_EQ(failed.text(), "no");
  for (const char* table : {"relay_messages", "event_names", "store_ledger"})
    EXPECT_THAT(query(std::string("SELECT count(*) FROM ") + table), ElementsAre("0"));
  query("DROP TRIGGER refuse");
  EXPECT_TRUE(write().ok());
  EXPECT_EQ(written.rows, 4u);
  EXPECT_THAT(query("SELECT name FROM analytics_events"), ElementsAre("e"));
  EXPECT_THAT(query("SELECT event FROM store_ledger"), ElementsAre("left_out"));
  add(event("e", numbered(2)));
  add(event("f", numbered(3)));
  EXPECT_TRUE(write().ok());
  add(event("e", numbered(4)));
  RowWriter next(database.get(), kMostText, nullptr, p.clock);  // after a restart
  EXPECT_TRUE(next.write(batch, 0, 1, {}).ok());
  EXPECT_THAT(query("SELECT name FROM analytics_events"), ElementsAre("e", "e", "f", "e"));
  EXPECT_THAT(query("SELECT event FROM store_ledger"), ElementsAre("left_out"));
}

TEST_F(RowWriterTest, PayloadTooLargeIsLeftOutWithALedgerRow) {
  const Payload large = ofLength(kMostText + 1);
  for (const Payload& each : {ofLength(kMostText), large}) {
    add(message(each));
    add(event("e", tagged(each), each));
  }
  add(event("e", large));
  add(PowerRecord{28, "n", large});
  EXPECT_TRUE(write().ok());
  EXPECT_THAT(query("SELECT length(payload), substr(payload, 1, 22) FROM relay_messages"),
              ElementsAre("100|{\"f\":\"xxxxxxxxxxxxxxxx", "22|{\"left_out_bytes\":101}"));
  EXPECT_THAT(query("SELECT json_extract(payload, '$.app') FROM analytics_events"),
              ElementsAre("x\"y", "x\"y", "null"));
  EXPECT_THAT(query("SELECT event, table_name, rows, detail FROM store_ledger"),
              ElementsAre("left_out|relay_messages|1|a payload of 101 bytes",
                          "left_out|analytics_events|1|a payload of 101 bytes",
                          "left_out|power_records|1|a payload of 101 bytes"));
}

TEST_F(RowWriterTest, EventHasItsOwnTimeAndIsValidWhateverItsSize) {
  const Payload small = numbered(1);
  const Payload large = PayloadBuilder(small).set("f", std::string(kMostText, 'x')).build();
  row->id = 4;
  row->store = 1;
  add(message(small), 2);
  add(event("e", large, small), 1.75);
  const Payload other = numbered(2);
  add(message(other), 3);
  add(event("f", tagged(other), other));
  EXPECT_TRUE(write().ok());
  EXPECT_THAT(query("SELECT name, time, json_valid(payload), relay_session FROM analytics_events"),
              ElementsAre("f|1.5|1|4", "e|1.75|1|4"));
  EXPECT_EQ(written.rows, 4u);
}

TEST_F(RowWriterTest, EveryFewThousandRowsAreMarkedForTheNextReplay) {
  for (const int rows : {4096, 405, 500}) {
    for (int i = 0; i < rows; ++i)
      addOf(rows == 4096 && i < 2 ? recorded() : JournalTicket(), message(Payload()));
    if (rows == 500) addOf(recorded(), message(Payload()));
    EXPECT_TRUE(write().ok());
  }
  EXPECT_THAT(query("SELECT call, last_row FROM store_marks"), ElementsAre("2|4096"));
  auto known = [&](uint64_t first, uint64_t call) {
    return KnownRows::load(database.get(), {.first = first, .sessionsFrom = first})
        ->find({call, 0})
        .value_or(0);
  };
  EXPECT_EQ(known(1, 1), 1);
  EXPECT_EQ(known(2, 1), 0);
  EXPECT_EQ(known(2, 2), 2);
  EXPECT_EQ(known(3, 3), 5002);
}

// ---------------------------------------------------------------------------------------- pairing

class EventPairingTest : public BatchTest {
 protected:
  // The place of the event that shares the text of the message in a place.
  uint32_t eventOf(std::size_t place) { return batch[place].event; }
  void nextBatch() {
    batch.clear();
    pairing.join(batch);
  }
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

TEST_F(EventPairingTest, AnEventThatIsWrittenWithItsMessageCountsOnce) {
  const Payload payload = numbered(1);
  for (const JournalTicket& call : {recorded(), JournalTicket()}) {
    batch.clear();
    addOf(call, message(payload));
    addOf(call, event("e", payload, payload));
    pairing.pair(batch);
    EXPECT_EQ(EventPairing::markWritten(batch, 0, 2), call ? 0u : 2u);
  }
}

}  // namespace
}  // namespace vx::lnx
