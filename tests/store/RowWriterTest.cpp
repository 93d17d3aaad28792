#include <limits>
#include <stdexcept>

#include "platform/linux/store/EventPairing.h"
#include "platform/linux/store/RowWriter.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

// With the pairing before it, as the store's writer has it.
class RowWriterTest : public StoreTest {
 protected:
  static constexpr std::size_t kMostText = 100;

  void add(StoreRecord::What what, double time = 1.5) { batch.push_back({time, std::move(what)}); }
  // Writes what was added and begins the next batch.
  Status write(const std::vector<LedgerNote>& notes = {}) {
    pairing.join(batch);
    pairing.pair(batch);
    pairing.hold(batch, holdFrom, p.clock.monotonic());
    const Result<RowWriter::Written> result = writer.write(batch, 0, batch.size(), notes);
    if (!result.ok()) return result.status();
    EXPECT_EQ(EventPairing::unwrittenRows(batch, 0), result->rows + result->failedBuilders);
    written = *result;
    batch.clear();
    return {};
  }
  Rows query(const std::string& sql) { return StoreTest::query(database.get(), sql); }
  // A payload whose text is so long.
  static Payload ofLength(std::size_t bytes) {
    return PayloadBuilder().set("f", std::string(bytes - 8, 'x')).build();
  }

  Database database = openStoreDatabase(":memory:").database;
  EventPairing pairing;
  double holdFrom = std::numeric_limits<double>::max();
  RowWriter writer{database.get(), kMostText, p.clock};
  StoreRecords batch;
  RowWriter::Written written;
};

TEST_F(RowWriterTest, EveryColumnIsWhatWasGivenAndOfItsKind) {
  add(opening(std::make_shared<RelayRow>(), {{kVyrReportingSessionInfoSessionID, int32_t{-1}}},
              Payload()));
  add(opening(row, sessionInfo(int64_t{1} << 40)), 2);
  add(RelayMessageRecord{row, PayloadBuilder().set("x", 0.5).set("t", true).build(), 65535, 65534},
      2.5);
  add(event("name", numbered(1)), 3);
  add(AnalyticsRecord{"bad", Payload(), []() -> Payload { throw std::runtime_error("no"); }});
  add(PowerRecord{28, "Lumo_Haptics", numbered(2)}, 4);
  EXPECT_TRUE(write({{"what", "", 0, "why"}, {"what", "t", 3, "why"}}).ok());
  EXPECT_EQ(written.rows, 5u);
  EXPECT_EQ(written.failedBuilders, 1u);
  EXPECT_THAT(
      query("SELECT * FROM relay_sessions; SELECT * FROM relay_messages;"
            "SELECT * FROM analytics_events; SELECT * FROM power_records;"
            "SELECT id, time = 1576800000, event, table_name, rows, detail FROM store_ledger;"
            "SELECT typeof(client_version), typeof(batch_event), typeof(service_name),"
            " typeof(user_info) FROM relay_sessions WHERE id = 2;"
            "SELECT typeof(category), typeof(type), typeof(payload) FROM relay_messages"),
      ElementsAre("1|1.5|-1|null|null|||null|null|{}",
                  "2|2.0|1099511627776|19|2.5|c|s|1|0|{\"clientName\":\"c\",\"serviceName\":\"s\"}",
                  "1|2.5|2|65535|65534|{\"x\":0.5,\"t\":true}", "1|3.0|name|{\"i\":1}",
                  "1|4.0|28|Lumo_Haptics|{\"i\":2}", "1|1|what|null|0|why", "2|1|what|t|3|why",
                  "real|integer|text|text", "integer|integer|text"));
}

TEST_F(RowWriterTest, EventsShareTheTextOfTheirMessagesInTheirOrder) {
  const Payload own = PayloadBuilder().set("app", "client's").set("i", 5).build();
  const Payload messages[] = {numbered(1), numbered(1), numbered(3), Payload(), own};  // 1 twice
  add(event("before", tagged(messages[0]), messages[0]));
  for (const Payload& each : messages) add(message(each));
  add(message(messages[1]));  // to a second session
  add(event("after", tagged(messages[1]), messages[1]));
  add(event("again", tagged(messages[1]), messages[1]));
  add(event("same", messages[2], messages[2]));
  add(event("empty", tagged(Payload()), Payload()));
  add(event("replaced", tagged(own), own));
  add(event("alone", tagged(numbered(6)), numbered(6)));
  EXPECT_TRUE(write().ok());
  EXPECT_EQ(written.rows, 13u);
  EXPECT_THAT(
      query("SELECT e.name, n.message, e.payload FROM analytics_events e"
            " JOIN analytics_entries n USING (id) ORDER BY id"),
      ElementsAre("before|1|{\"i\":1,\"app\":\"x\\\"y\"}", "after|2|{\"i\":1,\"app\":\"x\\\"y\"}",
                  "again|2|{\"i\":1,\"app\":\"x\\\"y\"}", "same|3|{\"i\":3}",
                  "replaced|null|{\"app\":\"x\\\"y\",\"i\":5}", "empty|null|{\"app\":\"x\\\"y\"}",
                  "alone|null|{\"i\":6,\"app\":\"x\\\"y\"}"));
  std::vector<Payload> many;
  for (int i = 0; i < 700; ++i) many.push_back(numbered(i));
  for (const Payload& each : many) add(message(each));
  for (const Payload& each : many) add(event("many", each, each));
  EXPECT_TRUE(write().ok());
  EXPECT_THAT(query("SELECT count(*) FROM analytics_entries WHERE message > 6"),
              ElementsAre("700"));
}

TEST_F(RowWriterTest, YoungEventWaitsOneBatchForItsMessage) {
  const Payload late = numbered(1);
  const Payload never = numbered(2);
  holdFrom = 10;
  add(event("old", late, late), 9.9);
  add(event("late", late, late), 10);
  add(event("never", never, never), 11);
  add(event("nobody's", numbered(3)), 11);
  EXPECT_TRUE(write().ok());
  EXPECT_EQ(written.rows, 2u);
  EXPECT_EQ(pairing.heldSince(), p.clock.monotonic());
  add(message(late));
  EXPECT_TRUE(write().ok());
  EXPECT_EQ(pairing.heldSince(), std::nullopt);  // not twice
  EXPECT_THAT(query("SELECT message FROM analytics_entries ORDER BY id"),
              ElementsAre("null", "null", "1", "null"));
}

TEST_F(RowWriterTest, WhatIsWrittenIsNeitherLostNorKept) {
  const Payload a = numbered(1);
  for (const Payload& each : {a, numbered(2)}) add(message(each));
  add(event("e", a, a));
  pairing.pair(batch);
  EventPairing::markWritten(batch, 0, 1);
  EXPECT_EQ(EventPairing::unwrittenRows(batch, 1), 1u);
  EXPECT_EQ(std::get<RelayMessageRecord>(batch[0].what).payload.identity(), nullptr);
  EXPECT_NE(std::get<RelayMessageRecord>(batch[1].what).payload.identity(), nullptr);
}

TEST_F(RowWriterTest, FailedWriteLeavesNothingAndCanBeRepeatedWithEachNameOnce) {
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
  for (const char* name : {"f", "e"}) add(event(name, numbered(1)));
  EXPECT_TRUE(write().ok());
  EXPECT_THAT(query("SELECT event FROM store_ledger"), ElementsAre("left_out"));
  RowWriter next(database.get(), kMostText, p.clock);  // after a restart
  add(event("f", numbered(1)));
  EXPECT_TRUE(next.write(batch, 0, 1, {}).ok());
  EXPECT_THAT(query("SELECT id, name FROM event_names; SELECT name FROM analytics_events"),
              ElementsAre("1|e", "2|f", "e", "f", "e", "f"));
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

}  // namespace
}  // namespace vx::lnx
