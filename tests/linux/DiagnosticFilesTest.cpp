#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <csignal>
#include <iterator>

#include "platform/linux/diagnostics/LinuxDiagnosticFiles.h"
#include "tests/linux/FolderTest.h"

namespace vx::lnx {
namespace {

using DiagnosticFilesTest = FolderTest;

TEST_F(DiagnosticFilesTest, NothingPlantedIsEverOpened) {
  LinuxDiagnosticFiles files(folder + "/log");
  const std::string directory = folder + "/log/Audio/Reporting";
  const mode_t before = umask(077);
  EXPECT_EQ(files.createDirectory(directory, 0777), std::nullopt);
  umask(before);
  struct stat status {};
  ASSERT_EQ(stat(directory.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0777u);

  write("victim", "precious");
  ASSERT_EQ(symlink((folder + "/victim").c_str(), (directory + "/link.json").c_str()), 0);
  ASSERT_EQ(link((folder + "/victim").c_str(), (directory + "/hard.json").c_str()), 0);
  ASSERT_EQ(mkfifo((directory + "/fifo.json").c_str(), 0666), 0);
  for (const char* name : {"link.json", "hard.json", "fifo.json"}) {
    std::optional<Error> error;
    const auto file = files.createAtomically(directory, name, error);
    ASSERT_NE(file, nullptr);
    EXPECT_EQ(file->write("text"), std::nullopt);
    EXPECT_EQ(file->commit(), std::nullopt);
    EXPECT_EQ(read(std::string("log/Audio/Reporting/") + name), "text");
  }
  EXPECT_EQ(read("victim"), "precious");

  std::filesystem::create_directory(directory + "/folder.json");
  std::optional<Error> error;
  const auto file = files.createAtomically(directory, "folder.json", error);
  EXPECT_NE(file->commit(), std::nullopt);
  std::filesystem::remove_all(folder + "/log/Audio");
  ASSERT_EQ(symlink(folder.c_str(), (folder + "/log/Audio").c_str()), 0);
  EXPECT_NE(files.createDirectory(directory, 0777), std::nullopt);
  EXPECT_EQ(files.createAtomically(directory, "x", error), nullptr);
}

TEST_F(DiagnosticFilesTest, DiagnosticFilesAppearWholeOrNotAtAll) {
  LinuxDiagnosticFiles files(folder + "/log");
  const std::string directory = folder + "/log/Audio";
  const std::string target = directory + "/a.json";
  write("log/Audio/.vx.0123456789abcdef.tmp", "of a process that crashed");
  ASSERT_EQ(files.createDirectory(directory + "/", 0777), std::nullopt);
  auto names = [&] { return std::distance(std::filesystem::directory_iterator(directory), {}); };
  std::optional<Error> error;
  const mode_t before = umask(077);
  {
    const auto first = files.createAtomically(directory, "a.json", error);
    const auto second = files.createAtomically(directory, "a.json", error);
    ASSERT_EQ(first->write("first"), std::nullopt);
    EXPECT_FALSE(std::filesystem::exists(target));
    ASSERT_EQ(second->write("second"), std::nullopt);
    ASSERT_EQ(first->commit(), std::nullopt);
    ASSERT_EQ(second->commit(), std::nullopt);
  }
  umask(before);
  { const auto abandoned = files.createAtomically(directory, "b.json", error); }
  EXPECT_EQ(names(), 1);
  EXPECT_EQ(std::filesystem::file_size(target), 6u);  // the later one
  struct stat status {};
  ASSERT_EQ(stat(target.c_str(), &status), 0);
  EXPECT_EQ(status.st_mode & 07777, 0644u);
}

TEST_F(DiagnosticFilesTest, LargeDiagnosticFilesAreWrittenBesides) {
  LinuxDiagnosticFiles files(folder + "/log");
  ASSERT_EQ(files.createDirectory(folder + "/log/Audio", 0777), std::nullopt);
  std::optional<Error> error;
  std::string expected;
  const auto file = files.createAtomically(folder + "/log/Audio", "a.json", error);
  const auto abandoned = files.createAtomically(folder + "/log/Audio", "b.json", error);
  for (int i = 0; i < 500; ++i) {
    std::string piece(17000, static_cast<char>('a' + i % 26));
    expected += piece;
    (void)abandoned->write(piece);
    ASSERT_EQ(file->take(piece), std::nullopt);
    ASSERT_TRUE(piece.empty());
  }
  ASSERT_EQ(file->commit(), std::nullopt);
  EXPECT_TRUE(read("log/Audio/a.json") == expected);
}

// A disk that takes only so much: as many bytes as there are in all, and one less, where the last
// write is cut short and has no other after it.
struct Disk {
  std::size_t pieces;
  std::size_t pieceBytes;
  std::size_t tooFew;
};
class FullDiskTest : public FolderTest, public ::testing::WithParamInterface<Disk> {
 protected:
  std::optional<Error> writeWithin(std::size_t limit) {
    rlimit before{};
    getrlimit(RLIMIT_FSIZE, &before);
    const rlimit small{limit, before.rlim_max};
    signal(SIGXFSZ, SIG_IGN);
    setrlimit(RLIMIT_FSIZE, &small);
    std::optional<Error> error = files.createDirectory(folder + "/log", 0777);
    auto file = files.createAtomically(folder + "/log", "a.json", error);
    for (std::size_t i = 0; i < GetParam().pieces && !error; ++i)
      error = file->write(std::string(GetParam().pieceBytes, 'x'));
    if (!error) error = file->commit();
    file.reset();
    setrlimit(RLIMIT_FSIZE, &before);
    return error;
  }
  LinuxDiagnosticFiles files{folder + "/log"};
};

TEST_P(FullDiskTest, AFileThatIsCutShortIsNone) {
  const std::size_t all = GetParam().pieces * GetParam().pieceBytes;
  for (const std::size_t limit : {all - 1, all - GetParam().tooFew}) {
    const std::optional<Error> error = writeWithin(limit);
    ASSERT_TRUE(error) << limit;
    EXPECT_EQ(error->code, EFBIG);
    EXPECT_THAT(error->reason, HasSubstr("/log/a.json"));
    EXPECT_TRUE(std::filesystem::is_empty(folder + "/log"));
  }
  EXPECT_EQ(writeWithin(all), std::nullopt);
  EXPECT_EQ(std::filesystem::file_size(folder + "/log/a.json"), all);
}

INSTANTIATE_TEST_SUITE_P(Sizes, FullDiskTest,
                         ::testing::Values(Disk{1, 1500, 500}, Disk{2, 1024, 1024},
                                           Disk{5, 512 << 10, 8192},      // whole blocks
                                           Disk{3, 1000'000, 990'000}));  // and what is left

TEST_F(DiagnosticFilesTest, DiagnosticPathsStayBelowTheLogs) {
  LinuxDiagnosticFiles files(folder + "/log");
  std::optional<Error> error;
  ASSERT_EQ(files.createDirectory(folder + "/log/Audio", 0777), std::nullopt);
  for (const char* name : {"", ".", "..", "../x", "a/b"}) {
    EXPECT_EQ(files.createAtomically(folder + "/log/Audio", name, error), nullptr) << name;
  }
  for (const char* path : {"/log/../x", "/logs", "/log/Audio/../../x", "/elsewhere"}) {
    EXPECT_TRUE(files.createDirectory(folder + path, 0777)) << path;
  }
  EXPECT_FALSE(std::filesystem::exists(folder + "/x"));
  std::filesystem::create_symlink(folder, folder + "/log/Link");
  error = files.createDirectory(folder + "/log/Link/x", 0777);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, ELOOP);
  EXPECT_THAT(error->reason, HasSubstr("/log/Link"));
  EXPECT_FALSE(std::filesystem::exists(folder + "/x"));
  write("log/File", "");
  error = files.createDirectory(folder + "/log/File/x", 0777);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, ENOTDIR);
}

}  // namespace
}  // namespace vx::lnx
