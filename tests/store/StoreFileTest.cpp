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
      "SELECT id, session_id, service_name, application, category, type, payload"
      " FROM session_messages UNION ALL"
      " SELECT id, time, client_identifier, name, record, '', '' FROM power_records UNION ALL"
      " SELECT id, time, event, table_name, rows, detail, '' FROM store_ledger UNION ALL"
      " SELECT id, at, process, seconds, '', '', '' FROM client_uptimes";
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
  for (const char* version : {"1", "2"}) {
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
    EXPECT_EQ(opened.epoch, JournalEpoch{9});
  }
  EXPECT_EQ(open().epoch, JournalEpoch{9});  // has one
  EXPECT_THAT(query(open(), "PRAGMA user_version"), ElementsAre("3"));
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
