#include <sys/stat.h>
#include <unistd.h>

#include "platform/linux/store/StoreFile.h"
#include "platform/linux/store/StoreSchema.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

class StoreFileTest : public StoreTest {
 protected:
  const std::string path = folder + "/telemetry.db";
  OpenedStore open() { return openStoreDatabase(path, kEpoch); }
  static Rows query(const OpenedStore& opened, const std::string& sql) {
    return StoreTest::query(opened.database.get(), sql);
  }
  // Each table and view with its columns.
  static constexpr const char* kColumns =
      "SELECT s.name, group_concat(c.name || ' ' || c.type) FROM sqlite_master s,"
      " pragma_table_info(s.name) c WHERE s.type IN ('table', 'view') GROUP BY 1 ORDER BY 1";
  static constexpr const char* kReaders =
      "SELECT id, session_id, application, category, type, payload FROM session_messages UNION ALL"
      " SELECT id, time, client_identifier, name, record, '' FROM power_records UNION ALL"
      " SELECT id, time, event, table_name, rows, detail FROM store_ledger UNION ALL"
      " SELECT id, process, seconds, '', '', '' FROM client_uptimes";
  static std::string textOf(const std::string& name) {
    std::stringstream text;
    text << std::ifstream(std::string(VX_STORE_DATA) + "/" + name).rdbuf();
    return text.str();
  }
  void removeStore() {
    for (const char* suffix : {"", "-wal", "-shm"}) std::filesystem::remove(path + suffix);
  }
};

TEST_F(StoreFileTest, CommittedRowsSurviveAPowerCutAndReadersDoNotWait) {
  const OpenedStore opened = open();
  std::string are;
  for (const char* name :
       {"journal_mode", "synchronous", "page_size", "journal_size_limit", "wal_autocheckpoint"})
    are += query(opened, std::string("PRAGMA ") + name).at(0) + " ";
  EXPECT_EQ(are, "wal 2 8192 4194304 512 ");
}

TEST_F(StoreFileTest, WhatIsNoDatabaseIsDamagedAndWhatCannotBeUsedIsNot) {
  write("telemetry.db", std::string(20000, 'x'));
  EXPECT_EQ(open().fault, StoreFault::Damaged);
  const Result<std::string> aside = moveAside(path);
  ASSERT_TRUE(aside.ok());
  EXPECT_THAT(*aside, HasSubstr(folder + "/telemetry.db.damaged-2"));
  EXPECT_EQ(std::filesystem::file_size(*aside), 20000u);
  write("telemetry.db", "again");
  write("telemetry.db-wal", "wal");
  const Result<std::string> second = moveAside(path);
  ASSERT_TRUE(second.ok());
  EXPECT_NE(*second, *aside);
  EXPECT_TRUE(std::filesystem::exists(*second + "-wal"));
  EXPECT_FALSE(moveAside(path).ok());
  std::filesystem::create_directory(path);
  const OpenedStore opened = open();
  EXPECT_EQ(opened.fault, StoreFault::Unusable);
  EXPECT_EQ(opened.database, nullptr);
  EXPECT_THAT(opened.status.text(), HasSubstr("cannot use " + folder + "/telemetry.db: "));
}

int readsLeft = 0;  // until one fails, and all after it
ssize_t failingRead(int fd, void* data, size_t bytes, off_t at) {
  errno = EIO;
  return readsLeft-- > 0 ? pread(fd, data, bytes, at) : -1;
}

// SQLite says of a page that it cannot read that the file is malformed.
TEST_F(StoreFileTest, ReadErrorAtNoMomentIsTakenForDamage) {
  for (int i = 0; i < 50; ++i)
    query(open(), "INSERT INTO power_records VALUES(NULL, 1, 1, 'n', zeroblob(4000), 1, 1, 1)");
  sqlite3_vfs* const files = sqlite3_vfs_find(nullptr);
  const auto fake = reinterpret_cast<sqlite3_syscall_ptr>(failingRead);
  auto use = [&](sqlite3_syscall_ptr read) {
    for (const char* name : {"pread", "pread64"}) files->xSetSystemCall(files, name, read);
  };
  int refused = 0;
  StoreFault fault = StoreFault::Unusable;
  for (int reads = 0; fault != StoreFault::None && reads < 1000; ++reads) {
    use(fake);
    readsLeft = reads;
    const OpenedStore opened = open();
    fault = opened.status.ok() ? quickCheck(opened.database.get()).fault : opened.fault;
    use(nullptr);
    EXPECT_NE(fault, StoreFault::Damaged) << reads;
    ++refused;
  }
  EXPECT_EQ(fault, StoreFault::None);
  EXPECT_GT(refused, 20);
  using enum StoreFault;
  EXPECT_EQ(faultOfFinding("Tree 2 page 3: unable to get the page. error code=266"), Unusable);
  EXPECT_EQ(faultOfFinding("Tree 2 page 3: btreeInitPage() returns error code 11"), Damaged);
  EXPECT_EQ(faultOfFinding("Page 3: never used"), Damaged);
  EXPECT_EQ(faultOf(SQLITE_IOERR_READ), Unusable);
  EXPECT_EQ(faultOf(SQLITE_CORRUPT_SEQUENCE), Damaged);
}

TEST_F(StoreFileTest, SecondLockIsRefusedUntilTheFirstIsGone) {
  const std::string state = folder + "/state";
  StoreLock first = lockStore(state);
  ASSERT_TRUE(first.status.ok());
  EXPECT_TRUE(lockStore(state).heldByAnother);
  EXPECT_THAT(lockStore(state).status.text(), HasSubstr("another vxreportingd uses"));
  first.fd.reset();
  EXPECT_TRUE(lockStore(state).status.ok());
  const StoreLock none = lockStore(folder + "/none/state");
  EXPECT_THAT(none.status.text(), HasSubstr("cannot create the state directory"));
  EXPECT_FALSE(none.heldByAnother);
  write("file", "");
  EXPECT_THAT(lockStore(folder + "/file").status.text(), HasSubstr("set STATE_DIRECTORY"));
}

// Files as the service of that time made them.
TEST_F(StoreFileTest, EarlierSchemasAreBroughtUpToDateAndKeepTheirRows) {
  const Rows fresh = query(open(), kColumns);
  for (const char* version : {"1", "2", "3"}) {
    removeStore();
    StoreTest::query(textOf(std::string("schema-") + version + ".sql"));
    const Rows kept = StoreTest::query(kReaders);
    const OpenedStore opened = openStoreDatabase(path, {9});
    ASSERT_TRUE(opened.status.ok()) << opened.status.text();
    EXPECT_EQ(query(opened, kReaders), kept);
    EXPECT_THAT(query(opened,
                      "SELECT id, name, json_extract(payload, '$.HostApplicationDisplayID')"
                      " FROM analytics_events ORDER BY id"),
                ElementsAre("3|com.quorvel.sonik.Playback.Error|a",
                            "7|com.quorvel.sonik.vxreportingclientuptime|null",
                            "9|com.quorvel.sonik.Playback.Error|null"));
    EXPECT_EQ(query(opened, kColumns), fresh);
    EXPECT_EQ(opened.epoch[0], *version == '3' ? 3 : 9);  // that of version 3 has one
    EXPECT_EQ(open().epoch, opened.epoch);
    EXPECT_THAT(query(opened, "SELECT count(*) FROM store_epochs"), ElementsAre("1"));
  }
  EXPECT_THAT(query(open(), "PRAGMA user_version"), ElementsAre("4"));
}

TEST_F(StoreFileTest, ViewsTellSessionsApartAndCompareNumbersAsNumbers) {
  setenv("TZ", "XXX-9", 1);
  tzset();
  const OpenedStore opened = open();
  for (const char* sql :
       {// An identifier that is used again, a standalone, and a row that is no JSON.
        "INSERT INTO relay_sessions(time, session_id, client_name, service_name, batch_event,"
        " user_info, uid, ended_at, ended_how) VALUES"
        " (1000.25, 7, 'c', 'telephony_session', 1, '{\"HostApplicationDisplayID\":\"a\"}', 5, "
        "1004,"
        " 'stopped'), (2000, 7, 'c', 'alarms_session', 0, '{', 5, NULL, NULL),"
        " (3000, -1, 'c', 'standalone', NULL, '{}', 5, NULL, NULL)",
        "INSERT INTO event_names VALUES (1, 'com.quorvel.sonik.ChannelReporting.Generic'),"
        " (2, 'com.quorvel.sonik.HAL_ChannelReporting.Generic')",
        "INSERT INTO relay_messages(time, relay_session, category, type, payload, event_name,"
        " event_microseconds, event_tail) VALUES"
        " (1001, 1, 9, 0, '{\"clicks\":40,\"t\":\"5\"}', 1, 500000, ',\"b\":1}'),"
        " (1002, 1, 9, 0, '{\"mine\":9}', 2, 0, '}'),"
        " (1003, 1, 65535, 65535, '{\"VX_Session_Summary_Event\":\"2\","
        "\"rate\":\"96000,624000,01,1e400\",\"q\":\"a\\\",b\",\"e\":\"\"}', NULL, NULL, NULL),"
        " (1003, 1, 65535, 65535, '{\"rate\":\"1\"}', NULL, NULL, NULL),"
        " (2001, 2, 65535, 65535, '{\"VX_Session_Summary_Event\":\"2,', NULL, NULL, NULL),"
        " (2002, 2, 9, 0, 'no', 1, 0, '}'), (3000, 3, 3, 1, '{}', NULL, NULL, NULL)",
        "INSERT INTO analytics_entries(id, time, name, message, payload) VALUES"
        " (90, 5, 1, 77, '}'), (91, 5, 2, NULL, x'7b00')",
        "INSERT INTO power_records(time, client_identifier, name, record) VALUES"
        " (1, 28, 'Lumo_Haptics', '{\"ApplicationName\":\"a\",\"EngineOnDuration\":0.5}'),"
        " (2, 28, 'Lumo_Haptics', 'no')",
        "INSERT INTO store_ledger(time, event, rows) VALUES (1.5, 'left_out', 1), (2, 'new', 2)"})
    query(opened, sql);
  EXPECT_THAT(
      query(opened,
            "SELECT relay_session, session_id, application, service_type, uid, started_utc,"
            " ended_utc, seconds, ended_how, messages, bytes FROM sessions"),
      ElementsAre("1|7|a|telephony|5|1970-01-01 00:16:40.250|1970-01-01 00:16:44.000|3.75|stopped|"
                  "4|125",
                  "2|7|Unknown|alarms|5|1970-01-01 00:33:20.000|null|null|null|2|33"));
  EXPECT_THAT(
      query(opened,
            "SELECT relay_session, session_id, key, position, text, number"
            " FROM summary_values WHERE key NOT LIKE 'VX%' ORDER BY key, number DESC, position"),
      ElementsAre("1|7|e|1||null", "1|7|q|1|a\"|null", "1|7|q|2|b|null", "1|7|rate|4|1e400|Inf",
                  "1|7|rate|2|624000|624000.0", "1|7|rate|1|96000|96000.0", "1|7|rate|3|01|null"));
  EXPECT_THAT(query(opened,
                    "SELECT relay_session, application, counter, growth"
                    " FROM driver_statistics"),
              ElementsAre("1|a|clicks|40"));
  EXPECT_THAT(query(opened,
                    "SELECT id, time_utc, relay_session, payload FROM analytics_events"
                    " ORDER BY id"),
              ElementsAre("1|1970-01-01 00:16:41.500|1|{\"clicks\":40,\"t\":\"5\",\"b\":1}",
                          "2|1970-01-01 00:16:42.000|1|{\"mine\":9}",
                          "6|1970-01-01 00:33:22.000|2|{\"malformed\":\"n}\"}",
                          "90|1970-01-01 00:00:05.000|null|{\"malformed\":null}",
                          "91|1970-01-01 00:00:05.000|null|{\"malformed\":\"{\\u0000\"}"));
  EXPECT_THAT(query(opened, "SELECT min(json_valid(payload)), count(*) FROM session_messages"),
              ElementsAre("1|7"));
  EXPECT_THAT(query(opened, "SELECT application, engine_on FROM haptics_runs ORDER BY id"),
              ElementsAre("a|0.5", "null|null"));
  EXPECT_THAT(query(opened, "SELECT time_utc, cause, rows, meaning FROM losses ORDER BY id"),
              ElementsAre("1970-01-01 00:00:01.500|left_out|1|one payload is too large for a row",
                          "1970-01-01 00:00:02.000|new|2|null"));
}

TEST_F(StoreFileTest, MigrationThatFailsChangesNothingAndAStoreWithoutItsTablesIsDamaged) {
  StoreTest::query(
      "CREATE TABLE event_names(x); CREATE TABLE analytics_events(x);"
      "CREATE VIEW client_uptimes AS SELECT 1; PRAGMA user_version = 1");
  EXPECT_EQ(open().fault, StoreFault::Damaged);
  EXPECT_THAT(StoreTest::query("SELECT name FROM sqlite_master ORDER BY name"),
              ElementsAre("analytics_events", "client_uptimes", "event_names"));
  removeStore();
  query(open(), "DROP TABLE power_records");
  EXPECT_EQ(open().fault, StoreFault::Damaged);
}

}  // namespace
}  // namespace vx::lnx
