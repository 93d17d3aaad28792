// What others do to the store's files while the service writes them.
#include <sys/socket.h>
#include <sys/wait.h>
#include <unistd.h>

#include "platform/linux/store/LogReaders.h"
#include "tests/store/LocalStoreTest.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size);

namespace vx::lnx {
namespace {

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
  store->sendEventLazy("e", lose, Payload());  // within a transaction
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

TEST_F(StoreFaultsTest, OlderFilesOfTheFuzzerHoldNoSurprise) {
  int files = 0;
  for (const auto& entry : std::filesystem::directory_iterator(VX_FUZZ_CORPUS "/store")) {
    std::ifstream in(entry.path(), std::ios::binary);
    const std::string bytes((std::istreambuf_iterator<char>(in)), {});
    files +=
        LLVMFuzzerTestOneInput(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size()) + 1;
  }
  EXPECT_GE(files, 3);
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
