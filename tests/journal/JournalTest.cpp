// What is appended, held, let go of, and read again.
#include <sys/resource.h>

#include <csignal>
#include <cstring>
#include <thread>

#include "tests/journal/JournalFixture.h"

namespace vx::lnx {
namespace {

class JournalTest : public JournalFixture {
 protected:
  // Segments are 2 MiB; two of these entries fill one.
  Result<JournalAppended> appendLarge(uint8_t kind) {
    return append(kind, dictionary(kind, 1000000));
  }
  // A generation whose snapshot is one record.
  void snapshot(uint8_t kind) {
    ASSERT_TRUE(journal->beginGeneration().ok());
    ASSERT_TRUE(journal->appendToSnapshot({.kind = kind}).ok());
    ASSERT_TRUE(journal->endSnapshot().ok());
  }
};

TEST_F(JournalTest, GivesBackWhatWasAppendedWithItsNotes) {
  options.first.call = 41;
  open();
  const Payload odd = PayloadBuilder().set("a key", 0.0 / 0.0).build();
  const auto first = append(3, odd, {9, 8, 7});
  const auto second = journal->append({.kind = 0, .dictionary = Payload().validated()});
  const auto third = journal->append({.kind = 255, .head = Bytes(8, 5)});
  ASSERT_TRUE(first.ok() && second.ok() && third.ok());
  const Bytes bytes{1, 2, 3};
  EXPECT_TRUE(journal->note(first->ticket, 4, bytes).ok());
  EXPECT_TRUE(journal->note(third->ticket, 5, {}).ok());
  EXPECT_FALSE(journal->note({}, 5, {}).ok());
  EXPECT_EQ(first->call, 41u);
  EXPECT_EQ(third->call, 43u);
  EXPECT_EQ(first->dictionary, odd);
  EXPECT_TRUE(first->dictionary.hasSpaceInKeys() && first->dictionary.mayHoldNonFinite());
  EXPECT_EQ(second->dictionary.identity(), nullptr);
  EXPECT_EQ(journal->counters().appended, 5u);

  const JournalContents contents = read();
  const auto& records = contents.records;
  ASSERT_THAT(records, SizeIs(3));
  EXPECT_EQ(std::tuple(records[0].kind, records[0].call, records[0].time, records[0].connection),
            std::tuple(3, 41u, 1.5, 7u));
  EXPECT_EQ(std::tuple(records[0].head, records[0].dictionary), std::tuple(Bytes{9, 8, 7}, odd));
  EXPECT_TRUE(records[0].dictionary->hasSpaceInKeys());
  EXPECT_EQ(records[0].notes.at(0).kind, 4);
  EXPECT_EQ(records[0].notes.at(0).bytes, bytes);
  EXPECT_EQ(records[1].dictionary, Payload());
  EXPECT_EQ(records[2].dictionary, std::nullopt);
  EXPECT_EQ(records[2].head, Bytes(8, 5));
  EXPECT_THAT(records[2].notes, SizeIs(1));
}

TEST_F(JournalTest, ACallIsDoneWhenItsLastTicketHasGone) {
  open();
  auto one = append(1, dictionary(1));
  auto two = append(2, dictionary(2));
  JournalTicket copy = two->ticket;
  two->ticket = {};
  one->ticket = {};
  EXPECT_EQ(readKinds(), "1d 2");
  copy = JournalTicket(copy);
  EXPECT_EQ(readKinds(), "1d 2");
  copy = {};
  EXPECT_EQ(readKinds(), "1d 2d");
}

TEST_F(JournalTest, AnEntryMayBeAsLargeAsItsLimitAndFillItsSegmentToTheLastByte) {
  open();
  const std::size_t most = kMaxEntryBytes - sizeof(EntryHeader);
  EXPECT_TRUE(append(1, Payload(), Bytes(most)).ok());
  EXPECT_EQ(append(2, Payload(), Bytes(most + 1)).status().code(), EMSGSIZE);
  EXPECT_EQ(readKinds(), "1d");
  EXPECT_EQ(read().records[0].head.size(), most);
  std::filesystem::remove_all(options.folder);
  open();
  const std::size_t space = kSegmentBytes - kFirstEntry - 2 * sizeof(EntryHeader);
  const auto first = append(1, Payload(), Bytes(space / 2));
  const auto second = append(2, Payload(), Bytes(space - padded(space / 2)));
  const auto third = append(3, Payload());
  ASSERT_TRUE(first.ok() && second.ok() && third.ok());
  EXPECT_EQ(journal->counters().segmentsInUse, 2u);
  EXPECT_EQ(readKinds(), "1 2 3");
  EXPECT_EQ(read().tornBytes, 0u);
}

// ------------------------------------------------------------------------------------ generations

TEST_F(JournalTest, TheNewestCompleteSnapshotIsTheBase) {
  open();
  std::vector<JournalTicket> held;
  const auto call = [&](uint8_t kind) { held.push_back(append(kind, dictionary(kind))->ticket); };
  appendDone(1);
  call(2);
  snapshot(3);
  call(4);
  appendDone(5);
  EXPECT_EQ(readKinds(), "2b 3s 4 5d");
  ASSERT_TRUE(journal->beginGeneration().ok());
  ASSERT_TRUE(journal->appendToSnapshot({.kind = 6}).ok());
  call(7);
  EXPECT_EQ(readKinds(), "2b 3s 4 5d 7") << "an incomplete snapshot counted";
  ASSERT_TRUE(journal->beginGeneration().ok());
  EXPECT_EQ(read().base, 2u);
  ASSERT_TRUE(journal->appendToSnapshot({.kind = 8}).ok());
  ASSERT_TRUE(journal->endSnapshot().ok());
  EXPECT_EQ(readKinds(), "2b 4b 7b 8s");
  EXPECT_EQ(read().base, 4u);
  EXPECT_FALSE(journal->endSnapshot().ok());
  EXPECT_FALSE(journal->appendToSnapshot({}).ok());
  EXPECT_EQ(journal->counters().recycled, 0u) << "a call of the first generation still waits";
  held.clear();
  snapshot(9);
  EXPECT_EQ(readKinds(), "9s");
  EXPECT_EQ(journal->counters().recycled, 4u);
  EXPECT_EQ(journal->counters().segmentsInUse, 1u);
}

TEST_F(JournalTest, ANoteStaysAsLongAsItsCall) {
  open();
  const auto call = append(1, dictionary(1));
  snapshot(2);
  ASSERT_TRUE(journal->note(call->ticket, 3, Bytes{1}).ok());
  snapshot(4);
  EXPECT_EQ(readKinds(), "1b 4s");
  EXPECT_THAT(read().records[0].notes, SizeIs(1));
}

TEST_F(JournalTest, UsesSegmentsAgainForEverButAPayloadKeepsItsBytes) {
  options.maxBytes = 8 * kSegmentBytes;
  open();
  Payload kept = append(1, dictionary(1, 1000))->dictionary;
  const Payload same = dictionary(1, 1000);
  for (int round = 0; round < 4; ++round) {
    for (uint8_t i = 0; i < 6; ++i) ASSERT_TRUE(appendLarge(i).ok());
    snapshot(9);
  }
  EXPECT_EQ(kept, same);
  EXPECT_EQ(readKinds(), "9s") << "its call is done, though its bytes stay";
  EXPECT_EQ(read().tornBytes, 0u) << "what a used segment held before does not come back";
  EXPECT_EQ(journal->counters().full, 0u);
  EXPECT_EQ(journal->counters().segmentsInUse, 2u);
  Payload last = append(2, same)->dictionary;
  kept = {};
  snapshot(9);
  snapshot(9);
  EXPECT_EQ(journal->counters().segmentsInUse, 2u) << "the segment of `last`, and the active one";
  JournalTicket ticket = append(2, same)->ticket;
  journal.reset();
  EXPECT_EQ(last, same);
  last = {};
  EXPECT_EQ(readKinds(), "9s 2");
  ticket = {};
  EXPECT_EQ(readKinds(), "9s 2d");
}

// ------------------------------------------------------------------------------------------- full

TEST_F(JournalTest, IsFullAtItsLimitButForTheSnapshotThatMakesSpace) {
  options.maxBytes = 8 * kSegmentBytes;
  open();
  std::vector<JournalTicket> held;
  for (uint8_t i = 0; i < 12; ++i) {  // six segments
    EXPECT_EQ(journal->hasCapacity(), i < 11) << "told before it is full";
    held.push_back(appendLarge(i)->ticket);
  }
  const auto refused = appendLarge(12);
  EXPECT_EQ(refused.status().code(), ENOSPC);
  EXPECT_EQ(journal->counters().full, 1u);
  EXPECT_THAT(files(), SizeIs(8)) << "two are for the snapshot";
  EXPECT_EQ(readKinds(), "0 1 2 3 4 5 6 7 8 9 10 11");
  held.clear();
  EXPECT_FALSE(appendLarge(12).ok()) << "there is no snapshot after them";
  EXPECT_FALSE(journal->lookForCapacity());
  snapshot(20);
  EXPECT_TRUE(journal->hasCapacity());
  EXPECT_TRUE(appendLarge(21).ok());
  for (uint8_t i = 22; i < 26; ++i) EXPECT_TRUE(appendLarge(i).ok());
  EXPECT_EQ(readKinds(), "20s 21d 22d 23d 24d 25d") << "done, but after the snapshot";
  snapshot(30);
  EXPECT_THAT(files(), SizeIs(::testing::Gt(4u)));
  journal->giveBack();
  EXPECT_THAT(files(), SizeIs(1));
  for (uint8_t i = 31; i < 34; ++i) EXPECT_TRUE(appendLarge(i).ok());
  EXPECT_THAT(files(), SizeIs(4)) << "with spares again";
}

TEST_F(JournalTest, AFileSystemWithoutSpaceMakesItFullAndNoWorse) {
  open();
  for (uint8_t i = 0; i < 3; ++i) ASSERT_TRUE(appendLarge(i).ok());  // two segments, and two spares
  rlimit before{};
  ASSERT_EQ(getrlimit(RLIMIT_FSIZE, &before), 0);
  std::signal(SIGXFSZ, SIG_IGN);
  rlimit none = before;
  none.rlim_cur = kSegmentBytes / 2;
  ASSERT_EQ(setrlimit(RLIMIT_FSIZE, &none), 0);
  int refused = 0;
  bool told = false;
  for (uint8_t i = 0; i < 8; ++i) {
    told = told || !journal->hasCapacity();
    const bool full = appendLarge(i).status().code() == ENOSPC;
    EXPECT_TRUE(told || !full) << "before";
    refused += full ? 1 : 0;
  }
  EXPECT_GE(refused, 2);
  snapshot(20);  // there is space for it, and it makes some
  EXPECT_TRUE(appendLarge(9).ok());
  setrlimit(RLIMIT_FSIZE, &before);
  EXPECT_THAT(files(), SizeIs(4)) << "part of a segment was left";
  bool again = false;
  for (int i = 0; i < 1000 && !again; ++i) again = appendLarge(9).ok();
  EXPECT_TRUE(again);
}

// ---------------------------------------------------------------------------------------- threads

TEST_F(JournalTest, ThreadsAppendHoldAndLetGo) {
  open();
  auto shared = append(1, dictionary(5));
  std::vector<std::thread> threads;
  for (int t = 0; t < 4; ++t)
    threads.emplace_back([this, t, ticket = shared->ticket, payload = shared->dictionary] {
      std::vector<JournalAppended> kept;
      for (int i = 0; i < 1500; ++i) {
        const JournalTicket copy = ticket;
        const Payload other = payload;
        auto appended = append(static_cast<uint8_t>(t), dictionary(i, 800));
        ASSERT_TRUE(appended.ok());
        kept.push_back(*appended);
        if (kept.size() == 100) kept.clear();
        if (t == 0 && i % 500 == 0) snapshot(9);
      }
    });
  for (std::thread& thread : threads) thread.join();
  threads.clear();
  snapshot(9);
  EXPECT_EQ(readKinds(), "1b 9s");
  shared = Status::failure("gone");
  snapshot(9);
  EXPECT_EQ(readKinds(), "9s");
  EXPECT_EQ(journal->counters().segmentsInUse, 1u);
}

// ------------------------------------------------------------------------------------------- torn

class TornTest : public JournalTest {
 protected:
  TornTest() {
    open();
    held.push_back(append(1, dictionary(1), {1, 2, 3})->ticket);
    held.push_back(append(2, dictionary(2, 5), {4, 5, 6})->ticket);
    held.push_back(append(3, dictionary(3))->ticket);
    bytes = bytesOf(onlySegment());
    bytes.resize(1024);
    second = kFirstEntry + padded(lengthAt(kFirstEntry));
    third = second + padded(lengthAt(second));
  }
  std::size_t lengthAt(std::size_t at) const {
    uint32_t length;
    std::memcpy(&length, &bytes[at], sizeof length);
    return length;
  }
  std::vector<JournalTicket> held;
  Bytes bytes;
  std::size_t second = 0;
  std::size_t third = 0;
};

TEST_F(TornTest, EveryChangedByteIsSeenButThoseThatMayChange) {
  ASSERT_THAT(JournalReader::readSegment(bytes).entries, SizeIs(3));
  const std::size_t end = second + lengthAt(second);
  const std::size_t references = second + bodyOffset(3);
  for (std::size_t i = second; i < end; ++i) {
    Bytes changed = bytes;
    changed[i] ^= 0x10;
    const bool mayChange = (i >= second + offsetof(EntryHeader, waiting) &&
                            i < second + offsetof(EntryHeader, checksum)) ||
                           (i >= references && i < references + 4);
    const auto segment = JournalReader::readSegment(changed);
    ASSERT_THAT(segment.entries, SizeIs(mayChange ? 3 : 2)) << "byte " << i - second;
    ASSERT_EQ(segment.entries.back().offset, third) << "what comes after it is read";
    ASSERT_EQ(segment.tornBytes, mayChange ? 0 : third - second);
  }
}

TEST_F(TornTest, ATailThatWasNotWrittenIsNotBelieved) {
  for (std::size_t end = third; end < third + lengthAt(third); ++end) {
    Bytes cut(bytes.begin(), bytes.begin() + static_cast<std::ptrdiff_t>(end));
    ASSERT_THAT(JournalReader::readSegment(cut).entries, SizeIs(2)) << end;  // the file ends
    cut.resize(bytes.size());
    const auto segment = JournalReader::readSegment(cut);  // zeros follow; the last byte is none
    ASSERT_THAT(segment.entries, SizeIs(2)) << end;
    ASSERT_EQ(segment.tornBytes, end < third + 1 ? 0 : bytes.size() - third);
  }
}

TEST_F(TornTest, ALengthOfNoneBeforeTheEndHidesNothing) {
  std::fill_n(bytes.begin() + static_cast<std::ptrdiff_t>(second), 4, uint8_t{0});
  const auto segment = JournalReader::readSegment(bytes);
  EXPECT_THAT(segment.entries, SizeIs(2));
  EXPECT_EQ(segment.tornBytes, third - second);
}

TEST_F(TornTest, AnEntryOfAnotherSegmentOrOutOfOrderIsNotBelieved) {
  Bytes other = bytes;
  ++other[offsetof(SegmentHeader, sequence)];
  EXPECT_THAT(JournalReader::readSegment(other).entries, IsEmpty());
  Bytes twice = bytes;
  std::copy_n(bytes.begin() + kFirstEntry, second - kFirstEntry,
              twice.begin() + static_cast<std::ptrdiff_t>(third));
  EXPECT_THAT(JournalReader::readSegment(twice).entries, SizeIs(2));
}

TEST_F(TornTest, ADictionaryIsValidatedThoughTheChecksumAgrees) {
  const auto poison = [&](std::size_t from, uint8_t value) {
    Bytes poisoned = bytes;
    poisoned[third + bodyOffset(0) + from] = value;
    const uint64_t sum = checksumOf(&poisoned[third], lengthAt(third), 1);
    std::memcpy(&poisoned[third + offsetof(EntryHeader, checksum)], &sum, sizeof sum);
    return JournalReader::readSegment(poisoned).entries.size();
  };
  EXPECT_EQ(poison(8, bytes[third + bodyOffset(0) + 8]), 3u);
  EXPECT_EQ(poison(8, 0xBF), 2u);  // an indefinite length
  EXPECT_EQ(poison(4, 0xFF), 2u);  // a size beyond the entry
  EXPECT_EQ(poison(4, 1), 2u);     // one short of it
}

}  // namespace
}  // namespace vx::lnx
