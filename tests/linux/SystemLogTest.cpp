#include <fcntl.h>
#include <gmock/gmock.h>
#include <time.h>
#include <unistd.h>

#include <functional>
#include <set>
#include <string>
#include <thread>
#include <vector>

#include "platform/linux/diagnostics/SystemLog.h"

namespace vx::lnx {
namespace {

LogOptions toStderr(uint32_t burst, double refillPerSecond) {
  LogOptions options;
  options.destination = LogOptions::Destination::Stderr;
  options.burst = burst;
  options.refillPerSecond = refillPerSecond;
  return options;
}

// Puts a pipe in the place of stderr.
class StderrPipe {
 public:
  StderrPipe() : saved_(dup(STDERR_FILENO)) {
    EXPECT_EQ(pipe2(ends_, O_CLOEXEC), 0);
    EXPECT_EQ(fcntl(ends_[1], F_SETPIPE_SZ, 8192), 8192);  // two pages
    fcntl(ends_[0], F_SETFL, O_NONBLOCK);
    dup2(ends_[1], STDERR_FILENO);
  }
  ~StderrPipe() {
    dup2(saved_, STDERR_FILENO);
    for (const int fd : {saved_, ends_[0], ends_[1]}) close(fd);
  }
  std::string drain() {
    std::string text;
    char buffer[4096];
    for (ssize_t got; (got = read(ends_[0], buffer, sizeof buffer)) > 0;)
      text.append(buffer, static_cast<std::size_t>(got));
    return text;
  }

 private:
  int saved_;
  int ends_[2] = {-1, -1};
};

TEST(SystemLogOnStderr, ClientsTextCannotForgeALine) {
  SystemLog log;
  const LogSite site{"F.cpp", 1, "f", 0};
  StderrPipe pipe;
  log.write(nullptr, LogLevel::Default, site, "a\n<0>b\x1B[m\tc\xC3\xA9", 0);
  EXPECT_EQ(pipe.drain(), "<5>default: a\\n<0>b\\x1B[m\\tc\xC3\xA9\n");
}

TEST(SystemLogOnStderr, AReaderThatStoppedCostsLinesAndNoTime) {
  SystemLog log;
  const LogSite site{"F.cpp", 1, "f", 0};
  StderrPipe pipe;
  log.write(nullptr, LogLevel::Info, site, std::string(12000, 'x'), 0);  // more than the pipe holds
  EXPECT_EQ(log.droppedLines(), 1u);
  log.write(nullptr, LogLevel::Info, site, "dropped", 0);
  EXPECT_EQ(log.droppedLines(), 2u);
  EXPECT_EQ(pipe.drain(), "<6>default: " + std::string(8192 - 12, 'x'));
  log.write(nullptr, LogLevel::Info, site, "next", 0);
  EXPECT_EQ(pipe.drain(), "\n<6>default: next\n");  // a line of its own
  EXPECT_EQ(log.droppedLines(), 2u);
}

TEST(SystemLogOnStderr, LongLinesAreCutBetweenCharacters) {
  SystemLog log;
  const LogSite site{"F.cpp", 1, "f", 0};
  const std::string kept((16 << 10) - 1, 'x');
  testing::internal::CaptureStderr();
  log.write(nullptr, LogLevel::Error, site,
            kept +
                "\xC3\xA9"
                "tail",
            0);
  EXPECT_EQ(testing::internal::GetCapturedStderr(), "<3>default: " + kept + "\xE2\x80\xA6\n");
}

TEST(SystemLogLimits, LinesOfOneStatementAreLimitedAndCounted) {
  SystemLog log;
  LogOptions options;
  options.destination = LogOptions::Destination::Stderr;
  options.burst = 3;
  options.refillPerSecond = 0.001;
  log.configure(options);
  const LogSite site{"File.cpp", 7, "f", 0};
  int wanted = 0;
  for (int i = 0; i < 10; ++i) wanted += log.wantsLine(nullptr, LogLevel::Default, site) ? 1 : 0;
  EXPECT_EQ(wanted, 3);
  const LogSite other{"File.cpp", 8, "f", 0};
  EXPECT_TRUE(log.wantsLine(nullptr, LogLevel::Error, other));
  EXPECT_FALSE(log.wantsLine(nullptr, LogLevel::Info, other));
  ::testing::internal::CaptureStderr();
  log.write(nullptr, LogLevel::Error, site, "File.cpp:7:f: text", 13);
  EXPECT_EQ(::testing::internal::GetCapturedStderr(),
            "<3>default: File.cpp:7:f: text (7 lines like this were left out)\n");
}

// The bucket of a statement that wrote its last line some time ago.
TEST(SystemLogLimits, AnAllowanceComesBackAsSlowlyAsConfigured) {
  SystemLog log;
  log.configure(toStderr(6, 0.01));  // a line in 100 seconds
  const auto wantedAfter = [&](std::chrono::seconds ago) {
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    const auto then = static_cast<uint32_t>((now.tv_sec - ago.count()) * 1000);
    const LogSite site{"F.cpp", 1, "f", uint64_t{1} << 32 | then};
    int wanted = 0;
    for (int i = 0; i < 20; ++i) wanted += log.wantsLine(nullptr, LogLevel::Error, site) ? 1 : 0;
    return wanted;
  };
  EXPECT_EQ(wantedAfter(std::chrono::seconds(450)), 4);
  EXPECT_EQ(wantedAfter(std::chrono::seconds(50)), 0);
  EXPECT_EQ(wantedAfter(std::chrono::seconds(-20)), 0);  // another thread's clock was ahead
  EXPECT_EQ(wantedAfter(std::chrono::hours(10)), 6);     // no more than the burst
  log.configure(toStderr(100'000, 0.01));                // more than there are bits for
  EXPECT_EQ(wantedAfter(std::chrono::seconds(450)), 4);
  const LogSite fresh{"F.cpp", 1, "f", 0};
  EXPECT_TRUE(log.wantsLine(nullptr, LogLevel::Error, fresh));
}

TEST(SystemLogLimits, ThreadsShareOneStatementsAllowance) {
  SystemLog log;
  log.configure(toStderr(50, 0.001));
  const LogSite site{"F.cpp", 1, "f", 0};
  std::atomic<int> wanted{0};
  std::vector<std::thread> threads;
  for (int i = 0; i < 4; ++i) {
    threads.emplace_back([&] {
      for (int n = 0; n < 300'000; ++n)
        wanted += log.wantsLine(nullptr, LogLevel::Error, site) ? 1 : 0;
    });
  }
  for (std::thread& thread : threads) thread.join();
  EXPECT_EQ(wanted.load(), 50);
}

// Preferences in which every key is whether it is one of `on`.
class KeyedPreferences final : public Preferences {
 public:
  class Domain final : public PreferencesDomain {
   public:
    explicit Domain(std::set<std::string, std::less<>> on) : on_(std::move(on)) {}
    bool hasObject(std::string_view) const override { return true; }
    std::optional<std::string> string(std::string_view) const override { return std::nullopt; }
    bool boolean(std::string_view key) const override { return on_.contains(key); }

   private:
    const std::set<std::string, std::less<>> on_;
  };
  std::unique_ptr<PreferencesDomain> open(std::string_view domain) override {
    opened.emplace_back(domain);
    if (auto hook = std::exchange(onOpen, nullptr)) hook();
    return std::make_unique<Domain>(on);
  }
  std::set<std::string, std::less<>> on;
  std::vector<std::string> opened;
  std::function<void()> onOpen;
};

TEST(SystemLogScopes, PreferencesMayLogAndRegisterWhileTheyAreRead) {
  SystemLog log;
  KeyedPreferences preferences;
  log.setPreferences(preferences);
  const LogScope* inner = nullptr;
  preferences.on = {"outer"};
  preferences.onOpen = [&] { inner = log.registerScope(true, 1, "in", "d", "inner", 31); };
  const LogScope* outer = log.registerScope(true, 1, "out", "d", "outer", 31);
  ASSERT_NE(inner, nullptr);
  EXPECT_TRUE(log.isLogEnabled(5, outer));
  EXPECT_FALSE(log.isLogEnabled(5, inner));
  EXPECT_FALSE(log.isLogEnabled(5, nullptr));
  EXPECT_TRUE(log.isLogEnabled(4, nullptr));
  EXPECT_EQ(log.registerScope(false, 1, "off", "d", "k", 31), nullptr);
}

TEST(SystemLogScopes, ARefreshOpensEachDomainOnceForAllItsScopes) {
  SystemLog log;
  KeyedPreferences preferences;
  log.refreshVerbose();  // without any
  log.setPreferences(preferences);
  const LogScope* a = log.registerScope(true, 1, "a", "d", "ka", 31);
  const LogScope* b = log.registerScope(true, 1, "b", "d", "kb", 31);
  const LogScope* c = log.registerScope(true, 1, "c", "other", "ka", 31);
  preferences.opened.clear();
  preferences.on = {"ka"};
  log.refreshVerbose();
  EXPECT_EQ(preferences.opened, (std::vector<std::string>{"d", "other"}));
  EXPECT_TRUE(log.isLogEnabled(5, a));
  EXPECT_FALSE(log.isLogEnabled(5, b));
  EXPECT_TRUE(log.isLogEnabled(5, c));
  log.configure(toStderr(0, 0));
  const LogSite site{"F.cpp", 1, "f", 0};
  EXPECT_TRUE(log.wantsLine(a, LogLevel::Debug, site));
  EXPECT_FALSE(log.wantsLine(b, LogLevel::Debug, site));
  EXPECT_FALSE(log.wantsLine(a, LogLevel::Info, site));
  preferences.on = {};
  log.refreshVerbose();
  EXPECT_FALSE(log.isLogEnabled(5, a));
}

}  // namespace
}  // namespace vx::lnx
