#include <sys/stat.h>

#include <cstdlib>

#include "platform/linux/PlatformConfiguration.h"
#include "platform/linux/settings/TomlPreferences.h"
#include "tests/linux/FolderTest.h"

namespace vx::lnx {
namespace {

class ConfigurationTest : public FolderTest {
 protected:
  std::vector<std::string> complaintsOf(const std::string& text) {
    write("platform.toml", text);
    std::vector<std::string> complaints;
    configuration = PlatformConfiguration::load({"", "", folder, ""}, complaints);
    return complaints;
  }
  PlatformConfiguration configuration;
};

TEST_F(ConfigurationTest, ConfigurationNamesFileLineAndKeyAndKeepsDefaults) {
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

TEST_F(ConfigurationTest, DirectoriesTakeTheFirstOfAListAndFallBack) {
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

TEST_F(ConfigurationTest, ConfigurationRangesEndWhereTheySay) {
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

TEST_F(ConfigurationTest, BackEndsThatAreNotKnownAreLeftOut) {
  EXPECT_THAT(complaintsOf("[relay]\nbackends = [\n\"stoer\",\n\"store\", \"store\"]\n"),
              ElementsAre(folder + "/platform.toml:3: relay.backends: \"stoer\" is not known; "
                                   "must be one of \"store\""));
  EXPECT_THAT(configuration.relay.backends, ElementsAre("store"));
  EXPECT_EQ(complaintsOf("[relay]\nbackends = [\"elsewhere\"]\n").size(), 1u);
  EXPECT_THAT(configuration.relay.backends, IsEmpty());
  EXPECT_THAT(complaintsOf("[relay]\nbackends = []\n[store]\nmax_age_days = 3\n"
                           "commit_interval_ms = 5\nqueue_bytes = 65536\n"),
              IsEmpty());
  EXPECT_THAT(configuration.relay.backends, IsEmpty());
  EXPECT_EQ(configuration.store.maxAgeDays, 3u);
  EXPECT_EQ(configuration.store.commit.interval.count(), 5);
  EXPECT_EQ(configuration.store.queueBytes, 65536u);
}

TEST_F(ConfigurationTest, WhatIsNoConfigurationFileIsOneComplaint) {
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
TEST_F(ConfigurationTest, KeysNestedWithoutEndAreRefused) {
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

TEST_F(ConfigurationTest, PreferencesKeepTheLastGoodValuesAndComplainOnce) {
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

}  // namespace
}  // namespace vx::lnx
