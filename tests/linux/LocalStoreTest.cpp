#include <gmock/gmock.h>
#include <sqlite3.h>

#include <atomic>
#include <chrono>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/store/LocalStore.h"
#include "tests/linux/FolderTest.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;
using Rows = std::vector<std::string>;

class LocalStoreTest : public FolderTest {
 protected:
  void open() {
    std::string problem;
    store = LocalStore::open(folder, options, clock, problem);
    ASSERT_NE(store, nullptr) << problem;
    store->start();
  }
  bool close() { return store->close(clock.monotonic() + 20s); }
  Rows query(const std::string& sql) {
    sqlite3* database = nullptr;
    EXPECT_EQ(sqlite3_open_v2((folder + "/telemetry.db").c_str(), &database, SQLITE_OPEN_READONLY,
                              nullptr),
              SQLITE_OK);
    sqlite3_busy_timeout(database, 5000);
    Rows rows;
    sqlite3_exec(
        database, sql.c_str(),
        [](void* out, int count, char** values, char**) {
          std::string row;
          for (int i = 0; i < count; ++i)
            row += (i > 0 ? "|" : "") + std::string(values[i] != nullptr ? values[i] : "null");
          static_cast<Rows*>(out)->push_back(row);
          return 0;
        },
        &rows, nullptr);
    sqlite3_close(database);
    return rows;
  }
  bool eventually(const std::function<bool()>& condition) {
    for (int i = 0; i < 2000; ++i) {
      if (condition()) return true;
      std::this_thread::sleep_for(5ms);
    }
    return false;
  }
  std::shared_ptr<VyrReportingSession> session(int64_t id) {
    return store->relay().initWithSessionInfo(
        {{kVyrReportingSessionInfoClientType, int32_t{19}},
         {kVyrReportingSessionInfoClientVersion, 2.0f},
         {kVyrReportingSessionInfoSessionID, id},
         {kVyrReportingSessionInfoBatchEvent, true},
         {kVyrReportingSessionInfoContainsRealtimeEvents, false}},
        PayloadBuilder()
            .set(kVyrReportingUserInfoClientName, "c")
            .set(kVyrReportingUserInfoServiceName, "s")
            .build(),
        {});
  }
  void event(std::string_view name, const Payload& built, const Payload& message = Payload()) {
    store->analytics().sendEventLazy(
        name, [built] { return built; }, message);
  }
  // The payload with one entry more, as its event has it.
  static Payload tagged(const Payload& payload) {
    return PayloadBuilder(payload).set("app", "x\"y").build();
  }
  static Payload numbered(int i) { return PayloadBuilder().set("i", i).build(); }

  SystemClock clock;
  StoreOptions options;
  std::unique_ptr<LocalStore> store;
};

TEST_F(LocalStoreTest, RowsAsTheyWereSent) {
  open();
  std::optional<Error> error;
  const auto relay = session(42);
  EXPECT_TRUE(relay->sendMessageWithCategory(
      5, 1, PayloadBuilder().set("x", 0.5).set("t", true).build(), error));
  event("name", numbered(1));
  store->analytics().sendEventLazy(
      "bad", []() -> Payload { throw std::runtime_error("builder"); }, Payload());
  store->power().logRegisteredEvent(28, "Lumo_Haptics", numbered(2), nullptr);
  EXPECT_TRUE(store->relay().sendOneMessageWithSessionInfo(
      {{kVyrReportingSessionInfoSessionID, int32_t{-1}}}, Payload(), 7, 2, numbered(3), error));
  EXPECT_TRUE(close());
  EXPECT_THAT(
      query(
          "SELECT session_id, client_type, client_version, client_name, service_name, batch_event,"
          " contains_realtime_events, user_info FROM relay_sessions"),
      ElementsAre("42|19|2.0|c|s|1|0|{\"clientName\":\"c\",\"serviceName\":\"s\"}",
                  "-1|null|null|||null|null|{}"));
  EXPECT_THAT(query("SELECT relay_session, category, type, payload FROM relay_messages"),
              ElementsAre("1|5|1|{\"x\":0.5,\"t\":true}", "2|7|2|{\"i\":3}"));
  EXPECT_THAT(query("SELECT name, payload FROM analytics_events"), ElementsAre("name|{\"i\":1}"));
  EXPECT_THAT(query("SELECT client_identifier, name, record FROM power_records"),
              ElementsAre("28|Lumo_Haptics|{\"i\":2}"));
  EXPECT_FALSE(relay->sendMessageWithCategory(5, 1, numbered(1), error));
}

TEST_F(LocalStoreTest, EventsShareTheTextOfTheirMessages) {
  open();
  std::optional<Error> error;
  const auto relay = session(1);
  const Payload own = PayloadBuilder().set("app", "client's").set("i", 5).build();
  const Payload messages[] = {numbered(1), numbered(2), numbered(3), Payload(), own};
  event("before", tagged(messages[0]), messages[0]);
  for (const Payload& message : messages) relay->sendMessageWithCategory(1, 1, message, error);
  event("behind", tagged(messages[1]), messages[1]);
  event("again", tagged(messages[1]), messages[1]);
  event("same", messages[2], messages[2]);
  event("empty", tagged(Payload()), Payload());
  event("replaced", tagged(own), own);
  event("alone", tagged(numbered(6)), numbered(6));
  EXPECT_TRUE(close());
  EXPECT_THAT(
      query("SELECT name, payload FROM analytics_events ORDER BY name"),
      ElementsAre("again|{\"i\":2,\"app\":\"x\\\"y\"}", "alone|{\"i\":6,\"app\":\"x\\\"y\"}",
                  "before|{\"i\":1,\"app\":\"x\\\"y\"}", "behind|{\"i\":2,\"app\":\"x\\\"y\"}",
                  "empty|{\"app\":\"x\\\"y\"}", "replaced|{\"app\":\"x\\\"y\",\"i\":5}",
                  "same|{\"i\":3}"));
  EXPECT_THAT(query("SELECT message FROM analytics_entries WHERE message IS NOT NULL ORDER BY id"),
              ElementsAre("1", "2", "2", "3"));
}

TEST_F(LocalStoreTest, YoungEventWaitsOneBatchForItsMessage) {
  options.commitInterval = 20ms;
  open();
  std::optional<Error> error;
  const auto relay = session(1);
  const Payload late = numbered(1);
  event("late", tagged(late), late);
  for (int i = 0; i < 1000; ++i) store->power().logRegisteredEvent(1, "n", numbered(i), nullptr);
  EXPECT_TRUE(eventually([&] { return store->counters().rowsCommitted >= 1000; }));
  relay->sendMessageWithCategory(1, 1, late, error);
  const Payload never = numbered(2);  // whose message does not come
  event("never", tagged(never), never);
  for (int i = 0; i < 1000; ++i) store->power().logRegisteredEvent(1, "n", numbered(i), nullptr);
  EXPECT_TRUE(eventually(
      [&] { return query("SELECT payload FROM analytics_events ORDER BY payload").size() == 2; }));
  EXPECT_THAT(query("SELECT payload FROM analytics_events ORDER BY payload"),
              ElementsAre("{\"i\":1,\"app\":\"x\\\"y\"}", "{\"i\":2,\"app\":\"x\\\"y\"}"));
  EXPECT_TRUE(close());
  EXPECT_EQ(store->counters().rowsCommitted, 2004u);
}

TEST_F(LocalStoreTest, FlushIsAnsweredOnceItsMessagesAreCommitted) {
  options.commitInterval = 1h;
  open();
  std::optional<Error> error;
  const auto relay = session(1);
  relay->sendMessageWithCategory(1, 1, numbered(1), error);
  std::atomic<bool> flushed{false};
  std::string seen;
  relay->flushMessagesWithCompletion([&](std::optional<Error>) {
    seen = query("SELECT count(*) FROM relay_messages").at(0);
    flushed = true;
  });
  EXPECT_TRUE(eventually([&] { return flushed.load(); }));
  EXPECT_EQ(seen, "1");
}

TEST_F(LocalStoreTest, FullQueueIsCongestedUntilHalfIsWritten) {
  options.queueBytes = 64 << 10;
  options.commitInterval = 1h;
  open();
  std::atomic<int> drained{0};
  store->setDrainedHandler([&] { ++drained; });
  int rows = 0;
  while (!store->isCongested() && rows < 100000) {
    store->power().logRegisteredEvent(
        1, "n", PayloadBuilder().set("i", ++rows).set("fill", std::string(200, 'x')).build(),
        nullptr);
  }
  EXPECT_LT(rows, 1000);
  session(1)->flushMessagesWithCompletion(nullptr);
  EXPECT_TRUE(eventually([&] { return drained > 0; }));
  EXPECT_FALSE(store->isCongested());
  EXPECT_TRUE(close());
  EXPECT_EQ(query("SELECT count(*) FROM power_records").at(0), std::to_string(rows));
}

TEST_F(LocalStoreTest, ConfigurationAnswersTheNamedBackEnds) {
  open();
  store->setBackends({});
  std::atomic<int> answers{0};
  session(1)->startConfigurationWithCompletionHandler(
      [&](const std::optional<VyrReportingSession::BackendList>& backends) {
        answers += backends ? 100 : 1;
      });
  store->setBackends({"elsewhere"});
  const auto relay = session(1);
  relay->startConfigurationWithCompletionHandler(
      [&](const std::optional<VyrReportingSession::BackendList>& backends) {
        answers += backends->size() == 1 ? 10 : 100;
      });
  EXPECT_TRUE(eventually([&] { return answers == 11; }));
  std::optional<Error> error;
  EXPECT_FALSE(relay->sendMessageWithCategory(1, 1, numbered(1), error));
  EXPECT_THAT(error->reason, HasSubstr("not configured"));
}

TEST_F(LocalStoreTest, DamageInsideTheFileIsFoundAndMovedAside) {
  open();
  for (int i = 0; i < 500; ++i)
    store->power().logRegisteredEvent(1, std::string(100, 'n'), numbered(i), nullptr);
  EXPECT_TRUE(close());
  store.reset();
  {
    std::fstream file(folder + "/telemetry.db", std::ios::in | std::ios::out | std::ios::binary);
    file.seekp(4096 * 10);
    file << std::string(4096 * 3, '\x5A');
  }
  open();
  store->power().logRegisteredEvent(1, "fresh", numbered(1), nullptr);
  EXPECT_TRUE(close());
  EXPECT_THAT(query("SELECT name FROM power_records"), ElementsAre("fresh"));
  EXPECT_THAT(query("SELECT event FROM store_ledger"), ElementsAre("moved_aside"));
}

TEST_F(LocalStoreTest, OldestRowsGoFirstAndTheLedgerSaysSo) {
  options.maxBytes = 1 << 20;
  open();
  for (int i = 0; i < 200; ++i) {
    for (int k = 0; k < 200; ++k) {
      store->power().logRegisteredEvent(
          1, "n", PayloadBuilder().set("i", i * 200 + k).set("f", std::string(100, 'x')).build(),
          nullptr);
    }
    std::atomic<bool> flushed{false};
    session(1)->flushMessagesWithCompletion([&](auto) { flushed = true; });
    ASSERT_TRUE(eventually([&] { return flushed.load(); }));
  }
  EXPECT_TRUE(close());
  const int kept = std::stoi(query("SELECT count(*) FROM power_records").at(0));
  EXPECT_LT(kept, 39000);
  EXPECT_GT(kept, 1000);
  EXPECT_EQ(query("SELECT max(json_extract(record, '$.i')) FROM power_records").at(0), "39999");
  EXPECT_EQ(query("SELECT sum(rows) FROM store_ledger WHERE event = 'removed_for_size' AND "
                  "table_name = 'power_records'")
                .at(0),
            std::to_string(40000 - kept));
}

TEST_F(LocalStoreTest, PayloadTooLargeForTheStoreHoldsUpNothing) {
  options.maxBytes = 1 << 20;  // of which one payload may have a quarter
  open();
  const auto relay = session(1);
  std::optional<Error> error;
  const Payload large = PayloadBuilder().set("f", std::string(300000, 'x')).build();
  for (const Payload& message : {numbered(1), large, numbered(2)}) {
    relay->sendMessageWithCategory(1, 1, message, error);
    event("e", tagged(message), message);
  }
  EXPECT_TRUE(close());
  EXPECT_THAT(query("SELECT payload FROM relay_messages"),
              ElementsAre("{\"i\":1}", "{\"left_out_bytes\":300008}", "{\"i\":2}"));
  EXPECT_THAT(query("SELECT json_extract(payload, '$.app') FROM analytics_events"),
              ElementsAre("x\"y", "x\"y", "x\"y"));
  EXPECT_THAT(query("SELECT event, table_name, rows FROM store_ledger"),
              ElementsAre("left_out|relay_messages|1"));
}

TEST_F(LocalStoreTest, EventsGoWithTheMessagesWhoseTextTheyShare) {
  options.maxBytes = 1 << 20;
  open();
  const auto relay = session(1);
  std::optional<Error> error;
  for (int i = 0; i < 100; ++i) {
    for (int k = 0; k < 200; ++k) {
      const Payload message =
          PayloadBuilder().set("i", i * 200 + k).set("f", std::string(100, 'x')).build();
      relay->sendMessageWithCategory(1, 1, message, error);
      event("e", tagged(message), message);
    }
    std::atomic<bool> flushed{false};
    relay->flushMessagesWithCompletion([&](auto) { flushed = true; });
    ASSERT_TRUE(eventually([&] { return flushed.load(); }));
  }
  EXPECT_TRUE(close());
  const int kept = std::stoi(query("SELECT count(*) FROM analytics_events").at(0));
  EXPECT_LT(kept, 19000);
  EXPECT_GT(kept, 1000);
  EXPECT_EQ(query("SELECT count(*) FROM analytics_events WHERE json_valid(payload)").at(0),
            std::to_string(kept));
  EXPECT_EQ(query("SELECT sum(rows) FROM store_ledger WHERE table_name = 'analytics_events'").at(0),
            std::to_string(20000 - kept));
}

TEST_F(LocalStoreTest, EventsOfTheFirstSchemaAreKept) {
  sqlite3* database = nullptr;
  sqlite3_open((folder + "/telemetry.db").c_str(), &database);
  EXPECT_EQ(sqlite3_exec(database,
                         "CREATE TABLE relay_sessions(id INTEGER PRIMARY KEY, time REAL);"
                         "CREATE TABLE relay_messages(id INTEGER PRIMARY KEY, time REAL NOT NULL, "
                         "relay_session INTEGER, category INTEGER, type INTEGER, payload TEXT);"
                         "CREATE TABLE analytics_events(id INTEGER PRIMARY KEY, time REAL NOT NULL,"
                         " name TEXT NOT NULL, payload TEXT NOT NULL);"
                         "CREATE TABLE power_records(id INTEGER PRIMARY KEY, time REAL,"
                         " client_identifier INTEGER, name TEXT, record TEXT);"
                         "CREATE TABLE store_ledger(id INTEGER PRIMARY KEY, time REAL, event TEXT,"
                         " table_name TEXT, rows INTEGER, detail TEXT);"
                         "CREATE VIEW client_uptimes AS SELECT id FROM analytics_events;"
                         "INSERT INTO analytics_events VALUES(3, 4e9, 'a', '{\"i\":1}'),"
                         "(7, 4e9, 'b', '{\"i\":2}'), (9, 4e9, 'a', '{\"i\":3}');"
                         "PRAGMA user_version = 1",
                         nullptr, nullptr, nullptr),
            SQLITE_OK);
  sqlite3_close(database);
  open();
  event("b", numbered(4));
  EXPECT_TRUE(close());
  EXPECT_THAT(query("SELECT id, name, payload FROM analytics_events ORDER BY id"),
              ElementsAre("3|a|{\"i\":1}", "7|b|{\"i\":2}", "9|a|{\"i\":3}", "10|b|{\"i\":4}"));
  EXPECT_THAT(query("SELECT count(*) FROM client_uptimes"), ElementsAre("0"));
}

TEST_F(LocalStoreTest, SecondOpenerAndNewerSchemaAreRefused) {
  open();
  std::string problem;
  EXPECT_EQ(LocalStore::open(folder, options, clock, problem), nullptr);
  EXPECT_THAT(problem, HasSubstr(folder));
  EXPECT_TRUE(close());
  store.reset();
  sqlite3* database = nullptr;
  sqlite3_open((folder + "/telemetry.db").c_str(), &database);
  sqlite3_exec(database, "PRAGMA user_version = 99", nullptr, nullptr, nullptr);
  sqlite3_close(database);
  EXPECT_EQ(LocalStore::open(folder, options, clock, problem), nullptr);
  EXPECT_THAT(problem, HasSubstr("newer version"));
}

}  // namespace
}  // namespace vx::lnx
