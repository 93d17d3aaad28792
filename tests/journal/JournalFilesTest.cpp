// What lies in the folder: of another process, another store, another user, another place.
#include <fcntl.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <fstream>

#include "tests/journal/JournalFixture.h"

namespace vx::lnx {
namespace {

namespace fs = std::filesystem;

class JournalFilesTest : public JournalFixture {
 protected:
  // A journal of a process that has ended with one call undone.
  void leaveBehind(uint8_t kind = 1) {
    open();
    append(kind, dictionary(kind))->ticket.abandon();
    journal.reset();
  }
  static void patch(const std::string& path, std::size_t at, uint8_t value) {
    std::fstream file(path, std::ios::binary | std::ios::in | std::ios::out);
    file.seekp(static_cast<std::streamoff>(at));
    file.put(static_cast<char>(value));
  }
};

TEST_F(JournalFilesTest, WhatWasLeftStaysUntilItsCallsAreDone) {
  leaveBehind(1);
  leaveBehind(2);
  open();
  EXPECT_EQ(journal->counters().segmentsInUse, 2u);
  auto third = append(3, dictionary(3));
  EXPECT_EQ(readKinds(), "1 2 3");
  EXPECT_THAT(complaints, IsEmpty());
  EXPECT_GT(third->call, 2u);
  EXPECT_GT(read().records[2].generation, 2u);

  const JournalContents left = read();
  JournalTicket first = journal->resume(left.records[0].place);
  JournalTicket second = journal->resume(left.records[1].place);
  EXPECT_EQ(second.call(), left.records[1].call);
  EXPECT_FALSE(first.wasDone());
  EXPECT_FALSE(journal->resume({99, kFirstEntry})) << "no such segment";
  first = {};
  EXPECT_EQ(readKinds(), "1d 2 3");
  // Run once more, for what it leaves behind: it stays done whenever this process ends.
  first = journal->resume(left.records[0].place);
  EXPECT_TRUE(JournalTicket(first).wasDone());
  EXPECT_EQ(readKinds(), "1d 2 3");

  ASSERT_TRUE(journal->beginGeneration().ok());
  EXPECT_FALSE(journal->earlierCallsAreDone());
  first = second = {};
  EXPECT_FALSE(journal->earlierCallsAreDone()) << "the third is not";
  EXPECT_EQ(journal->counters().recycled, 0u);
  third->ticket = {};
  EXPECT_TRUE(journal->earlierCallsAreDone());
  ASSERT_TRUE(journal->endSnapshot().ok());
  EXPECT_EQ(readKinds(), "");
  EXPECT_EQ(journal->counters().recycled, 3u);
  journal->discard();
  EXPECT_THAT(files(), IsEmpty());
  EXPECT_EQ(append(4, dictionary(4)).status().code(), ENOSPC);
}

TEST_F(JournalFilesTest, FilesOfOthersAreSetAsideAndReported) {
  const auto patched = [](std::size_t at, uint8_t value) {
    return [=](const std::string& path) { patch(path, at, value); };
  };
  const std::pair<const char*, std::function<void(const std::string&)>> cases[] = {
      {"is of another store", [this](auto&) { ++options.epoch[15]; }},
      {"belongs to another user", [](auto& path) { (void)!chown(path.c_str(), 1, -1); }},
      {"is no journal segment", patched(0, 'x')},
      {"is of version 9", patched(offsetof(SegmentHeader, version), 9)},
      {"has a damaged header", patched(offsetof(SegmentHeader, sequence), 9)},
      {"has a damaged header", patched(offsetof(SegmentHeader, state), 0x5B)},
      {"is not of a segment's size", [](auto& path) { fs::resize_file(path, kSegmentBytes - 1); }},
      {"is open to other users", [](auto& path) { chmod(path.c_str(), 0640); }},
      {"cannot open",
       [](auto& path) {
         fs::rename(path, path + ".kept");
         fs::create_symlink(path + ".kept", path);
       }},
      {"is of another kind",
       [](auto& path) {
         fs::remove(path);
         mkfifo(path.c_str(), 0600);
       }},
      {"Is a directory",
       [](auto& path) {
         fs::remove(path);
         fs::create_directory(path);
       }},
  };
  for (const auto& [complaint, spoil] : cases) {
    if (geteuid() != 0 && std::string_view(complaint).ends_with("user")) continue;
    SCOPED_TRACE(complaint);
    fs::remove_all(options.folder);
    leaveBehind();
    const std::string path = onlySegment();
    spoil(path);
    const auto contents = JournalReader::read(options.folder, options.epoch);
    EXPECT_THAT(contents->refused, SizeIs(1));
    EXPECT_THAT(contents->records, IsEmpty());
    open();
    EXPECT_THAT(complaints, ElementsAre(HasSubstr(complaint)));
    EXPECT_EQ(journal->counters().aside, 1u);
    EXPECT_FALSE(fs::exists(fs::symlink_status(path)));
    EXPECT_TRUE(fs::exists(fs::symlink_status(path + ".aside-1")));
    EXPECT_TRUE(append(2, dictionary(2)).ok());
  }
}

TEST_F(JournalFilesTest, FileThatCannotBeMappedAtThisMomentStaysForAnotherProcess) {
  leaveBehind();
  const std::string kinds = readKinds();
  long pages = 0;
  std::ifstream("/proc/self/statm") >> pages;
  rlimit before{};
  getrlimit(RLIMIT_AS, &before);
  const rlimit little{static_cast<rlim_t>(pages * sysconf(_SC_PAGESIZE)) + (1 << 20),
                      before.rlim_max};
  setrlimit(RLIMIT_AS, &little);
  const auto refused = Journal::open(options, &complaints);
  setrlimit(RLIMIT_AS, &before);
  EXPECT_EQ(refused.status().code(), ENOMEM);
  EXPECT_EQ(readKinds(), kinds);
  EXPECT_NE(kinds, "");
}

TEST_F(JournalFilesTest, KeepsTheLastFewThatWereSetAside) {
  for (int i = 0; i < 6; ++i) {
    leaveBehind();
    patch(options.folder + "/segment-0000000000000001.vxj", 0, 'x');
  }
  open();
  std::vector<std::string> names = files();
  ASSERT_THAT(names, SizeIs(JournalFolder::kMaxAside));
  EXPECT_THAT(names[0], HasSubstr(".aside-3"));
  EXPECT_THAT(names[3], HasSubstr(".aside-6"));
}

TEST_F(JournalFilesTest, AFileThatIsBlankIsRemovedWithAWord) {
  open();
  std::ofstream(options.folder + "/segment-0000000000000007.vxj").flush();
  std::ofstream(options.folder + "/segment-0000000000000008.vxj") << std::string(kSegmentBytes, 0);
  for (const std::string& name : files()) chmod((options.folder + "/" + name).c_str(), 0600);
  open();
  EXPECT_THAT(complaints, ElementsAre(HasSubstr("7.vxj is blank")));
  EXPECT_THAT(files(), IsEmpty());
  appendDone(1);
  struct stat info {};
  stat(onlySegment().c_str(), &info);
  EXPECT_EQ(info.st_mode & 0777, 0600u);
}

// Of each file: a write to a page that is not would end the process once the file system is full.
TEST_F(JournalFilesTest, AllocatesItsFirstSegmentAsItFillsAndTheOthersWhole) {
  constexpr std::size_t kStep = std::size_t{256} << 10;
  const auto allocated = [this] {
    std::vector<std::size_t> bytes;
    for (const std::string& name : files()) {
      struct stat info {};
      stat((options.folder + "/" + name).c_str(), &info);
      bytes.push_back(static_cast<std::size_t>(info.st_blocks) * 512);
    }
    return bytes;
  };
  open();
  const std::size_t space = kStep - kFirstEntry - 2 * sizeof(EntryHeader);
  appendDone(1);
  EXPECT_THAT(allocated(), ElementsAre(kStep));
  open();  // what it finds it does not add to
  EXPECT_THAT(allocated(), ElementsAre(kStep));
  journal->discard();
  open();
  ASSERT_TRUE(append(2, Payload(), Bytes(space / 2)).ok());
  ASSERT_TRUE(append(3, Payload(), Bytes(space - padded(space / 2))).ok());
  EXPECT_THAT(allocated(), ElementsAre(2 * kStep)) << "the next length lies behind the first step";
  for (int i = 0; i < 5; ++i) ASSERT_TRUE(append(4, Payload(), Bytes(500000)).ok());
  EXPECT_EQ(allocated().front(), kSegmentBytes - kStep);
  EXPECT_EQ(allocated().at(1), kSegmentBytes);
  EXPECT_EQ(readKinds(), "2d 3d 4d 4d 4d 4d 4d");
}

TEST_F(JournalFilesTest, AFolderOfOthersIsRefused) {
  fs::create_directory(options.folder);
  chmod(options.folder.c_str(), 0755);
  EXPECT_FALSE(Journal::open(options).ok());
  fs::remove(options.folder);
  fs::create_directory_symlink(root, options.folder);
  EXPECT_FALSE(Journal::open(options).ok());
  options.folder = root + "/none/journal";
  EXPECT_EQ(Journal::open(options).status().code(), ENOENT);
}

TEST_F(JournalFilesTest, AWholeJournalIsMovedAside) {
  for (int i = 1; i <= 6; ++i) {
    leaveBehind(static_cast<uint8_t>(i));
    const auto moved = JournalFolder::moveAside(options.folder);
    ASSERT_TRUE(moved.ok()) << moved.status().text();
    EXPECT_EQ(*moved, options.folder + ".aside-" + std::to_string(i));
    EXPECT_EQ(JournalReader::read(*moved, kEpoch)->records.at(0).kind, i);
    EXPECT_FALSE(fs::exists(options.folder));
  }
  EXPECT_FALSE(fs::exists(options.folder + ".aside-2"));
  EXPECT_TRUE(fs::exists(options.folder + ".aside-3"));
  EXPECT_EQ(JournalFolder::moveAside(options.folder).status().code(), ENOENT);
}

TEST_F(JournalFilesTest, MovesToAnotherFileSystemAndIsReadThere) {
  std::string other = "/var/tmp/vxtest-XXXXXX";
  other = mkdtemp(other.data());
  leaveBehind(1);
  leaveBehind(2);
  const std::string twice = options.folder + "/segment-0000000000000001.vxj";
  fs::copy_file(twice, root + "/twice");
  std::ofstream(options.folder + "/aggregate-1.vxa") << std::string(700000, 'a');
  EXPECT_FALSE(
      JournalFolder::moveTo(options.folder, other, nullptr, 2 * kSegmentBytes + 700000 - 1).ok());
  EXPECT_THAT(JournalReader::read(other, options.epoch)->records, IsEmpty());
  ASSERT_TRUE(JournalFolder::moveTo(options.folder, other).ok());
  EXPECT_THAT(files(), IsEmpty());
  EXPECT_EQ(fs::file_size(other + "/aggregate-1.vxa"), 700000u);
  fs::remove(other + "/aggregate-1.vxa");
  EXPECT_THAT(JournalReader::read(other, kEpoch)->records, SizeIs(2));
  // The process ended between copying and removing: the next move leaves it at that.
  fs::copy_file(root + "/twice", twice);
  options.first = JournalReader::read(other, kEpoch)->next;
  leaveBehind(3);
  ASSERT_TRUE(JournalFolder::moveTo(options.folder, other).ok());
  options.folder = other;
  EXPECT_EQ(readKinds(), "1 2 3");
  EXPECT_THAT(files(), SizeIs(3));
  fs::remove_all(other);
  EXPECT_FALSE(JournalFolder::moveTo(root + "/none", other).ok());
}

TEST_F(JournalFilesTest, AFullFileSystemKeepsTheJournalWhereItIs) {
  const std::string small = root + "/small";
  fs::create_directory(small);
  if (mount("none", small.c_str(), "tmpfs", 0, "size=5m,mode=700") != 0) GTEST_SKIP() << "no root";
  for (uint8_t i = 1; i <= 3; ++i) leaveBehind(i);
  EXPECT_EQ(JournalFolder::moveTo(options.folder, small).code(), ENOSPC);
  EXPECT_EQ(readKinds(), "1 2 3");
  fs::remove_all(small + "/segment-0000000000000001.vxj");
  const std::string large = options.folder;
  options.folder = small + "/journal";
  fs::remove_all(small + "/segment-0000000000000002.vxj");
  open();
  int appended = 0;
  while (append(1, dictionary(1, 500000)).ok()) ++appended;
  EXPECT_EQ(appended, 8) << "two segments fit";
  EXPECT_EQ(read().records.size(), 8u);
  journal.reset();
  EXPECT_EQ(umount2(small.c_str(), MNT_DETACH), 0);
}

}  // namespace
}  // namespace vx::lnx
