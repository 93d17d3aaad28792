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

class DiagnosticFilesTest : public FolderTest {
 protected:
  DiagnosticFilesTest() {
    const mode_t before = umask(077);
    EXPECT_EQ(files.createDirectory(directory + "/", 0777), std::nullopt);
    umask(before);
  }
  std::unique_ptr<AtomicFile> create(const std::string& name) {
    return files.createAtomically(directory, name, error);
  }
  mode_t modeOf(const std::string& path) {
    struct stat status {};
    EXPECT_EQ(stat(path.c_str(), &status), 0);
    return status.st_mode & 07777;
  }
  const std::string directory = folder + "/log/Audio";
  LinuxDiagnosticFiles files{folder + "/log"};
  std::optional<Error> error;
};

TEST_F(DiagnosticFilesTest, NothingPlantedIsEverOpenedNorAnythingBesideTheLogs) {
  EXPECT_EQ(modeOf(directory), 01777u);
  for (const char* name : {"", ".", "..", "../x", "a/b"}) EXPECT_EQ(create(name), nullptr) << name;
  for (const char* path : {"/log/../x", "/logs", "/log/Audio/../../x", "/elsewhere"})
    EXPECT_TRUE(files.createDirectory(folder + path, 0777)) << path;
  write("victim", "precious");
  ASSERT_EQ(symlink((folder + "/victim").c_str(), (directory + "/link").c_str()), 0);
  ASSERT_EQ(link((folder + "/victim").c_str(), (directory + "/hard").c_str()), 0);
  ASSERT_EQ(mkfifo((directory + "/fifo").c_str(), 0666), 0);
  for (const std::string name : {"link", "hard", "fifo"}) {
    const auto file = create(name);
    EXPECT_EQ(file->write("text"), std::nullopt);
    EXPECT_EQ(file->commit(), std::nullopt);
    EXPECT_EQ(read("log/Audio/" + name), "text");
  }
  EXPECT_EQ(read("victim"), "precious");
  std::filesystem::remove_all(directory);
  ASSERT_EQ(symlink(folder.c_str(), directory.c_str()), 0);
  EXPECT_EQ(create("x"), nullptr);
  const auto refused = files.createDirectory(directory + "/x", 0777);
  ASSERT_TRUE(refused);
  EXPECT_EQ(refused->code, ELOOP);
  EXPECT_THAT(refused->reason, HasSubstr("/log/Audio"));
  EXPECT_FALSE(std::filesystem::exists(folder + "/x"));
}

TEST_F(DiagnosticFilesTest, FilesAppearWholeOrNotAtAll) {
  write("log/Audio/.vx.0123456789abcdef.tmp", "of a process that crashed");
  write("log/Audio/.mine.tmp", "of somebody else");
  ASSERT_EQ(files.createDirectory(directory, 0777), std::nullopt);
  const mode_t before = umask(077);
  std::string expected;
  {
    const auto first = create("a");
    const auto second = create("a");
    const auto abandoned = create("b");
    ASSERT_EQ(first->write("first"), std::nullopt);
    for (int i = 0; i < 500; ++i) {  // more than there is before it is written besides
      std::string piece(17000, static_cast<char>('a' + i % 26));
      expected += piece;
      (void)abandoned->write(piece);
      ASSERT_EQ(second->take(piece), std::nullopt);
      ASSERT_TRUE(piece.empty());
    }
    EXPECT_FALSE(std::filesystem::exists(directory + "/a"));
    ASSERT_EQ(files.createDirectory(directory, 0777), std::nullopt);  // of another session
    ASSERT_EQ(first->commit(), std::nullopt);
    ASSERT_EQ(second->commit(), std::nullopt);
  }
  umask(before);
  EXPECT_EQ(std::distance(std::filesystem::directory_iterator(directory), {}), 2);
  EXPECT_TRUE(read("log/Audio/a") == expected);  // the later one
  EXPECT_EQ(modeOf(directory + "/a"), 0644u);
}

// A disk that takes only so much: as many bytes as there are in all, and less, where the last write
// is cut short and has no other after it.
TEST_F(DiagnosticFilesTest, AFileThatIsCutShortIsNone) {
  signal(SIGXFSZ, SIG_IGN);
  rlimit before{};
  getrlimit(RLIMIT_FSIZE, &before);
  // Small ones, whole blocks, and what is left of some.
  for (const auto& [pieces, bytes, tooFew] :
       {std::tuple(1, 1500, 500), {2, 1024, 1024}, {5, 512 << 10, 8192}, {3, 1000'000, 990'000}}) {
    const int all = pieces * bytes;
    for (const int limit : {all - 1, all - tooFew, all}) {
      const rlimit small{static_cast<rlim_t>(limit), before.rlim_max};
      setrlimit(RLIMIT_FSIZE, &small);
      error.reset();
      {
        const auto file = create("a");
        for (int i = 0; i < pieces && !error; ++i) error = file->write(std::string(bytes, 'x'));
        if (!error) error = file->commit();
      }
      setrlimit(RLIMIT_FSIZE, &before);
      ASSERT_EQ(error ? error->code : 0, limit < all ? EFBIG : 0) << limit;
      EXPECT_EQ(std::filesystem::is_empty(directory), limit < all);
    }
    EXPECT_EQ(std::filesystem::file_size(directory + "/a"), all);
    std::filesystem::remove(directory + "/a");
  }
}

}  // namespace
}  // namespace vx::lnx
