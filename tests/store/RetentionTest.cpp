#include "platform/linux/store/Retention.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

constexpr double kNow = 1576800000;  // the fake clock's
constexpr double kDay = 86400;

class RetentionTest : public StoreTest {
 protected:
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
    for (int i = 0; i < count; ++i) {
      query("INSERT INTO relay_messages(time, relay_session, category, type, payload) SELECT " +
            at + ", max(id), 1, 1, printf('%*c', " + std::to_string(bytes) +
            ", 'x') FROM relay_sessions;" +
            "INSERT INTO analytics_entries(time, name, message, payload) VALUES(" + at +
            ", 1, last_insert_rowid(), '}')");
    }
  }
  static Rows apply(Retention& retention) {
    Rows notes;
    for (const LedgerNote& note : retention.apply())
      notes.push_back(note.event + " " + note.table + " " + std::to_string(note.rows));
    return notes;
  }
  Database database = openStoreDatabase(":memory:").database;
};

TEST_F(RetentionTest, RowsOlderThanTheDaysGoEveryTenMinutesAndTheirSharersWithThem) {
  Retention retention(database.get(), {.maxAgeDays = 2, .commit = {}}, p.clock);
  addPower(1, kNow - 2 * kDay - 1);
  addPower(1, kNow - 2 * kDay);
  addSession(2, kNow - 3 * kDay);
  addSession(1, kNow - kDay);
  EXPECT_THAT(apply(retention),
              ElementsAre("removed_for_age relay_messages 2", "removed_for_age analytics_events 2",
                          "removed_for_age power_records 1", "removed_for_age relay_sessions 1"));
  EXPECT_THAT(query("SELECT id FROM analytics_entries; SELECT id FROM power_records"),
              ElementsAre("3", "2"));
  p.clock.advance(10min - 1s);
  EXPECT_THAT(apply(retention), IsEmpty());
  p.clock.advance(1s);
  EXPECT_THAT(apply(retention), ElementsAre("removed_for_age power_records 1"));
  Retention unlimited(database.get(), {.maxAgeDays = 0, .commit = {}}, p.clock);
  addPower(2, 0);
  EXPECT_THAT(apply(unlimited), IsEmpty());
}

TEST_F(RetentionTest, PassesComeEverySoManyBatchesAndRemoveAtMostSoManyRows) {
  Retention retention(database.get(), {.maxAgeDays = 1, .commit = {}}, p.clock);
  addPower(33000, 0);
  for (std::size_t i = 1; i < Retention::kBatchesPerPass; ++i)
    ASSERT_THAT(retention.onBatchWritten().size(), 0u);
  EXPECT_EQ(retention.onBatchWritten().at(0).rows, 32000);
  p.clock.advance(10min);
  EXPECT_THAT(apply(retention), ElementsAre("removed_for_age power_records 1000"));
}

TEST_F(RetentionTest, OldestGoFirstUntilTheSizeFits) {
  Retention retention(database.get(), {.maxBytes = 1 << 20, .maxAgeDays = 0, .commit = {}},
                      p.clock);
  addPower(3000, kNow, 200);
  addSession(1200, kNow - 1, 1000);  // older, written later
  addSession(500, kNow + kDay);
  EXPECT_THAT(apply(retention), ElementsAre("removed_for_size relay_messages 1000",
                                            "removed_for_size analytics_events 1000"));
  EXPECT_THAT(query("SELECT count(*) FROM power_records; SELECT min(id) FROM relay_messages;"
                    "SELECT count(*) FROM relay_sessions;"
                    "SELECT count(*) FROM analytics_events WHERE payload IS NULL"),
              ElementsAre("3000", "1001", "2", "0"));
  addPower(3000, kNow, 200);
  const Rows more = apply(retention);
  ASSERT_EQ(more.size(), 4u);
  EXPECT_EQ(more[0], "removed_for_size relay_messages 500");
  EXPECT_EQ(more[3], "removed_for_size relay_sessions 1");
  EXPECT_EQ(query("SELECT min(id) > 1 AND max(id) = 6000 FROM power_records").at(0), "1");
}

}  // namespace
}  // namespace vx::lnx
