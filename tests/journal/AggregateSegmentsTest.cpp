#include <sys/stat.h>

#include <cstring>

#include "platform/linux/aggregates/AggregateSegments.h"
#include "tests/journal/JournalFixture.h"

namespace vx::lnx {
namespace {

using Block = AggregateMemory::Block;

class AggregateSegmentsTest : public JournalFixture {
 protected:
  // What the next process has, when this one ends without a word.
  void reopen(std::size_t maxBytes = std::size_t{192} << 20) {
    elsewhere.clear();
    memory = std::make_unique<AggregateSegments>(
        AggregateOptions{options.folder, maxBytes,
                         [this](Function<void()> work) { elsewhere.push_back(std::move(work)); }});
    memory->setUnrecordedHandler([this](const Status& why) { told.push_back(why.text()); });
    complaints.clear();
    ASSERT_TRUE(memory->open(complaints).ok());
  }
  Block acquire(uint64_t aggregate, uint32_t ordinal, std::size_t bytes) {
    const Block block = memory->acquire(aggregate, ordinal, bytes);
    EXPECT_GE(block.size, bytes);
    std::memset(block.bytes, static_cast<int>(aggregate + ordinal), block.size);
    return block;
  }
  // The first byte and the size of each block that is found.
  std::vector<std::pair<int, std::size_t>> found(uint64_t aggregate, std::size_t bytes) {
    std::vector<std::pair<int, std::size_t>> shown;
    for (const Block& block : memory->find(aggregate, bytes)) {
      EXPECT_TRUE(block.survives);
      EXPECT_EQ(block.bytes[0], block.bytes[block.size - 1]);
      shown.emplace_back(block.bytes[0], block.size);
    }
    return shown;
  }
  void completeSnapshot() {
    memory->snapshotBegan();
    memory->snapshotCompleted();
  }
  void runElsewhere() {
    for (Function<void()>& work : std::exchange(elsewhere, {})) work();
  }

  std::unique_ptr<AggregateSegments> memory;
  std::vector<std::string> told;
  std::vector<Function<void()>> elsewhere;
};

TEST_F(AggregateSegmentsTest, TheNextProcessFindsWhatItAsksFor) {
  reopen();
  const uint64_t first = memory->nameAggregate();
  acquire(20, 0, 480);
  acquire(30, 0, 480);
  for (uint32_t i = 0; i < 200; ++i) acquire(40, i, i < 100 ? 480 : 5000);
  acquire(20, 1, 300000);
  acquire(20, 2, 70);
  acquire(50, 1, 70);  // whose first one is not there
  reopen();
  EXPECT_NE(memory->nameAggregate(), first);
  EXPECT_THAT(found(20, 481), ElementsAre(std::pair(20, 480), std::pair(21, 303072)));
  EXPECT_THAT(found(20, 481), IsEmpty());  // once
  EXPECT_THAT(found(30, 480), ElementsAre(std::pair(30, 480)));
  EXPECT_THAT(found(40, 480 * 100), SizeIs(100));
  EXPECT_THAT(found(50, 10), IsEmpty());
  EXPECT_THAT(found(60, 10), IsEmpty());
  const std::size_t bytes = memory->counters().fileBytes;
  for (uint32_t i = 1; i <= 26; ++i) acquire(30, i, 480);  // as many as nobody has
  EXPECT_EQ(memory->counters().fileBytes, bytes);
  reopen();
  EXPECT_THAT(found(20, 1 << 20), SizeIs(2));
  EXPECT_THAT(found(30, 1 << 20), SizeIs(27));
  EXPECT_THAT(complaints, IsEmpty());
  const std::vector<std::string> names = files();
  memory->discard();
  EXPECT_THAT(files(), IsEmpty());
  reopen();
  acquire(20, 0, 480);
  EXPECT_EQ(std::ranges::count(names, files().front()), 0);
}

TEST_F(AggregateSegmentsTest, WhatWasReleasedWaitsForASnapshotThatWasBegunAfterwards) {
  reopen();
  const Block blocks[] = {acquire(1, 0, 480), acquire(6, 0, 480), acquire(2, 0, 480),
                          acquire(3, 0, 1 << 20)};
  memory->snapshotTaken();
  memory->release({blocks, 2});
  memory->snapshotBegan();
  memory->snapshotBegan();  // the one before it was not completed
  memory->release({blocks + 2, 2});
  const Block since = acquire(7, 0, 480);
  memory->release({&since, 1});
  EXPECT_EQ(acquire(8, 0, 480).bytes, since.bytes) << "no snapshot names it";
  EXPECT_NE(acquire(4, 0, 480).bytes, blocks[1].bytes);
  memory->snapshotCompleted();
  EXPECT_EQ(memory->counters().waitingBytes, blocks[2].size + blocks[3].size);
  EXPECT_EQ(acquire(5, 0, 480).bytes, blocks[1].bytes);
  reopen();
  EXPECT_THAT(found(1, 480), IsEmpty());
  EXPECT_THAT(found(2, 480), SizeIs(1));
  EXPECT_THAT(found(3, 1 << 20), SizeIs(1));
  memory->snapshotCompleted();  // of one that was not begun
  EXPECT_THAT(found(4, 480), SizeIs(1));
  const std::size_t bytes = memory->counters().fileBytes;
  completeSnapshot();
  EXPECT_THAT(found(5, 480), IsEmpty());
  reopen();
  EXPECT_EQ(memory->counters().fileBytes, bytes);
  completeSnapshot();
  EXPECT_THAT(files(), IsEmpty());
  EXPECT_EQ(memory->counters().fileBytes, bytes);  // giving it back takes its time
  runElsewhere();
  EXPECT_EQ(memory->counters().fileBytes, 0u);
}

TEST_F(AggregateSegmentsTest, BeyondTheBoundBlocksAreOfTheHeapWhichIsSaidOnce) {
  reopen(std::size_t{300} << 10);
  std::vector<Block> blocks;
  for (uint32_t i = 0; i < 20; ++i) blocks.push_back(acquire(1, i, 32000));
  const auto surviving = std::ranges::count(blocks, true, &Block::survives);
  EXPECT_EQ(surviving, 8);  // 64, 64 and 128 KiB
  EXPECT_TRUE(std::ranges::is_partitioned(blocks, std::identity(), &Block::survives));
  EXPECT_THAT(told, ElementsAre(HasSubstr("No space left")));
  EXPECT_EQ(memory->counters().unrecordedBytes, 12 * 32000u);
  EXPECT_EQ(memory->counters().waitingBytes, 0u);
  memory->release(blocks);
  EXPECT_EQ(memory->counters().unrecordedBytes, 0u);
  completeSnapshot();
  runElsewhere();
  EXPECT_TRUE(acquire(2, 0, 32000).survives);
  AggregateSegments none;
  const Block block = none.acquire(1, 0, 10);
  EXPECT_FALSE(block.survives);
  none.release({&block, 1});
}

TEST_F(AggregateSegmentsTest, FilesThatAreNotItsOwnAreSetAside) {
  reopen();
  acquire(1, 0, 480);
  const std::string good = onlySegment();
  const Bytes bytes = bytesOf(good);
  const auto make = [&](char number, std::size_t at, Bytes with, std::size_t size) {
    Bytes changed = bytes;
    std::ranges::copy(with, changed.begin() + static_cast<std::ptrdiff_t>(at));
    changed.resize(size);
    const std::string path = options.folder + "/aggregate-" + number + ".vxa";
    std::ofstream(path, std::ios::binary)
        .write(reinterpret_cast<const char*>(changed.data()),
               static_cast<std::streamsize>(changed.size()));
    chmod(path.c_str(), 0600);
    return path;
  };
  make('a', 0, {9}, bytes.size());        // another magic number
  make('b', 8, {9}, bytes.size());        // version
  make('c', 12, {130}, bytes.size());     // number of blocks
  make('d', 17, {6}, 4096 + 128 * 1536);  // a size that no block has
  make('e', 0, {}, 10);
  chmod(make('f', 0, {}, bytes.size()).c_str(), 0640);
  std::filesystem::create_symlink(good, options.folder + "/aggregate-g.vxa");
  mkfifo((options.folder + "/aggregate-h.vxa").c_str(), 0600);
  std::ofstream(options.folder + "/aggregate-i.vxa.new") << "of a process that ended just then";
  reopen();
  EXPECT_THAT(complaints, SizeIs(8));
  EXPECT_EQ(memory->counters().aside, 8u);
  EXPECT_THAT(found(1, 480), ElementsAre(std::pair(1, 480)));
  EXPECT_THAT(files(), SizeIs(1 + JournalFolder::kMaxAside));
}

}  // namespace
}  // namespace vx::lnx
