#include <gmock/gmock.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cerrno>
#include <climits>
#include <csignal>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <map>
#include <sstream>
#include <string>

#include "platform/linux/CounterChannels.h"
#include "platform/linux/LinuxDiagnosticFiles.h"
#include "platform/linux/PlatformConfiguration.h"
#include "platform/linux/SystemServices.h"
#include "platform/linux/TomlPreferences.h"
#include "tests/fakes/FakePlatform.h"

namespace vx::lnx {
namespace {

using ::testing::ElementsAre;
using ::testing::HasSubstr;
using ::testing::IsEmpty;
using ::testing::Pair;
using Counters = std::multimap<std::string, int64_t>;
using Name = std::optional<std::string>;

class ServicesTest : public ::testing::Test {
 protected:
  ServicesTest() {
    std::string pattern = "/tmp/vxservices-XXXXXX";
    folder = mkdtemp(pattern.data());
    drivers.root = folder + "/drivers";
  }
  ~ServicesTest() override { std::filesystem::remove_all(folder); }

  void write(const std::string& name, const std::string& text) {
    std::filesystem::create_directories(std::filesystem::path(folder + "/" + name).parent_path());
    std::ofstream(folder + "/" + name) << text;
  }
  std::vector<std::string> complaintsOf(const std::string& text) {
    write("platform.toml", text);
    std::vector<std::string> complaints;
    configuration = PlatformConfiguration::load({"", "", folder, ""}, complaints);
    return complaints;
  }

  fakes::FakePlatform platform;
  std::string folder;
  PlatformConfiguration configuration;
  PlatformConfiguration::Drivers drivers;
};

TEST_F(ServicesTest, DirectoriesTakeTheFirstOfAListAndFallBack) {
  setenv("RUNTIME_DIRECTORY", "/run/a/:/run/b", 1);
  setenv("STATE_DIRECTORY", "", 1);
  setenv("CONFIGURATION_DIRECTORY", ":/etc/b", 1);
  unsetenv("LOGS_DIRECTORY");
  const Directories directories = Directories::fromEnvironment();
  EXPECT_EQ(directories.runtime, "/run/a");
  EXPECT_EQ(directories.state, "/var/lib/vxreporting");
  EXPECT_EQ(directories.configuration, "/etc/vxreporting");
  EXPECT_EQ(directories.logs, "/var/log/vxreporting");
}

TEST_F(ServicesTest, ConfigurationRangesEndWhereTheySay) {
  EXPECT_THAT(complaintsOf("[log]\nburst = 65535\nrefill_per_second = 1\n[listener]\n"
                           "max_frame_bytes = 1048576\n[drivers]\nmapped = []\n"),
              IsEmpty());
  EXPECT_EQ(configuration.log.burst, 65535u);
  EXPECT_THAT(complaintsOf("[log]\nburst = 65536\nrefill_per_second = nan\n[listener]\n"
                           "max_frame_bytes = 1048577\n[store]\nmax_bytes = \"9999999999GiB\"\n"
                           "[relay]\nbackends = [\"store\", 1]\n"
                           "[[drivers.mapped]]\npath = \"/p\"\n[[drivers.mapped]]\ngroup = \"G\"\n")
                  .size(),
              7u);
  EXPECT_EQ(configuration.listener.maxFrameBytes, 1u << 20);
  EXPECT_THAT(configuration.relay.backends, ElementsAre("store"));
  EXPECT_THAT(configuration.drivers.mapped, IsEmpty());
}

TEST_F(ServicesTest, WhatIsNoConfigurationFileIsOneComplaint) {
  const std::string path = folder + "/platform.toml";
  auto complaints = [&] {
    std::vector<std::string> made;
    PlatformConfiguration::load({"", "", folder, ""}, made);
    return made;
  };
  EXPECT_THAT(complaints(), IsEmpty());  // no file
  ASSERT_EQ(mkfifo(path.c_str(), 0666), 0);
  EXPECT_THAT(complaints(), ElementsAre(HasSubstr("not a regular file")));
  std::filesystem::remove(path);
  std::filesystem::create_directory(path);
  EXPECT_THAT(complaints(), ElementsAre(HasSubstr("not a regular file")));
  std::filesystem::remove(path);
  write("platform.toml", std::string((1 << 20) + 1, '\n'));
  EXPECT_THAT(complaints(), ElementsAre(HasSubstr("larger than")));
}

// The parser recurses once per part of a key, without a limit of its own.
TEST_F(ServicesTest, KeysNestedWithoutEndAreRefused) {
  std::string deep;
  for (int i = 0; i < 250'000; ++i) deep += "a.";
  EXPECT_THAT(complaintsOf("\n" + deep + "a = 1\n"),
              ElementsAre(HasSubstr("platform.toml:2: a key")));
  EXPECT_EQ(complaintsOf("[" + deep + "a]\n").size(), 1u);
  EXPECT_EQ(complaintsOf("s = '''\n'''\nx = {" + deep + "a = 1}\n").size(), 1u);
  write("d.toml", deep + "a = 1\n");
  TomlPreferences preferences(folder);
  EXPECT_FALSE(preferences.open("d")->hasObject("a"));
  const std::string dots(100, '.');
  write(
      "d.toml", "# " + dots + "\na = \"" + dots + "\\\"" + dots + "\"\nb = '" + dots +
                    "'\nc = \"\"\"" + dots + "\n\"" + dots + "\"\"\"\nd = [" +
                    [] {
                      std::string n;
                      for (int i = 0; i < 50; ++i) n += "1.5, ";
                      return n;
                    }() +
                    "]\n");
  EXPECT_TRUE(preferences.open("d")->hasObject("d"));
}

// One driver group, from the channels it has to their samples.
class Group {
 public:
  Group(CounterChannels& channels, const Name& group, const Name& subGroup) : channels_(channels) {
    const ChannelDictionaryRef set = channels.copyChannelsInGroup(group, subGroup, 0, error);
    if (set == nullptr) return;
    count = channels.channelCount(*set);
    subscription_ = channels.createSubscription(set, subscribed_);
  }
  ChannelDictionaryRef sample() {
    return channels_.createSamples(subscription_, subscribed_, error);
  }
  Counters values(const ChannelDictionaryRef& samples) {
    Counters found;
    if (samples == nullptr) return found;
    channels_.iterateSamples(*samples, [&](const ChannelSample& sample) {
      found.emplace(*channels_.channelName(sample), channels_.simpleIntegerValue(sample, 0));
      return 0;
    });
    return found;
  }
  std::optional<Error> error;
  int count = -1;  // no channel set

 private:
  CounterChannels& channels_;
  ChannelSubscription* subscription_ = nullptr;
  ChannelDictionaryRef subscribed_;
};

TEST_F(ServicesTest, CountersMoveVanishAndWrap) {
  write("drivers/Speaker/kept", "0x10\n");
  write("drivers/Speaker/gone", "1");
  write("drivers/Speaker/wraps", std::to_string(INT64_MAX));
  write("drivers/Speaker/L/kept", "5");
  CounterChannels channels(drivers);
  Group group(channels, "Speaker", std::nullopt);
  EXPECT_EQ(group.count, 4);
  const auto before = group.sample();
  write("drivers/Speaker/kept", "12");
  write("drivers/Speaker/wraps", std::to_string(INT64_MIN));
  write("drivers/Speaker/L/kept", "8");
  std::filesystem::remove(folder + "/drivers/Speaker/gone");
  const auto after = group.sample();
  EXPECT_THAT(group.values(channels.createSamplesDelta(before, after, group.error)),
              testing::UnorderedElementsAre(Pair("kept", -4), Pair("kept", 3), Pair("wraps", 1)));
  EXPECT_FALSE(group.error);
  EXPECT_EQ(channels.createSamplesDelta(nullptr, after, group.error), nullptr);
  EXPECT_TRUE(group.error);
  write("drivers/Speaker/kept", "99999999999999999999");
  group.error.reset();
  EXPECT_EQ(group.sample(), nullptr);
  ASSERT_TRUE(group.error);
  EXPECT_EQ(group.error->code, ERANGE);
  std::optional<Error> error;
  EXPECT_EQ(channels.createSamples(nullptr, before, error), nullptr);
  EXPECT_TRUE(error);
}

TEST_F(ServicesTest, ChannelsComeFromRegularFilesOfTheGroupAlone) {
  CounterChannels channels(drivers);
  EXPECT_EQ(Group(channels, std::nullopt, "MCA").count, -1);  // not even a root
  write("drivers/README", "text");
  write("drivers/A/MCA/x", "1");
  write("drivers/B/MCA/x", "2");
  write("drivers/B/Other/y", "3");
  write("drivers/B/.hidden", "4");
  ASSERT_EQ(mkfifo((folder + "/drivers/A/MCA/fifo").c_str(), 0666), 0);
  std::filesystem::create_directories(folder + "/drivers/Empty");
  Group mca(channels, std::nullopt, "MCA");
  EXPECT_THAT(mca.values(mca.sample()), ElementsAre(Pair("x", 1), Pair("x", 2)));
  EXPECT_EQ(Group(channels, "B", std::nullopt).count, 2);
  EXPECT_EQ(Group(channels, "Empty", std::nullopt).count, 0);
  EXPECT_EQ(Group(channels, std::nullopt, std::nullopt).count, 3);
  const Group missing(channels, "Missing", std::nullopt);
  EXPECT_EQ(missing.count, -1);
  EXPECT_FALSE(missing.error);
  std::filesystem::create_symlink(folder + "/drivers/Loop", folder + "/drivers/Loop");
  const Group loop(channels, "Loop", std::nullopt);
  ASSERT_TRUE(loop.error);
  EXPECT_EQ(loop.error->code, ELOOP);
}

TEST_F(ServicesTest, ChannelsAreBounded) {
  for (std::size_t i = 0; i < CounterChannels::kMaxChannels; ++i)
    write("drivers/G/" + std::to_string(i), "1");
  CounterChannels channels(drivers);
  EXPECT_EQ(Group(channels, "G", std::nullopt).count, 4096);
  EXPECT_THAT(platform.log.lines, IsEmpty());
  for (const char* name : {"more", "and more"}) write(std::string("drivers/G/") + name, "1");
  EXPECT_EQ(Group(channels, "G", std::nullopt).count, 4096);
  EXPECT_THAT(platform.log.lines, ElementsAre(HasSubstr("more than 4096 channels")));
}

// A stream that is opened and closed while a session runs, and a real folder of kernel counters.
TEST_F(ServicesTest, MappedSourcesFollowTheKernel) {
  const std::string status = "asound/card0/pcm0p/sub0/status";
  write(status, "closed\n");
  drivers.mapped = {
      {"Alsa", "", MappedChannelSource::Kind::AlsaProc, folder + "/asound"},
      {"Codec", "MCA", MappedChannelSource::Kind::Statistics, "/sys/class/net/lo/statistics"}};
  CounterChannels channels(drivers);
  Group alsa(channels, "Alsa", std::nullopt);
  EXPECT_EQ(alsa.count, 5);
  const auto closed = alsa.sample();
  EXPECT_THAT(alsa.values(closed), IsEmpty());
  write(status, "state: RUNNING\ndelay       : -5\nhw_ptr      : 4096\n");
  const auto open = alsa.sample();
  EXPECT_THAT(alsa.values(open), ElementsAre(Pair("card0_pcm0p_sub0_delay", -5),
                                             Pair("card0_pcm0p_sub0_hw_ptr", 4096)));
  EXPECT_THAT(alsa.values(channels.createSamplesDelta(closed, open, alsa.error)), IsEmpty());
  EXPECT_FALSE(alsa.error);
  Group codec(channels, std::nullopt, "MCA");
  EXPECT_EQ(codec.values(codec.sample()).count("rx_packets"), 1u);
}

TEST_F(ServicesTest, DiagnosticFilesAppearWholeOrNotAtAll) {
  LinuxDiagnosticFiles files(folder + "/log");
  const std::string directory = folder + "/log/Audio";
  const std::string target = directory + "/a.json";
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

TEST_F(ServicesTest, LargeDiagnosticFilesAreWrittenBesides) {
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
  std::stringstream text;
  text << std::ifstream(folder + "/log/Audio/a.json").rdbuf();
  EXPECT_TRUE(text.str() == expected);

  // A disk that is full after two megabytes.
  rlimit before{};
  getrlimit(RLIMIT_FSIZE, &before);
  const rlimit small{2 << 20, before.rlim_max};
  signal(SIGXFSZ, SIG_IGN);
  setrlimit(RLIMIT_FSIZE, &small);
  const auto full = files.createAtomically(folder + "/log/Audio", "c.json", error);
  for (int i = 0; i < 500 && !error; ++i) error = full->write(std::string(17000, 'x'));
  if (!error) error = full->commit();
  setrlimit(RLIMIT_FSIZE, &before);
  ASSERT_TRUE(error);
  EXPECT_EQ(error->code, EFBIG);
  EXPECT_FALSE(std::filesystem::exists(folder + "/log/Audio/c.json"));
}

TEST_F(ServicesTest, DiagnosticPathsStayBelowTheLogs) {
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

TEST(ProcessNames, OfOwnLiveAndGoneProcesses) {
  ProcProcessInfo processes;
  EXPECT_EQ(processes.shortCommandName(getpid()), processes.ownProcessName());
  EXPECT_EQ(processes.ownProcessName(), "services_test");
  EXPECT_EQ(processes.shortCommandName(0), std::nullopt);
  EXPECT_EQ(processes.shortCommandName(-1), std::nullopt);
  const pid_t child = fork();
  if (child == 0) _exit(0);
  waitpid(child, nullptr, 0);
  EXPECT_EQ(processes.shortCommandName(child), std::nullopt);
}

}  // namespace
}  // namespace vx::lnx
