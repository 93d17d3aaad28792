#include <fcntl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <time.h>
#include <unistd.h>

#include "platform/linux/diagnostics/SystemLog.h"
#include "tests/linux/FolderTest.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;

class SystemLogTest : public ::testing::Test {
 protected:
  // Puts a pipe in the place of stderr.
  SystemLogTest() {
    EXPECT_EQ(pipe2(ends_, O_CLOEXEC), 0);
    EXPECT_EQ(fcntl(ends_[1], F_SETPIPE_SZ, kPipe), kPipe);
    fcntl(ends_[0], F_SETFL, O_NONBLOCK);
    dup2(ends_[1], STDERR_FILENO);
  }
  ~SystemLogTest() override {
    dup2(saved_, STDERR_FILENO);
    for (const int fd : {saved_, ends_[0], ends_[1]}) close(fd);
  }
  std::string drain() {
    std::string text(kPipe, '\0');
    const ssize_t got = read(ends_[0], text.data(), text.size());
    return text.substr(0, static_cast<std::size_t>(std::max<ssize_t>(got, 0)));
  }
  void limit(uint32_t burst, double refillPerSecond) {
    LogOptions options;
    options.destination = LogOptions::Destination::Stderr;
    options.burst = burst;
    options.refillPerSecond = refillPerSecond;
    log.configure(options);
  }
  int wanted(const LogSite& at, int lines) {
    int taken = 0;
    for (int i = 0; i < lines; ++i) taken += log.wantsLine(nullptr, LogLevel::Error, at) ? 1 : 0;
    return taken;
  }
  static constexpr int kPipe = 32 << 10;
  SystemLog log;
  const LogSite site{"F.cpp", 7, "f", 0};
  fakes::Journal journal;
  fakes::FakeServices services{journal};

 private:
  int saved_ = dup(STDERR_FILENO);
  int ends_[2] = {-1, -1};
};

TEST_F(SystemLogTest, ClientsCannotForgeALineAndAReaderThatStoppedCostsLinesAndNoTime) {
  log.write(nullptr, LogLevel::Default, site, "a\n<0>b\x1B[m\tc\xC3\xA9", 0);
  EXPECT_EQ(drain(), "<5>default: a\\n<0>b\\x1B[m\\tc\xC3\xA9\n");
  const std::string kept((16 << 10) - 1, 'x');
  log.write(nullptr, LogLevel::Error, site, kept + "\xC3\xA9" + "tail", 0);
  EXPECT_EQ(drain(), "<3>default: " + kept + "\xE2\x80\xA6\n");
  const std::string text(12288 - 13, 'x');  // a line of whole pages
  for (int i = 0; i < 3; ++i) log.write(nullptr, LogLevel::Info, site, text, 0);
  EXPECT_EQ(log.droppedLines(), 1u);
  log.write(nullptr, LogLevel::Info, site, "dropped", 0);
  EXPECT_EQ(log.droppedLines(), 2u);
  const std::string line = "<6>default: " + text + "\n";
  EXPECT_EQ(drain(), (line + line + line).substr(0, kPipe));
  log.write(nullptr, LogLevel::Info, site, "next", 0);
  EXPECT_EQ(drain(), "\n<6>default: next\n");  // a line of its own
  EXPECT_EQ(log.droppedLines(), 2u);
}

TEST_F(SystemLogTest, TheJournalGetsFieldsAndOneThatHangsCostsLinesAndNoTime) {
  Folder folder;
  sockaddr_un address{.sun_family = AF_UNIX, .sun_path = {}};
  const std::string path = folder.folder + "/journal";
  path.copy(address.sun_path, path.size());
  const UniqueFd journald(socket(AF_UNIX, SOCK_DGRAM, 0));
  ASSERT_EQ(bind(journald.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
  log.configure({.destination = LogOptions::Destination::Auto, .journalSocket = path});
  std::string text(1000, '\0');
  const auto receive = [&] {
    return text.substr(0, recv(journald.get(), text.data(), text.size(), MSG_DONTWAIT));
  };
  log.write(nullptr, LogLevel::Error, site, "a", 0);
  EXPECT_EQ(receive(),
            "MESSAGE=a\nPRIORITY=3\nSYSLOG_IDENTIFIER=vxreporting\nVX_SCOPE=default\n"
            "CODE_FILE=F.cpp\nCODE_LINE=7\nCODE_FUNC=f\n");
  log.write(nullptr, LogLevel::Error, site, "a\nb", 0);
  EXPECT_THAT(receive(),
              testing::StartsWith(std::string("MESSAGE\n\3\0\0\0\0\0\0\0a\nb\nPRI", 23)));
  EXPECT_EQ(log.droppedLines(), 0u);
  alarm(30);  // what waits here waits for ever
  for (int i = 0; i < 2000; ++i) log.write(nullptr, LogLevel::Error, site, "hung", 0);
  alarm(0);
  EXPECT_GT(log.droppedLines(), 1000u);
}

TEST_F(SystemLogTest, LinesOfOneStatementAreLimitedCountedAndAllowedAgainAsSlowlyAsConfigured) {
  limit(3, 0.001);
  EXPECT_EQ(wanted(site, 10), 3);
  const LogSite other{"F.cpp", 8, "f", 0};
  EXPECT_EQ(wanted(other, 1), 1);
  EXPECT_FALSE(log.wantsLine(nullptr, LogLevel::Info, other));
  log.write(nullptr, LogLevel::Error, site, "F.cpp:7:f: text", 10);
  EXPECT_EQ(drain(), "<3>default: F.cpp:7:f: text (7 lines like this were left out)\n");
  log.write(nullptr, LogLevel::Error, site, "again", 0);
  EXPECT_EQ(drain(), "<3>default: again\n");
  // The bucket of a statement that wrote its last line some time ago.
  const auto wantedAfter = [&](std::chrono::seconds ago) {
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    const auto then = static_cast<uint32_t>((now.tv_sec - ago.count()) * 1000);
    return wanted({"F.cpp", 1, "f", uint64_t{1} << 32 | then}, 20);
  };
  limit(6, 0.01);  // a line in 100 seconds
  EXPECT_EQ(wantedAfter(450s), 4);
  EXPECT_EQ(wantedAfter(50s), 0);
  EXPECT_EQ(wantedAfter(-20s), 0);  // another thread's clock was ahead
  EXPECT_EQ(wantedAfter(10h), 6);   // no more than the burst
  limit(1 << 16, 0.01);             // one more than there are bits for
  EXPECT_EQ(wanted({"F.cpp", 9, "f", 0}, 20), 20);
}

TEST_F(SystemLogTest, ScopesAreAsVerboseAsTheirKeys) {
  log.refreshVerbose();  // without any
  log.setPreferences(services);
  services.preferences = {{"ka", "true"}};
  const LogScope* a = log.registerScope(true, 1, "a", "d", "ka", 31);
  const LogScope* b = log.registerScope(true, 1, "b", "d", "kb", 31);
  EXPECT_TRUE(log.isLogEnabled(5, a));
  EXPECT_FALSE(log.isLogEnabled(5, b));
  EXPECT_FALSE(log.isLogEnabled(5, nullptr));
  EXPECT_TRUE(log.isLogEnabled(4, nullptr));
  log.configure({.level = LogOptions::Level::Debug});
  EXPECT_TRUE(log.isLogEnabled(5, nullptr)) << "the default scope has no key";
  EXPECT_FALSE(log.isLogEnabled(5, b));
  EXPECT_EQ(log.registerScope(false, 1, "off", "d", "k", 31), nullptr);
  services.preferences = {{"kb", "true"}};
  log.refreshVerbose();
  EXPECT_FALSE(log.isLogEnabled(5, a));
  EXPECT_TRUE(log.isLogEnabled(5, b));
}

}  // namespace
}  // namespace vx::lnx
