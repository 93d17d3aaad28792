// The store as a whole, on its own thread and the machine's clock.
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include <future>
#include <thread>

#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/store/LocalStore.h"
#include "platform/linux/store/LogReaders.h"
#include "tests/store/StoreTest.h"

namespace vx::lnx {
namespace {

class LocalStoreTest : public StoreTest {
 protected:
  LocalStoreTest() { options.commit.interval = 1h; }
  Result<std::unique_ptr<LocalStore>> tryOpen(const std::optional<JournalEpoch>& epoch = {}) {
    return LocalStore::open(folder, options, clock, epoch);
  }
  void open(const std::optional<JournalEpoch>& epoch = {}) {
    store = std::move(*tryOpen(epoch));
    store->setEndWord([](const JournalTicket& call) -> std::string_view {
      return call.kind() == 1 ? "stopped" : "";
    });
    store->start();
  }
  bool close(std::chrono::seconds within = 60s) { return store->close(clock.monotonic() + within); }
  void reopen() {
    EXPECT_TRUE(close());
    store.reset();
    open();
  }
  std::unique_ptr<RelayBackend::Session> session(int64_t id = 1) {
    return store->relayBackend().open(sessionInfo(id), userInfo());
  }
  void power(int i, const std::string& name = "n") {
    store->logRegisteredEvent(28, name, numbered(i), nullptr);
  }
  // Told when everything before it is committed, or the error that prevents it.
  std::future<std::optional<Error>> flush() {
    auto told = std::make_shared<std::promise<std::optional<Error>>>();
    if (relay == nullptr) relay = session();
    relay->flush([told](std::optional<Error> error) { told->set_value(std::move(error)); });
    return told->get_future();
  }
  std::string file(const std::string& suffix = "") { return folder + "/telemetry.db" + suffix; }
  uintmax_t storeBytes() {
    std::error_code none;
    const uintmax_t log = std::filesystem::file_size(file("-wal"), none);
    return std::filesystem::file_size(file()) + (none ? 0 : log);
  }
  // Makes the rows of a table impossible to write, from outside, until refuse() of none.
  void refuse(const std::string& table) {
    query("DROP TRIGGER IF EXISTS refuse");
    if (!table.empty())
      query("CREATE TRIGGER refuse BEFORE INSERT ON " + table +
            " BEGIN SELECT RAISE(FAIL, 'no'); END");
  }
  static void waitUntil(const std::function<bool()>& condition) {
    while (!condition()) std::this_thread::yield();
  }

  SystemClock clock;
  StoreOptions options;
  std::unique_ptr<LocalStore> store;
  std::unique_ptr<RelayBackend::Session> relay;
};

TEST_F(LocalStoreTest, WhatWasSentIsThereAfterTheClose) {
  open();
  relay = session(42);
  EXPECT_EQ(relay->send(5, 1, numbered(1)), std::nullopt);
  store->sendEventLazy(
      "e", [] { return tagged(numbered(1)); }, Payload(), 0);
  power(2);
  EXPECT_EQ(store->relayBackend().sendOne({{kVyrReportingSessionInfoSessionID, int32_t{-1}}},
                                          Payload(), 7, 2, numbered(3)),
            std::nullopt);
  EXPECT_TRUE(close());
  // Whoever may only read needs them, and cannot make them.
  EXPECT_TRUE(std::filesystem::exists(file("-wal")) && std::filesystem::exists(file("-shm")));
  EXPECT_THAT(query("SELECT s.session_id, m.category, m.type, m.payload FROM relay_messages m "
                    "JOIN relay_sessions s ON s.id = m.relay_session"),
              ElementsAre("42|5|1|{\"i\":1}", "-1|7|2|{\"i\":3}"));
  EXPECT_THAT(query("SELECT name, payload FROM analytics_events"),
              ElementsAre("e|{\"i\":1,\"app\":\"x\\\"y\"}"));
  EXPECT_THAT(query("SELECT client_identifier, name, record, abs(time - strftime('%s')) < 600 "
                    "FROM power_records"),
              ElementsAre("28|n|{\"i\":2}|1"));
  EXPECT_EQ(store->counters().rowsCommitted, 6u);
  EXPECT_EQ(relay->send(5, 1, numbered(1))->code, kRelayErrorClosed);
  EXPECT_TRUE(store->relayBackend().sendOne({}, Payload(), 1, 1, Payload()));
  EXPECT_EQ(flush().get()->code, kRelayErrorClosed);
}

TEST_F(LocalStoreTest, EventWaitsForAMessageOfTheNextBatch) {
  options.commit.rows = 2;
  open();
  const Payload late = numbered(1);
  store->sendEventLazy(
      "late", [late] { return tagged(late); }, late, 0);
  power(1);
  waitUntil([&] { return store->counters().rowsCommitted >= 1; });
  session()->send(1, 1, late);
  EXPECT_TRUE(close());
  EXPECT_THAT(query("SELECT payload FROM analytics_events"),
              ElementsAre("{\"i\":1,\"app\":\"x\\\"y\"}"));
  EXPECT_EQ(store->counters().rowsCommitted, 4u);
}

TEST_F(LocalStoreTest, FailedWriteIsRepeatedInOrderAndLosesNothing) {
  options.commit.rows = 2;  // several transactions
  open();
  EXPECT_EQ(flush().get(), std::nullopt);
  UserAccounts accounts;
  store->setAccounts(accounts);
  refuse("power_records");
  for (int i = 0; i < 5; ++i) power(i);
  std::promise<Rows> told;
  relay->flush([&](const std::optional<Error>& error) {
    told.set_value(error ? Rows() : query("SELECT record FROM power_records"));
  });
  auto rows = told.get_future();
  waitUntil([&] { return store->counters().writeFailures > 0; });
  EXPECT_EQ(rows.wait_for(0s), std::future_status::timeout);
  refuse("");
  EXPECT_THAT(rows.get(),
              ElementsAre("{\"i\":0}", "{\"i\":1}", "{\"i\":2}", "{\"i\":3}", "{\"i\":4}"));
  EXPECT_TRUE(close());
  EXPECT_EQ(store->counters().rowsLost, 0u);
  EXPECT_EQ(accounts.total(MemoryKind::Waiting), 0);
}

// Also where the flush comes in a batch of its own.
TEST_F(LocalStoreTest, RowsThatCannotBeWrittenByTheDeadlineAreCountedAndTold) {
  options.commit.rows = 2;
  open();
  EXPECT_EQ(flush().get(), std::nullopt);
  refuse("relay_messages");
  relay->send(1, 1, numbered(0));
  auto ofTheRow = flush();
  for (int i = 1; i < 5; ++i) relay->send(1, 1, numbered(i));
  within({recorded(), {}}, [&] {
    for (int i = 0; i < 2; ++i) relay->send(1, 1, numbered(i));
  });
  waitUntil([&] { return store->counters().writeFailures > 0; });
  auto flushed = flush();
  store->stopAccepting();
  const LocalStore::Counters counters = store->counters();
  const uint64_t before = store->progress();
  waitUntil([&] { return store->counters().writeFailures > counters.writeFailures; });
  EXPECT_EQ(store->progress(), before);
  EXPECT_EQ(counters.unrecordedWaiting, 5u);
  EXPECT_FALSE(store->waitUntilEnded(clock.monotonic()));
  store->giveUp();
  EXPECT_TRUE(store->waitUntilEnded(Monotonic::max()));
  EXPECT_TRUE(ofTheRow.get());
  EXPECT_TRUE(flushed.get());
  EXPECT_EQ(store->counters().rowsLost, 5u);
  EXPECT_EQ(store->counters().rowsLeft, 2u);
  EXPECT_EQ(store->counters().unrecordedWaiting, 0u);
  EXPECT_FALSE(close());
  EXPECT_EQ(undone(), 1);
}

TEST_F(LocalStoreTest, DamageIsMovedAsideWithALedgerRow) {
  write("telemetry.db", std::string(20000, 'x'));
  open();
  for (int i = 0; i < 500; ++i) power(i, std::string(1000, 'n'));
  EXPECT_TRUE(close());
  store.reset();
  {
    std::fstream torn(file(), std::ios::in | std::ios::out | std::ios::binary);
    torn.seekp(16384 * 12);  // found by the check alone
    torn << std::string(16384, '\x5A');
  }
  open();
  power(1, "fresh");
  EXPECT_TRUE(close());
  // All but those of one page are taken over.
  EXPECT_THAT(query("SELECT count(*) BETWEEN 450 AND 499, max(name = 'fresh') FROM power_records"),
              ElementsAre("1|1"));
  EXPECT_THAT(query("SELECT id IN (SELECT min(id) FROM power_records UNION SELECT 500)"
                    " FROM power_records WHERE id IN (1, 500)"),
              ElementsAre("1", "1"));
  EXPECT_THAT(query("SELECT event, detail LIKE 'failed its check (%); now %damaged-%' "
                    "FROM store_ledger"),
              ElementsAre("moved_aside|0", "moved_aside|1"));
}

TEST_F(LocalStoreTest, FileAndLogStayWithinTheSizeAndItsSlack) {
  options.maxBytes = 12 << 20;
  open();
  uintmax_t largest = 0;
  for (int i = 0; i < 24; ++i) {
    const std::size_t bytes = i % 6 == 5 ? 5 << 19 : 600 << 10;  // now and then a long summary
    store->logRegisteredEvent(28, "n", PayloadBuilder().set("f", std::string(bytes, 'x')).build(),
                              nullptr);
    if (i % 4 == 3) flush().get();
    largest = std::max(largest, storeBytes());
  }
  flush().get();
  EXPECT_LE(std::max(largest, storeBytes()), options.maxBytes + StoreOptions::kSlackBytes);
  const char* const removals = "SELECT count(*) FROM store_ledger WHERE event = 'removed_for_size'";
  const int removedBefore = std::stoi(query(removals).at(0));
  EXPECT_GT(removedBefore, 0);
  // With a journal that an earlier process moved there, and that could not be taken back.
  std::filesystem::create_directory(folder + "/journal");
  write("journal/some", std::string(3 << 20, 'x'));
  options.maxBytes = 9 << 20;
  reopen();
  EXPECT_TRUE(close());
  store.reset();
  EXPECT_LE(storeBytes(), 6u << 20);
  EXPECT_GT(std::stoi(query(removals).at(0)), removedBefore);  // of what went at the end too
}

TEST_F(LocalStoreTest, NewerStoreIsLeftAloneAndOneBesideItIsBegun) {
  open();
  close();
  store.reset();
  query("PRAGMA user_version = 5");
  open();
  power(1);
  reopen();
  power(2);
  EXPECT_TRUE(close());
  EXPECT_THAT(
      query("SELECT user_version, (SELECT count(*) FROM power_records) FROM pragma_user_version"),
      ElementsAre("5|0"));
  std::filesystem::rename(folder + "/telemetry-schema4.db", file());
  EXPECT_THAT(query("SELECT record FROM power_records"), ElementsAre("{\"i\":1}", "{\"i\":2}"));
  EXPECT_THAT(query("SELECT event FROM store_ledger"), ElementsAre("beside_newer", "beside_newer"));
}

// What cannot be used now says nothing of what is in it. Its journal's epoch is promised meanwhile,
// or one of its own, under which a later process finds the rows that were never written.
TEST_F(LocalStoreTest, RowsWaitUntilTheStoreCanBeBegun) {
  open();
  power(1);
  close();
  const JournalEpoch first = store->epoch();
  store.reset();
  const JournalEpoch other{7};
  EXPECT_EQ((*tryOpen(other))->epoch(), first);
  const JournalEpoch unwritten{0x80};  // promised by a process that could not begin the store
  EXPECT_EQ((*tryOpen(unwritten))->epoch(), unwritten);
  std::filesystem::rename(file(), folder + "/kept");
  std::filesystem::create_directory(file());
  const JournalEpoch promised = (*tryOpen())->epoch();
  EXPECT_EQ((*tryOpen(promised))->epoch(), promised);
  EXPECT_EQ((*tryOpen(other))->epoch(), other);
  open(promised);
  power(2);
  const auto flushed = flush();
  waitUntil([&] { return store->counters().writeFailures > 1; });
  std::filesystem::remove(file());
  std::filesystem::rename(folder + "/kept", file());
  EXPECT_TRUE(close());
  EXPECT_THAT(query("SELECT record FROM power_records"), ElementsAre("{\"i\":1}", "{\"i\":2}"));
  EXPECT_THAT(query("SELECT count(*) FROM store_ledger"), ElementsAre("0"));
  store.reset();
  EXPECT_EQ((*tryOpen(other))->epoch(), promised);
  EXPECT_THAT(query("SELECT id, after_power FROM store_epochs"), ElementsAre("1|0", "2|1"));
}

// As after a crash: the same calls run again, from the first that is not known to be done.
TEST_F(LocalStoreTest, ReplayWritesWhatIsMissingAndNothingTwice) {
  const Cause calls[] = {{recorded(1.5), {}}, {recorded(2.5), {}}, {recorded(3.5), {}}};
  const Payload payload = numbered(1);
  auto run = [&](int upTo) {
    const auto sender = within(calls[0], [&] { return session(42); });
    for (int call = 1; call < upTo; ++call) {
      const CauseScope scope(calls[call]);
      sender->send(5, 1, payload);
      store->sendEventLazy(
          "e", [payload] { return tagged(payload); }, payload, 0);
      power(call);
      sender->send(6, 1, Payload());
    }
    if (upTo == 3) within(calls[2], [&] { sender->flush([](const std::optional<Error>&) {}); });
  };
  // A standalone that was delayed: a replay is over before its time comes again.
  auto delayed = [&] {
    within({calls[1].ticket, {9, 1}}, [&] {
      store->relayBackend().sendOne({{kVyrReportingSessionInfoSessionID, int32_t{-1}}}, Payload(),
                                    7, 2, numbered(3));
    });
  };
  open();
  const JournalEpoch epoch = store->epoch();
  run(2);
  delayed();
  reopen();
  EXPECT_EQ(store->epoch(), epoch);
  store->beginReplay({.first = 2, .end = 4, .sessionsFrom = 1});  // the first is older, and found
  run(3);
  std::promise<void> committed;
  store->endReplay([&] { committed.set_value(); });
  committed.get_future().get();
  delayed();
  power(3);
  EXPECT_TRUE(close());
  EXPECT_EQ(store->counters().rowsCommitted, 5u);
  EXPECT_THAT(query("SELECT session_id, call, place, uid, ended_at, ended_how FROM relay_sessions"
                    " WHERE session_id = 42"),
              ElementsAre("42|1|0|1000|3.5|stopped"));
  EXPECT_THAT(query("SELECT count(*) FROM relay_messages WHERE category = 7"), ElementsAre("1"));
  EXPECT_THAT(query("SELECT relay_session, call, place, category, event_place FROM relay_messages"
                    " WHERE category < 7"),
              ElementsAre("1|2|0|5|1073741824", "1|2|3221225472|6|null", "1|3|0|5|1073741824",
                          "1|3|3221225472|6|null"));
  EXPECT_THAT(query("SELECT time, payload FROM analytics_events WHERE id > 2"),
              ElementsAre("3.5|{\"i\":1,\"app\":\"x\\\"y\"}"));
  EXPECT_THAT(query("SELECT call, uid, record, time = 3.5 FROM power_records"),
              ElementsAre("2|1000|{\"i\":1}|0", "3|1000|{\"i\":2}|1", "null|null|{\"i\":3}|0"));
}

// Rows bear them, and may be gone when the next process numbers its calls.
TEST_F(LocalStoreTest, NumbersOfCallsAreRememberedWhenTheirRowsAreGone) {
  journal = std::move(
      *Journal::open({.folder = folder + "/journal", .epoch = kEpoch, .first = {.call = 1 << 22}}));
  const Cause call{recorded(), {}};
  const CauseScope scope(call);
  open();
  power(1);
  EXPECT_TRUE(close());
  query("DELETE FROM power_records");
  reopen();
  EXPECT_EQ(store->lastCall(), uint64_t{1} << 22);
}

// ------------------------------------------------- what others do to its files while it writes
// them

class StoreFaultsTest : public LocalStoreTest {
 protected:
  // What the session says until everything before is committed.
  std::optional<Error> say(int i) {
    relay->send(5, 1, numbered(i));
    return flush().get();
  }
  Rows messages() {
    return query(
        "SELECT s.session_id, m.payload FROM relay_messages m"
        " JOIN relay_sessions s ON s.id = m.relay_session ORDER BY m.id");
  }
  Rows ledger() { return query("SELECT event FROM store_ledger ORDER BY id"); }
};

TEST_F(StoreFaultsTest, LostStoreIsBegunAfreshWithWhatWaitsAndTheSessionsItIsOf) {
  open();
  relay = session(42);
  EXPECT_EQ(say(1), std::nullopt);
  bool there = true;
  auto lose = [&] {
    if (std::exchange(there, false)) std::filesystem::remove(file());
    return numbered(0);
  };
  store->sendEventLazy("e", lose, Payload(), 0);  // within a transaction
  EXPECT_EQ(say(2), std::nullopt);
  EXPECT_THAT(messages(), ElementsAre("42|{\"i\":2}"));
  EXPECT_THAT(ledger(), ElementsAre("store_lost"));
  EXPECT_EQ(say(3), std::nullopt);
  EXPECT_THAT(messages(), ElementsAre("42|{\"i\":2}", "42|{\"i\":3}"));

  write("other", "not ours");
  std::filesystem::rename(folder + "/other", file());
  EXPECT_EQ(say(4), std::nullopt);
  EXPECT_THAT(messages(), ElementsAre("42|{\"i\":4}"));
  EXPECT_THAT(query("SELECT detail LIKE '%replaced%damaged-%' FROM store_ledger"),
              ElementsAre("1"));

  std::filesystem::resize_file(file(), 0);
  EXPECT_EQ(say(5), std::nullopt);
  EXPECT_EQ(messages().back(), "42|{\"i\":5}");

  for (int i = 0; i < 300; ++i) relay->send(5, 1, numbered(1000 + i));
  EXPECT_EQ(say(6), std::nullopt);
  reopen();  // the log is written back
  relay = session(43);
  relay->send(5, 1, numbered(7));
  std::promise<void> cut;
  relay->flush([&](const std::optional<Error>&) {  // before the files are looked at
    std::filesystem::resize_file(file(), 12288);
    cut.set_value();
  });
  cut.get_future().get();
  EXPECT_EQ(say(8), std::nullopt);
  EXPECT_EQ(messages().back(), "43|{\"i\":8}");
  EXPECT_EQ(ledger().front(), "store_lost");
}

TEST_F(StoreFaultsTest, DeletedLogIsWrittenBackBeforeAnotherIsBegun) {
  open();
  relay = session(42);
  EXPECT_EQ(say(1), std::nullopt);
  std::filesystem::remove(file("-wal"));
  EXPECT_EQ(say(2), std::nullopt);
  EXPECT_THAT(messages(), ElementsAre("42|{\"i\":1}", "42|{\"i\":2}"));
  EXPECT_THAT(ledger(), ElementsAre("log_lost"));
  std::filesystem::remove_all(folder);
  EXPECT_EQ(say(3), std::nullopt);
  EXPECT_THAT(messages(), ElementsAre("42|{\"i\":3}"));
  EXPECT_THAT(tryOpen().status().text(), HasSubstr("another"));
}

// A reader is another process; it begins before there are threads here.
TEST_F(StoreFaultsTest, WritingPausesWhileAReaderHoldsTheLogAtItsBoundAndSaysWhoItIs) {
  int ends[2];
  char word = 0;
  ASSERT_EQ(socketpair(AF_UNIX, SOCK_STREAM, 0, ends), 0);
  const pid_t reader = fork();
  if (reader == 0) {
    sqlite3* opened = nullptr;
    if (::read(ends[1], &word, 1) != 1 || sqlite3_open(file().c_str(), &opened) != SQLITE_OK ||
        execute(opened, "BEGIN; SELECT count(*) FROM power_records") != SQLITE_OK ||
        ::write(ends[1], "r", 1) != 1)
      _exit(1);
    _exit(::read(ends[1], &word, 1) == 1 ? 0 : 1);  // the kernel lets go of its locks
  }
  open();
  EXPECT_EQ(flush().get(), std::nullopt);
  ASSERT_EQ(::write(ends[0], "b", 1), 1);
  ASSERT_EQ(::read(ends[0], &word, 1), 1);
  const Payload large = PayloadBuilder().set("f", std::string(500000, 'x')).build();
  for (int i = 0; i < 40; ++i) store->logRegisteredEvent(28, "n", large, nullptr);
  auto flushed = flush();
  waitUntil([&] { return store->counters().writeFailures > 0; });
  EXPECT_LE(storeBytes(), StoreOptions::kSlackBytes);
  EXPECT_EQ(flushed.wait_for(0s), std::future_status::timeout);
  ASSERT_EQ(::write(ends[0], "e", 1), 1);
  int status = 1;
  waitpid(reader, &status, 0);
  EXPECT_EQ(status, 0);
  EXPECT_EQ(flushed.get(), std::nullopt);
  EXPECT_THAT(query("SELECT count(*) FROM power_records"), ElementsAre("40"));
  EXPECT_THAT(
      query("SELECT event, detail LIKE '%(pid " + std::to_string(reader) + ")' FROM store_ledger"),
      ElementsAre("log_held|1"));
  for (const int end : ends) ::close(end);
}

TEST_F(StoreFaultsTest, ReadersAreThoseWithAReadLockOnTheIndex) {
  std::istringstream locks(
      "1: POSIX  ADVISORY  READ 10 fe:01:7 128 128\n"  // has it open, reads nothing
      "2: POSIX  ADVISORY  READ 11 fe:01:7 124 124\n"
      "2: -> POSIX  ADVISORY  READ 12 fe:01:7 124 124\n"
      "3: POSIX  ADVISORY  WRITE 13 fe:01:7 120 120\n"
      "4: POSIX  ADVISORY  READ 14 fe:01:17 124 124\n"
      "5: FLOCK  ADVISORY  READ 15 fe:01:7 0 EOF\n"
      "6: POSIX  ADVISORY  READ 11 fe:01:7 123 123\n"
      "7: POSIX  ADVISORY  READ " +
      std::to_string(getpid()) +
      " fe:01:7 123 127\n"
      "8: POSIX  ADVISORY  READ 16 fe:01:7 127 127\n");
  EXPECT_THAT(readersIn(locks, 7), ElementsAre(11, 16));
}

}  // namespace
}  // namespace vx::lnx
