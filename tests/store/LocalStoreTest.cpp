#include <fstream>
#include <future>
#include <thread>

#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/store/LocalStore.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

// The store as a whole, on its own thread and the machine's clock.
class LocalStoreTest : public StoreTest {
 protected:
  LocalStoreTest() { options.commit.interval = 1h; }
  void open() {
    Result<std::unique_ptr<LocalStore>> opened = LocalStore::open(folder, options, *used);
    ASSERT_TRUE(opened.ok()) << opened.status().text();
    store = std::move(*opened);
    store->start();
  }
  OpenedStore openDatabase() const { return openStoreDatabase(folder + "/telemetry.db"); }
  bool close(std::chrono::seconds within = 60s) { return store->close(clock.monotonic() + within); }
  void end() {
    EXPECT_TRUE(close());
    store.reset();
  }
  std::unique_ptr<RelayBackend::Session> session(int64_t id = 1) {
    return store->relayBackend().open(sessionInfo(id), userInfo());
  }
  void power(int i, const std::string& name = "n") {
    store->logRegisteredEvent(28, name, numbered(i), nullptr);
  }
  // Until everything before it is committed, or with the error that prevents it.
  std::future<std::optional<Error>> flush() {
    auto told = std::make_shared<std::promise<std::optional<Error>>>();
    session()->flush([told](std::optional<Error> error) { told->set_value(std::move(error)); });
    return told->get_future();
  }
  Rows ledger() {
    return query("SELECT event, table_name, rows, substr(detail, 1, 16) FROM store_ledger");
  }
  // Makes the rows of a table impossible to write, from outside.
  void refuse(const std::string& table) {
    query("CREATE TRIGGER refuse_" + table + " BEFORE INSERT ON " + table +
          " BEGIN SELECT RAISE(FAIL, 'no'); END");
  }
  static void waitUntil(const std::function<bool()>& condition) {
    while (!condition()) std::this_thread::yield();
  }

  SystemClock clock;
  Clock* used = &clock;
  StoreOptions options;
  std::unique_ptr<LocalStore> store;
};

TEST_F(LocalStoreTest, CommittedRowsSurviveAPowerCutAndReadersDoNotWait) {
  EXPECT_THAT(query(openDatabase().database.get(),
                    "PRAGMA journal_mode; PRAGMA synchronous; PRAGMA page_size;"
                    "PRAGMA journal_size_limit; PRAGMA wal_autocheckpoint"),
              ElementsAre("wal", "2", "16384", "67108864", "1000"));
}

TEST_F(LocalStoreTest, EventsOfTheFirstSchemaAreKeptAlsoWhereTheirMigrationFails) {
  query(
      "CREATE TABLE relay_messages(id INTEGER PRIMARY KEY, time REAL NOT NULL, payload TEXT);"
      "CREATE TABLE analytics_events(id INTEGER PRIMARY KEY, time REAL NOT NULL,"
      " name TEXT NOT NULL, payload TEXT NOT NULL);"
      "CREATE VIEW client_uptimes AS SELECT id FROM analytics_events;"
      "INSERT INTO analytics_events VALUES(3, 4e9, 'a', '{\"i\":1}'),"
      "(7, 5e9, 'b', '{\"i\":2}'), (9, 4e9, 'a', '{\"i\":3}');"
      "CREATE TABLE event_names(in_the_way); PRAGMA user_version = 1");
  EXPECT_EQ(openDatabase().fault, StoreFault::Unusable);
  EXPECT_THAT(query("SELECT name FROM sqlite_master ORDER BY name; DROP TABLE event_names"),
              ElementsAre("analytics_events", "client_uptimes", "event_names", "relay_messages"));
  const OpenedStore opened = openDatabase();
  ASSERT_TRUE(opened.status.ok()) << opened.status.text();
  EXPECT_THAT(query(opened.database.get(),
                    "SELECT * FROM analytics_events ORDER BY id;"
                    "SELECT name FROM event_names ORDER BY name;"
                    "SELECT count(*) FROM client_uptimes; PRAGMA user_version;"
                    "SELECT name FROM sqlite_master WHERE name = 'events_before'"),
              ElementsAre("3|4000000000.0|a|{\"i\":1}", "7|5000000000.0|b|{\"i\":2}",
                          "9|4000000000.0|a|{\"i\":3}", "a", "b", "0", "2"));
}

TEST_F(LocalStoreTest, WhatWasSentIsThereAfterTheClose) {
  open();
  const auto relay = session(42);
  EXPECT_EQ(relay->send(5, 1, numbered(1)), std::nullopt);
  store->sendEventLazy(
      "e", [] { return tagged(numbered(1)); }, Payload());
  power(2);
  EXPECT_EQ(store->relayBackend().sendOne({{kVyrReportingSessionInfoSessionID, int32_t{-1}}},
                                          Payload(), 7, 2, numbered(3)),
            std::nullopt);
  EXPECT_TRUE(close());
  EXPECT_THAT(query("SELECT s.session_id, m.category, m.type, m.payload FROM relay_messages m"
                    " JOIN relay_sessions s ON s.id = m.relay_session;"
                    "SELECT name, payload FROM analytics_events;"
                    "SELECT client_identifier, name, record, abs(time - strftime('%s')) < 600"
                    " FROM power_records"),
              ElementsAre("42|5|1|{\"i\":1}", "-1|7|2|{\"i\":3}", "e|{\"i\":1,\"app\":\"x\\\"y\"}",
                          "28|n|{\"i\":2}|1"));
  EXPECT_EQ(store->counters().rowsCommitted, 6u);
  EXPECT_EQ(relay->send(5, 1, numbered(1))->code, kRelayErrorClosed);
  EXPECT_TRUE(store->relayBackend().sendOne({}, Payload(), 1, 1, Payload()));
  EXPECT_EQ(flush().get()->code, kRelayErrorClosed);
}

TEST_F(LocalStoreTest, RowsAreCommittedAfterTheIntervalOrForAFlushBeforeItsAnswer) {
  open();
  const auto relay = session();
  relay->send(1, 1, numbered(1));
  std::promise<Rows> seen;
  relay->flush([&](const std::optional<Error>&) {
    seen.set_value(query("SELECT count(*) FROM relay_messages"));
  });
  EXPECT_THAT(seen.get_future().get(), ElementsAre("1"));
  end();
  options.commit.interval = 1ms;
  open();
  power(1);
  waitUntil([&] { return store->counters().rowsCommitted == 1; });
}

TEST_F(LocalStoreTest, EventWaitsForAMessageOfTheNextBatch) {
  options.commit.rows = 2;
  p.clock.steady = clock.monotonic();
  used = &p.clock;  // stands still: the event stays young
  open();
  const Payload late = numbered(1);
  store->sendEventLazy(
      "late", [late] { return tagged(late); }, late);
  power(1);
  waitUntil([&] { return store->counters().rowsCommitted >= 1; });
  session()->send(1, 1, late);
  EXPECT_TRUE(close());
  EXPECT_THAT(query("SELECT message FROM analytics_entries"), ElementsAre("1"));
  EXPECT_EQ(store->counters().rowsCommitted, 4u);
}

TEST_F(LocalStoreTest, CongestedStoreTellsWhenItHasDrained) {
  options.queueBytes = 64 << 10;
  open();
  std::promise<void> drained;
  store->setDrainedHandler([&] { drained.set_value(); });
  int rows = 0;
  while (!store->isCongested()) power(++rows);
  EXPECT_LT(rows, 600);
  const auto flushed = flush();
  drained.get_future().get();
  EXPECT_FALSE(store->isCongested());
  EXPECT_TRUE(close());
  EXPECT_EQ(query("SELECT count(*) FROM power_records").at(0), std::to_string(rows));
}

TEST_F(LocalStoreTest, FailedWriteIsRepeatedInOrderOrCountedAndToldAtTheDeadline) {
  options.commit.rows = 2;  // several transactions
  open();
  EXPECT_EQ(flush().get(), std::nullopt);
  refuse("power_records");
  for (int i = 0; i < 5; ++i) power(i);
  auto flushed = flush();
  std::promise<void> answered;
  waitUntil([&] { return store->counters().writeFailures > 1; });
  store->runSoon([&] { answered.set_value(); });
  answered.get_future().get();  // jobs do not wait for the disk
  EXPECT_EQ(flushed.wait_for(0s), std::future_status::timeout);
  query("DROP TRIGGER refuse_power_records");
  EXPECT_EQ(flushed.get(), std::nullopt);
  EXPECT_THAT(query("SELECT record FROM power_records"),
              ElementsAre("{\"i\":0}", "{\"i\":1}", "{\"i\":2}", "{\"i\":3}", "{\"i\":4}"));
  EXPECT_EQ(store->counters().rowsLost, 0u);
  EXPECT_THAT(p.log.lines, ElementsAre(HasSubstr("cannot write"), HasSubstr("written again")));

  refuse("power_records");
  refuse("relay_sessions");  // the flush may be taken in a batch of its own
  for (int i = 0; i < 5; ++i) power(i);
  flushed = flush();
  EXPECT_FALSE(close(0s));
  EXPECT_TRUE(flushed.get());
  waitUntil([&] { return store->counters().rowsLost == 6; });  // with the flush's session
}

TEST_F(LocalStoreTest, DamageIsMovedAsideWithALedgerRow) {
  write("telemetry.db", std::string(20000, 'x'));
  open();
  for (int i = 0; i < 500; ++i) power(i, std::string(1000, 'n'));
  end();
  open();
  end();
  EXPECT_THAT(ledger(), ElementsAre(HasSubstr("moved_aside|null|0|cannot use ")));
  {
    std::fstream file(folder + "/telemetry.db", std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(16384 * 12);  // found by the check alone
    file << std::string(16384, '\x5A');
  }
  open();
  power(1, "fresh");
  EXPECT_TRUE(close());
  EXPECT_THAT(query("SELECT name FROM power_records;"
                    "SELECT event, detail LIKE 'failed its check (%); now %damaged-%'"
                    " FROM store_ledger"),
              ElementsAre("fresh", "moved_aside|1"));
  write("telemetry.db-wal", "wal");
  const Result<std::string> third = moveAside(folder + "/telemetry.db");
  ASSERT_TRUE(third.ok());
  EXPECT_THAT(*third, HasSubstr(folder + "/telemetry.db.damaged-2"));
  EXPECT_TRUE(std::filesystem::exists(*third + "-wal"));
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(folder), {}), 5);  // with the lock
}

TEST_F(LocalStoreTest, WhatIsRemovedIsInTheLedgerEvenAtTheEnd) {
  open();
  query("INSERT INTO power_records(time, client_identifier, name, record) VALUES(1, 1, 'n', '{}')");
  end();
  options.maxBytes = 1 << 20;
  open();
  const Payload large = PayloadBuilder().set("f", std::string(40000, 'x')).build();
  for (std::size_t i = 0; i < Retention::kBatchesPerPass; ++i) {
    store->logRegisteredEvent(28, "n", large, nullptr);
    EXPECT_EQ(flush().get(), std::nullopt);
  }
  EXPECT_TRUE(close());
  EXPECT_THAT(ledger(), ElementsAre("removed_for_age|power_records|1|older than 30 da",
                                    HasSubstr("removed_for_size|power_records|")));
}

TEST_F(LocalStoreTest, WhatCannotBeUsedIsRefusedAndLeftAlone) {
  const auto refusal = [this](const std::string& state) {
    return LocalStore::open(folder + state, options, clock).status().text();
  };
  open();
  EXPECT_THAT(refusal(""), HasSubstr("another vxreportingd uses"));
  end();
  EXPECT_EQ(refusal("/new"), "");
  EXPECT_THAT(refusal("/none/new"), HasSubstr("cannot create the state directory"));
  write("file", "");
  EXPECT_THAT(refusal("/file"), HasSubstr("set STATE_DIRECTORY"));
  std::filesystem::create_directories(folder + "/odd/telemetry.db");
  EXPECT_THAT(refusal("/odd"), HasSubstr("cannot use " + folder + "/odd/telemetry.db: "));
  query("PRAGMA user_version = 3");
  EXPECT_THAT(refusal(""), HasSubstr("newer version of the service (schema 3)"));
  EXPECT_THAT(query("PRAGMA user_version"), ElementsAre("3"));
  EXPECT_FALSE(moveAside(folder + "/none").ok());
}

}  // namespace
}  // namespace vx::lnx
