#include "platform/linux/store/Retention.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

using ::testing::Contains;
using ::testing::Each;

constexpr double kNow = 1576800000;  // the fake clock's
constexpr double kDay = 86400;

class RetentionTest : public StoreTest {
 protected:
  RetentionTest() { options.maxAgeDays = 0; }
  Rows query(const std::string& sql) { return StoreTest::query(database.get(), sql); }
  // `count` rows, a second apart.
  void addPower(int count, double time, std::size_t bytes = 10) {
    query("WITH RECURSIVE n(i) AS (SELECT 0 UNION ALL SELECT i + 1 FROM n WHERE i < " +
          std::to_string(count - 1) +
          ") INSERT INTO power_records(time, client_identifier, name, record) SELECT " +
          std::to_string(time) + " + i, 1, 'n', printf('%*c', " + std::to_string(bytes) +
          ", 'x') FROM n");
  }
  // A session of `count` messages, each with an event that shares its text.
  void addSession(int count, double time, std::size_t bytes = 10) {
    const std::string at = std::to_string(time);
    query("INSERT INTO relay_sessions(time, session_id, user_info) VALUES(" + at + ", 1, '{}')");
    const std::string session = query("SELECT max(id) FROM relay_sessions").at(0);
    for (int i = 0; i < count; ++i) {
      query(
          "INSERT INTO relay_messages(time, relay_session, category, type, payload, event_name,"
          " event_microseconds, event_tail) VALUES(" +
          at + ", " + session + ", 1, 1, printf('%*c', " + std::to_string(bytes) +
          ", 'x'), 1, 0, '}')");
      if (schema2)
        query(
            "UPDATE relay_messages SET event_name = NULL WHERE id = last_insert_rowid();"
            "INSERT INTO analytics_entries(time, name, message, payload) VALUES(" +
            at + ", 1, last_insert_rowid(), '}')");
    }
  }
  Rows apply() {
    Rows notes;
    for (const LedgerNote& note : retention().apply())
      notes.push_back(note.event + " " + note.table + " " + std::to_string(note.rows));
    return notes;
  }
  int count(const std::string& table) {
    return std::stoi(query("SELECT count(*) FROM " + table).at(0));
  }
  Retention& retention() {
    if (!made) made.emplace(database.get(), options, p.clock);
    return *made;
  }
  Database database = openStoreDatabase(":memory:", kEpoch).database;
  StoreOptions options;
  bool schema2 = false;
  std::optional<Retention> made;
};

TEST_F(RetentionTest, RowsOlderThanTheDaysGoAndTheirSharersWithThem) {
  options.maxAgeDays = 2;
  addPower(1, kNow - 2 * kDay - 1);
  addPower(1, kNow - 2 * kDay);
  addSession(1, kNow - 3 * kDay);
  schema2 = true;
  addSession(1, kNow - 3 * kDay);
  addSession(1, kNow - kDay);
  EXPECT_THAT(apply(),
              ElementsAre("removed_for_age relay_messages 2", "removed_for_age analytics_events 2",
                          "removed_for_age power_records 1", "removed_for_age relay_sessions 2"));
  EXPECT_THAT(query("SELECT message FROM analytics_entries"), ElementsAre("3"));
  EXPECT_EQ(count("power_records"), 1);
}

TEST_F(RetentionTest, AgeIsLookedAtEveryTenMinutesAndZeroIsNoLimit) {
  options.maxAgeDays = 2;
  addPower(2, kNow - 2 * kDay);
  EXPECT_THAT(apply(), IsEmpty());
  p.clock.advance(10min - 1s);
  EXPECT_THAT(apply(), IsEmpty());
  p.clock.advance(1s);
  EXPECT_THAT(apply(), ElementsAre("removed_for_age power_records 2"));
  options.maxAgeDays = 0;
  made.reset();
  addPower(2, 0);
  EXPECT_THAT(apply(), IsEmpty());
}

TEST_F(RetentionTest, OnePassRemovesAtMostSoManyRowsOfMany) {
  options.maxAgeDays = 1;
  addPower(33000, 0);
  EXPECT_THAT(apply(), ElementsAre("removed_for_age power_records 32000"));
  p.clock.advance(10min);
  EXPECT_THAT(apply(), ElementsAre("removed_for_age power_records 1000"));
}

TEST_F(RetentionTest, OldestGoFirstUntilTheSizeFits) {
  options.maxBytes = 1 << 20;
  addPower(2500, kNow, 200);
  addSession(1200, kNow - 1, 1000);  // older, written later
  addSession(500, kNow + kDay);
  EXPECT_THAT(apply(), ElementsAre("removed_for_size relay_messages 1000",
                                   "removed_for_size analytics_events 1000"));
  EXPECT_EQ(count("power_records"), 2500);
  EXPECT_EQ(query("SELECT min(id) FROM relay_messages").at(0), "1001");
  EXPECT_EQ(count("relay_sessions"), 2);
  EXPECT_EQ(query("SELECT count(*) FROM analytics_events WHERE payload IS NULL").at(0), "0");
  addPower(3000, kNow, 200);
  const Rows more = apply();
  ASSERT_EQ(more.size(), 4u);
  EXPECT_EQ(more[0], "removed_for_size relay_messages 500");
  EXPECT_EQ(more[3], "removed_for_size relay_sessions 1");
  EXPECT_EQ(query("SELECT min(id) > 1 AND max(id) = 5500 FROM power_records").at(0), "1");
}

TEST_F(RetentionTest, WhoeverHasTheMostMakesSpaceWhateverIsOlder) {
  options.maxBytes = 1 << 20;
  addPower(500, kNow - kDay, 200);
  query("UPDATE power_records SET uid = 7");
  addSession(1500, kNow, 1000);
  query("UPDATE relay_messages SET uid = 8");
  addSession(100, kNow + 1, 1000);  // nobody's
  EXPECT_THAT(apply(), Contains("removed_for_size relay_messages 1000"));
  EXPECT_EQ(query("SELECT count(*) FROM power_records").at(0), "500");
  EXPECT_EQ(query("SELECT count(*) FROM relay_messages WHERE uid IS NULL").at(0), "100");
  retention().noteWritten({{7, 1 << 20}});
  query(
      "INSERT INTO power_records(time, client_identifier, name, record, uid)"
      " SELECT time + 9e5, 1, 'n', printf('%*c', 2000, 'x'), 7 FROM power_records");
  EXPECT_THAT(apply(), Each(HasSubstr("removed_for_size power_records")));
}

TEST_F(RetentionTest, IsAppliedEverySoManyBatches) {
  options.maxAgeDays = 1;
  addPower(1, 0);
  for (std::size_t i = 1; i < Retention::kBatchesPerPass; ++i)
    ASSERT_THAT(retention().onBatchWritten().size(), 0u);
  EXPECT_EQ(retention().onBatchWritten().size(), 1u);
}

}  // namespace
}  // namespace vx::lnx
