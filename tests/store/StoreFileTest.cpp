#include <sys/stat.h>

#include "platform/linux/store/StoreFile.h"
#include "platform/linux/store/StoreSchema.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

class StoreFileTest : public StoreTest {
 protected:
  OpenedStore open() { return openStoreDatabase(folder + "/telemetry.db"); }
  static Rows query(const OpenedStore& opened, const std::string& sql) {
    return StoreTest::query(opened.database.get(), sql);
  }
};

TEST_F(StoreFileTest, CommittedRowsSurviveAPowerCutAndReadersDoNotWait) {
  const OpenedStore opened = open();
  ASSERT_TRUE(opened.status.ok());
  EXPECT_THAT(query(opened, "PRAGMA journal_mode"), ElementsAre("wal"));
  EXPECT_THAT(query(opened, "PRAGMA synchronous"), ElementsAre("2"));
  EXPECT_THAT(query(opened, "PRAGMA page_size"), ElementsAre("16384"));
  EXPECT_THAT(query(opened, "PRAGMA journal_size_limit"), ElementsAre("67108864"));
  EXPECT_THAT(query(opened, "PRAGMA wal_autocheckpoint"), ElementsAre("1000"));
}

TEST_F(StoreFileTest, WhatIsNoDatabaseIsDamagedAndWhatCannotBeUsedIsNot) {
  write("telemetry.db", std::string(20000, 'x'));
  EXPECT_EQ(open().fault, StoreFault::Damaged);
  const Result<std::string> aside = moveAside(folder + "/telemetry.db");
  ASSERT_TRUE(aside.ok());
  EXPECT_THAT(*aside, HasSubstr(folder + "/telemetry.db.damaged-2"));
  EXPECT_EQ(std::filesystem::file_size(*aside), 20000u);
  write("telemetry.db", "again");
  write("telemetry.db-wal", "wal");
  const Result<std::string> second = moveAside(folder + "/telemetry.db");
  ASSERT_TRUE(second.ok());
  EXPECT_NE(*second, *aside);
  EXPECT_TRUE(std::filesystem::exists(*second + "-wal"));
  EXPECT_FALSE(moveAside(folder + "/telemetry.db").ok());
  std::filesystem::create_directory(folder + "/telemetry.db");
  const OpenedStore opened = open();
  EXPECT_EQ(opened.fault, StoreFault::Unusable);
  EXPECT_EQ(opened.database, nullptr);
  EXPECT_THAT(opened.status.text(), HasSubstr("cannot use " + folder + "/telemetry.db: "));
}

TEST_F(StoreFileTest, SecondLockIsRefusedUntilTheFirstIsGone) {
  const std::string state = folder + "/state";
  Result<UniqueFd> first = lockStore(state);
  ASSERT_TRUE(first.ok());
  EXPECT_THAT(lockStore(state).status().text(), HasSubstr("another vxreportingd uses"));
  first->reset();
  EXPECT_TRUE(lockStore(state).ok());
  EXPECT_THAT(lockStore(folder + "/none/state").status().text(),
              HasSubstr("cannot create the state directory"));
  write("file", "");
  EXPECT_THAT(lockStore(folder + "/file").status().text(), HasSubstr("set STATE_DIRECTORY"));
}

TEST_F(StoreFileTest, NewerSchemaIsRefusedAndLeftAlone) {
  query(open(), "PRAGMA user_version = 3");
  const OpenedStore opened = open();
  EXPECT_EQ(opened.fault, StoreFault::Unusable);
  EXPECT_THAT(opened.status.text(), HasSubstr("newer version of the service (schema 3)"));
  EXPECT_THAT(StoreTest::query("PRAGMA user_version"), ElementsAre("3"));
}

TEST_F(StoreFileTest, EventsOfTheFirstSchemaAreKept) {
  StoreTest::query(
      "CREATE TABLE relay_messages(id INTEGER PRIMARY KEY, time REAL NOT NULL, payload TEXT);"
      "CREATE TABLE analytics_events(id INTEGER PRIMARY KEY, time REAL NOT NULL,"
      " name TEXT NOT NULL, payload TEXT NOT NULL);"
      "CREATE VIEW client_uptimes AS SELECT id FROM analytics_events;"
      "INSERT INTO analytics_events VALUES(3, 4e9, 'a', '{\"i\":1}'),"
      "(7, 5e9, 'b', '{\"i\":2}'), (9, 4e9, 'a', '{\"i\":3}');"
      "PRAGMA user_version = 1");
  const OpenedStore opened = open();
  ASSERT_TRUE(opened.status.ok()) << opened.status.text();
  EXPECT_THAT(query(opened, "SELECT * FROM analytics_events ORDER BY id"),
              ElementsAre("3|4000000000.0|a|{\"i\":1}", "7|5000000000.0|b|{\"i\":2}",
                          "9|4000000000.0|a|{\"i\":3}"));
  EXPECT_THAT(query(opened, "SELECT name FROM event_names ORDER BY name"), ElementsAre("a", "b"));
  EXPECT_THAT(query(opened, "SELECT count(*) FROM client_uptimes"), ElementsAre("0"));
  EXPECT_THAT(query(opened, "PRAGMA user_version"), ElementsAre("2"));
  EXPECT_THAT(query(opened, "SELECT name FROM sqlite_master WHERE name = 'events_before'"),
              IsEmpty());
}

TEST_F(StoreFileTest, MigrationThatFailsChangesNothing) {
  StoreTest::query(
      "CREATE TABLE event_names(x); CREATE TABLE analytics_events(x);"
      "CREATE VIEW client_uptimes AS SELECT 1; PRAGMA user_version = 1");
  EXPECT_EQ(open().fault, StoreFault::Unusable);
  EXPECT_THAT(StoreTest::query("SELECT name FROM sqlite_master ORDER BY name"),
              ElementsAre("analytics_events", "client_uptimes", "event_names"));
}

}  // namespace
}  // namespace vx::lnx
