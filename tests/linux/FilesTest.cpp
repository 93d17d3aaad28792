#include <gmock/gmock.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <string>

#include "platform/linux/CounterChannels.h"
#include "platform/linux/LinuxDiagnosticFiles.h"
#include "platform/linux/PlatformConfiguration.h"
#include "platform/linux/PreferencesWatcher.h"
#include "platform/linux/SystemLog.h"
#include "platform/linux/SystemThreading.h"
#include "platform/linux/TomlPreferences.h"
#include "tests/fakes/FakePlatform.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;
using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;

class FilesTest : public ::testing::Test {
 protected:
  FilesTest() {
    std::string pattern = "/tmp/vxfiles-XXXXXX";
    folder = mkdtemp(pattern.data());
  }
  ~FilesTest() override { std::filesystem::remove_all(folder); }
  void write(const std::string& name, const std::string& text) {
    std::filesystem::create_directories(std::filesystem::path(folder + "/" + name).parent_path());
    std::ofstream(folder + "/" + name) << text;
  }
  std::string read(const std::string& name) {
    std::stringstream text;
    text << std::ifstream(folder + "/" + name).rdbuf();
    return text.str();
  }
  fakes::FakePlatform p;
  std::string folder;
};

TEST_F(FilesTest, ConfigurationNamesFileLineAndKeyAndKeepsDefaults) {
  write("platform.toml",
        "[device]\ninternal_build = 1\ndevice_class_number = 6\n[store]\nmax_bytes = "
        "\"64MiB\"\nqueue_bytes = -1\n"
        "[log]\nlevel = \"loud\"\nburst = 5\n[typo]\n[[drivers.mapped]]\ngroup = \"G\"\npath = "
        "\"/p\"\n");
  std::vector<std::string> complaints;
  const auto c = PlatformConfiguration::load({"", "", folder, ""}, complaints);
  const std::string file = folder + "/platform.toml:";
  EXPECT_THAT(complaints, ElementsAre(file + "2: device.internal_build: must be true or false",
                                      HasSubstr(file + "8: log.level: must be one of"),
                                      HasSubstr(file + "6: store.queue_bytes: must be"),
                                      file + "10: typo: unknown key"));
  EXPECT_FALSE(c.device.internalBuild);
  EXPECT_EQ(c.device.deviceClassNumber, 6);
  EXPECT_EQ(c.store.maxBytes, 64u << 20);
  EXPECT_EQ(c.log.burst, 5u);
  ASSERT_EQ(c.drivers.mapped.size(), 1u);
  write("platform.toml", "a = = 1\n");
  complaints.clear();
  PlatformConfiguration::load({"", "", folder, ""}, complaints);
  EXPECT_THAT(complaints, ElementsAre(HasSubstr(file + "1:5: ")));
}

TEST_F(FilesTest, CountersAreReadStrictly) {
  auto parsed = [](std::string_view text) {
    int64_t value = 0;
    const int code = parseCounter(text, value);
    return code != 0 ? std::to_string(code) : "=" + std::to_string(value);
  };
  EXPECT_EQ(parsed("17\n"), "=17");
  EXPECT_EQ(parsed("-3"), "=-3");
  EXPECT_EQ(parsed("0x1F"), "=31");
  EXPECT_EQ(parsed("9223372036854775807"), "=9223372036854775807");
  EXPECT_EQ(parsed("9223372036854775808"), std::to_string(ERANGE));
  for (const char* bad : {"", "\n", "x", "1 2", "1\n\n", "0x", "0x-1", "+-1", "1.5"}) {
    EXPECT_EQ(parsed(bad), std::to_string(EINVAL)) << bad;
  }
}

TEST_F(FilesTest, ChannelsOfTreesAndMappedSources) {
  write("drivers/Speaker/a", "1");
  write("drivers/Speaker/Left/b", "2");
  write("drivers/Other/MCA/c", "3");
  write("asound/card0/pcm0p/sub0/status",
        "state: RUNNING\nowner_pid   : 1\nhw_ptr      : 4096\nappl_ptr    : 5000\n");
  write("asound/card0/pcm0c/sub0/status", "closed\n");
  std::filesystem::create_directories(folder + "/drivers/Empty");
  PlatformConfiguration::Drivers options;
  options.root = folder + "/drivers";
  options.mapped = {
      {"Lo", "Net", MappedChannelSource::Kind::Statistics, "/sys/class/net/lo/statistics"},
      {"Alsa", "", MappedChannelSource::Kind::AlsaProc, folder + "/asound"}};
  CounterChannels channels(options);
  auto sampled = [&](std::optional<std::string> group, std::optional<std::string> subGroup) {
    std::optional<Error> error;
    ChannelDictionaryRef subscribed;
    const auto set = channels.copyChannelsInGroup(group, subGroup, 0, error);
    if (set == nullptr) return std::string(error ? "error" : "none");
    const auto samples =
        channels.createSamples(channels.createSubscription(set, subscribed), subscribed, error);
    if (samples == nullptr) return "code " + std::to_string(error->code);
    std::string text;
    channels.iterateSamples(*samples, [&](const ChannelSample& sample) {
      text += std::string(*channels.channelName(sample)) + "=" +
              std::to_string(channels.simpleIntegerValue(sample, 0)) + " ";
      return 0;
    });
    return text;
  };
  EXPECT_EQ(sampled("Speaker", std::nullopt), "b=2 a=1 ");
  EXPECT_EQ(sampled(std::nullopt, "MCA"), "c=3 ");
  EXPECT_EQ(sampled("Absent", std::nullopt), "none");
  EXPECT_EQ(sampled("Empty", std::nullopt), "");
  EXPECT_EQ(sampled("Alsa", std::nullopt),
            "card0_pcm0p_sub0_appl_ptr=5000 card0_pcm0p_sub0_hw_ptr=4096 ");
  EXPECT_THAT(sampled("Lo", "Net"), HasSubstr("rx_bytes="));
  write("drivers/Speaker/a", "many");
  EXPECT_EQ(sampled("Speaker", std::nullopt), "code " + std::to_string(EINVAL));
}

TEST_F(FilesTest, NothingPlantedIsEverOpened) {
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

TEST_F(FilesTest, PreferencesKeepTheLastGoodValuesAndComplainOnce) {
  TomlPreferences preferences(folder);
  EXPECT_FALSE(preferences.open("d")->hasObject("k"));
  write("d.toml", "k = \"yes\"\nn = 3\nt = { a = 1 }\n");
  EXPECT_TRUE(preferences.open("d")->boolean("k"));
  EXPECT_EQ(preferences.open("d")->string("n"), "3");
  EXPECT_EQ(preferences.open("d")->string("t"), std::nullopt);
  write("d.toml", "ok = 1\nk = \n");
  EXPECT_TRUE(preferences.open("d")->boolean("k"));
  EXPECT_TRUE(preferences.open("d")->boolean("k"));
  ASSERT_EQ(p.log.lines.size(), 1u);
  EXPECT_THAT(p.log.lines[0], HasSubstr("d.toml:2:"));
  for (const char* kind : {"directory", "fifo", "loop", "large"}) {
    std::filesystem::remove_all(folder + "/d.toml");
    const std::string path = folder + "/d.toml";
    if (kind[0] == 'd')
      std::filesystem::create_directory(path);
    else if (kind[0] == 'f')
      mkfifo(path.c_str(), 0666);
    else if (kind[1] == 'o')
      std::filesystem::create_symlink(path, path);
    else
      write("d.toml", std::string(10 << 20, '#'));
    EXPECT_TRUE(preferences.open("d")->boolean("k")) << kind;
  }
  std::filesystem::remove(folder + "/d.toml");
  EXPECT_FALSE(preferences.open("d")->hasObject("k"));
}

TEST_F(FilesTest, WatcherSettlesBeforeItFires) {
  fakes::FakeClock clock;
  PlatformConfiguration::Preferences options;
  PreferencesWatcher watcher(folder + "/preferences", folder + "/notify", {{"name", "d.toml"}},
                             options, clock);
  watcher.start();
  int fired = 0;
  int token = 0;
  EXPECT_EQ(
      watcher.registerHandler("name", token, p.queues.makeSerial("q", QualityOfService::Utility),
                              [&](int told) { fired += told == token ? 1 : 100; }),
      0u);
  auto pass = [&](std::chrono::milliseconds time) {
    watcher.onReadable();
    clock.advance(time);
    if (watcher.nextDue() && *watcher.nextDue() <= clock.monotonic()) watcher.onDue();
    p.queues.runAll();
  };
  EXPECT_FALSE(watcher.nextDue());
  write("preferences/d.toml", "a = 1\n");  // with its folder
  pass(99ms);
  EXPECT_EQ(fired, 0);
  pass(1ms);
  EXPECT_EQ(fired, 1);
  for (int i = 0; i < 200; ++i) {
    write("preferences/d.toml", "a = " + std::to_string(i) + "\n");
    if (i % 10 == 0) pass(1ms);
  }
  EXPECT_EQ(fired, 1);
  pass(100ms);
  EXPECT_EQ(fired, 2);
  for (int i = 0; i < 30; ++i) {  // never left alone: told all the same, now and then
    write("preferences/d.toml", "b = 1\n");
    pass(90ms);
  }
  EXPECT_EQ(fired, 3);
  pass(100ms);
  write("preferences/other.toml", "x = 1\n");
  pass(1s);
  const int before = fired;
  std::filesystem::remove_all(folder + "/preferences");
  pass(100ms);
  EXPECT_EQ(fired, before + 1);
  write("preferences/d.toml", "a = 1\n");
  pass(100ms);
  EXPECT_EQ(fired, before + 2);
  write("notify/unheard", "");
  write("notify/name", "");
  watcher.onReadable();
  p.queues.runAll();
  EXPECT_GT(fired, before + 2);
}

TEST_F(FilesTest, WatcherPollsWhereInotifyCannotBeHad) {
  fakes::FakeClock clock;
  PlatformConfiguration::Preferences options;
  PreferencesWatcher watcher(folder + "/preferences", folder + "/notify", {{"name", "d.toml"}},
                             options, clock);
  rlimit before{};
  getrlimit(RLIMIT_NOFILE, &before);
  const rlimit none{0, before.rlim_max};
  setrlimit(RLIMIT_NOFILE, &none);
  watcher.start();
  setrlimit(RLIMIT_NOFILE, &before);
  EXPECT_THAT(p.log.lines, ElementsAre(HasSubstr("looking every 3000 ms instead")));
  EXPECT_EQ(watcher.fd(), -1);
  int fired = 0;
  int token = 0;
  watcher.registerHandler("name", token, p.queues.makeSerial("q", QualityOfService::Utility),
                          [&](int) { ++fired; });
  auto pass = [&] {
    for (int i = 0; i < 4; ++i) {  // a look, and the settling time behind it
      clock.advance(1s);
      if (*watcher.nextDue() <= clock.monotonic()) watcher.onDue();
    }
    p.queues.runAll();
    return fired;
  };
  EXPECT_EQ(pass(), 0);
  write("preferences/d.toml", "a = 1\n");
  EXPECT_EQ(pass(), 1);
  EXPECT_EQ(pass(), 1);
  std::filesystem::remove(folder + "/preferences/d.toml");
  EXPECT_EQ(pass(), 2);
}

TEST(SystemLogTest, LinesOfOneStatementAreLimitedAndCounted) {
  SystemLog log;
  PlatformConfiguration::Log options;
  options.destination = PlatformConfiguration::Log::Destination::Stderr;
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

TEST(SystemLogTest, VerboseFollowsTheScopesPreference) {
  SystemLog log;
  bool on = false;
  log.setVerboseReader([&](std::string_view, std::string_view key) { return on && key == "k"; });
  const LogScope* scope = log.registerScope(true, 1, "s", "d", "k", 31);
  const LogScope* other = log.registerScope(true, 1, "t", "d", "l", 31);
  EXPECT_FALSE(log.isLogEnabled(5, scope));
  on = true;
  log.refreshVerbose();
  EXPECT_TRUE(log.isLogEnabled(5, scope));
  EXPECT_FALSE(log.isLogEnabled(5, other));
  const LogSite site{"File.cpp", 7, "f", 0};
  EXPECT_TRUE(log.wantsLine(scope, LogLevel::Debug, site));
  EXPECT_FALSE(log.wantsLine(other, LogLevel::Debug, site));
}

}  // namespace
}  // namespace vx::lnx
