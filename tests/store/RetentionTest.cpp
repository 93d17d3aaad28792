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
  // So many rows of such values, in which `i` counts.
  void insert(int count, const std::string& into, const std::string& values) {
    query("WITH RECURSIVE n(i) AS (SELECT 0 UNION ALL SELECT i + 1 FROM n WHERE i < " +
          std::to_string(count - 1) + ") INSERT INTO " + into + " SELECT " + values + " FROM n");
  }
  static std::string text(std::size_t bytes) {
    return "printf('%*c', " + std::to_string(bytes) + ", 'x')";
  }
  void addPower(int count, double time, std::size_t bytes = 10) {
    insert(count, "power_records(time, client_identifier, name, record)",
           std::to_string(time) + " + i, 1, 'n', " + text(bytes));
  }
  // A session of `count` messages, each with an event that shares its text.
  void addSession(int count, double time, std::size_t bytes = 10) {
    const std::string at = std::to_string(time);
    insert(1, "relay_sessions(time, session_id, user_info)", at + ", 1, '{}'");
    insert(count,
           "relay_messages(relay_session, category, type, event_microseconds, event_tail, time,"
           " payload, event_name)",
           "(SELECT max(id) FROM relay_sessions), 1, 1, 0, '}', " + at + ", " + text(bytes) +
               (schema2 ? ", NULL" : ", 1"));
    if (schema2)
      query(
          "INSERT INTO analytics_entries(time, name, message, payload) SELECT time, 1, id, '}'"
          " FROM relay_messages WHERE event_name IS NULL"
          " AND id > (SELECT ifnull(max(message), 0) FROM analytics_entries)");
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

TEST_F(RetentionTest, OnePassRemovesSoManyRowsAtMostAndAgeIsLookedAtEveryTenMinutes) {
  options.maxAgeDays = 1;
  addPower(33000, 0);
  for (std::size_t i = 1; i < Retention::kBatchesPerPass; ++i)
    ASSERT_EQ(retention().onBatchWritten().size(), 0u);
  EXPECT_EQ(retention().onBatchWritten().at(0).rows, 32000);
  p.clock.advance(10min - 1s);
  EXPECT_THAT(apply(), IsEmpty());
  p.clock.advance(1s);
  EXPECT_THAT(apply(), ElementsAre("removed_for_age power_records 1000"));
  options.maxAgeDays = 0;  // no limit
  made.reset();
  addPower(2, 0);
  EXPECT_THAT(apply(), IsEmpty());
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

}  // namespace
}  // namespace vx::lnx
