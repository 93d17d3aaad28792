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

#include "platform/linux/LocalStore.h"
#include "platform/linux/SystemThreading.h"
#include "tests/fakes/FakePlatform.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;
using Rows = std::vector<std::string>;
using ::testing::ElementsAre;
using ::testing::HasSubstr;

class LocalStoreTest : public ::testing::Test {
 protected:
  LocalStoreTest() {
    std::string pattern = "/tmp/vxstore-XXXXXX";
    folder = mkdtemp(pattern.data());
  }
  ~LocalStoreTest() override {
    store.reset();
    std::filesystem::remove_all(folder);
  }
  void open() {
    std::string problem;
    store = LocalStore::open({"", folder, "", ""}, options, clock, problem);
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
  static Payload numbered(int i) { return PayloadBuilder().set("i", i).build(); }

  fakes::FakePlatform p;  // for the log
  std::string folder;
  SystemClock clock;
  PlatformConfiguration::Store options;
  std::unique_ptr<LocalStore> store;
};

TEST_F(LocalStoreTest, RowsAsTheyWereSent) {
  open();
  std::optional<Error> error;
  const auto relay = session(42);
  EXPECT_TRUE(relay->sendMessageWithCategory(
      5, 1, PayloadBuilder().set("x", 0.5).set("t", true).build(), error));
  store->analytics().sendEventLazy("name", [] { return numbered(1); });
  store->analytics().sendEventLazy("bad", []() -> Payload { throw std::runtime_error("builder"); });
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

TEST_F(LocalStoreTest, ALoneRowIsCommittedAfterTheInterval) {
  options.commitInterval = 20ms;
  open();
  store->power().logRegisteredEvent(1, "n", numbered(1), nullptr);
  EXPECT_TRUE(eventually([&] { return query("SELECT count(*) FROM power_records").at(0) == "1"; }));
  EXPECT_EQ(store->counters().commits, 1u);
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
      [&](auto backends) { answers += backends ? 100 : 1; });
  store->setBackends({"elsewhere"});
  const auto relay = session(1);
  relay->startConfigurationWithCompletionHandler(
      [&](auto backends) { answers += backends->size() == 1 ? 10 : 100; });
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

TEST_F(LocalStoreTest, SecondOpenerAndNewerSchemaAreRefused) {
  open();
  std::string problem;
  EXPECT_EQ(LocalStore::open({"", folder, "", ""}, options, clock, problem), nullptr);
  EXPECT_THAT(problem, HasSubstr(folder));
  EXPECT_TRUE(close());
  store.reset();
  sqlite3* database = nullptr;
  sqlite3_open((folder + "/telemetry.db").c_str(), &database);
  sqlite3_exec(database, "PRAGMA user_version = 99", nullptr, nullptr, nullptr);
  sqlite3_close(database);
  EXPECT_EQ(LocalStore::open({"", folder, "", ""}, options, clock, problem), nullptr);
  EXPECT_THAT(problem, HasSubstr("newer version"));
}

}  // namespace
}  // namespace vx::lnx
