#include <sys/stat.h>

#include "platform/linux/ConfigurationCheck.h"
#include "platform/linux/PlatformConfiguration.h"
#include "platform/linux/settings/TomlPreferences.h"
#include "tests/linux/FolderTest.h"

namespace vx::lnx {
namespace {

using ::testing::SizeIs;
using ::testing::UnorderedElementsAre;

class ConfigurationTest : public FolderTest {
 protected:
  std::vector<std::string> load() {
    std::vector<std::string> complaints;
    configuration = PlatformConfiguration::load({"", "", folder, ""}, complaints);
    EXPECT_EQ(checkConfiguration(folder), complaints);
    return complaints;
  }
  std::vector<std::string> complaintsOf(const std::string& text) {
    write("platform.toml", text);
    return load();
  }
  PlatformConfiguration configuration;
  const std::string file = folder + "/platform.toml:";
};

TEST_F(ConfigurationTest, ComplaintsNameFileLineAndKeyAndDefaultsStay) {
  EXPECT_THAT(load(), IsEmpty());  // no file
  EXPECT_THAT(complaintsOf("[device]\ninternal_build = 1\ndevice_class_number = 6\n"
                           "[store]\nmax_bytes = \"64MiB\"\nqueue_bytes = -1\n"
                           "[log]\nlevel = \"loud\"\nburst = 5\n[typo]\n"
                           "[[drivers.mapped]]\ngroup = \"G\"\npath = \"/p\"\n"
                           "[relay]\nbackends = [\"cloud\", \"store\", \"store\"]\n"
                           "[listener]\nkill_allowed_users = [7, \"root\", \"x y\", -1]\n"),
              ElementsAre(file + "2: device.internal_build: must be true or false",
                          HasSubstr(file + "8: log.level: must be one of"),
                          AllOf(HasSubstr(file + "15: relay.backends: "), HasSubstr("cloud"),
                                HasSubstr("\"store\"")),
                          HasSubstr(file + "6: store.queue_bytes: must be"),
                          file + "17: listener.kill_allowed_users: there is no user \"x y\"",
                          HasSubstr(file + "17: listener.kill_allowed_users: must hold"),
                          file + "10: typo: unknown key"));
  EXPECT_FALSE(configuration.device.internalBuild);
  EXPECT_EQ(configuration.device.deviceClassNumber, 6);
  EXPECT_EQ(configuration.store.maxBytes, 64u << 20);
  EXPECT_EQ(configuration.log.burst, 5u);
  EXPECT_THAT(configuration.drivers.mapped, SizeIs(1));
  EXPECT_THAT(configuration.relay.backends, ElementsAre("store"));
  EXPECT_THAT(configuration.listener.killAllowedUsers, ElementsAre(7, 0));
  EXPECT_THAT(complaintsOf("a = = 1\n"), ElementsAre(HasSubstr(file + "1:5: ")));
  std::filesystem::remove(folder + "/platform.toml");
  ASSERT_EQ(mkfifo((folder + "/platform.toml").c_str(), 0666), 0);
  EXPECT_THAT(load(), ElementsAre(HasSubstr("not a regular file")));
}

TEST_F(ConfigurationTest, FoldersAreTheServiceManagersOrTheSystems) {
  setenv("RUNTIME_DIRECTORY", "/a/:/b", 1);
  const Directories all = Directories::fromEnvironment();
  EXPECT_EQ(all.runtime + all.state + all.configuration + all.logs,
            "/a/var/lib/vxreporting/etc/vxreporting/var/log/vxreporting");
  setenv("RUNTIME_DIRECTORY", "", 1);
  EXPECT_EQ(Directories::fromEnvironment().runtime, "/run/vxreporting");
}

TEST_F(ConfigurationTest, RangesEndWhereTheySay) {
  EXPECT_THAT(complaintsOf("[log]\nburst = 65535\nrefill_per_second = 1\n[listener]\n"
                           "max_frame_bytes = 1048576\n[drivers]\nmapped = []\n"
                           "[relay]\nbackends = []\n[store]\nmax_age_days = 3\n"
                           "commit_interval_ms = 5\nqueue_bytes = \"64KiB\"\n"
                           "[memory]\nmax_user_waiting_bytes = \"64KiB\"\n"),
              IsEmpty());
  EXPECT_EQ(configuration.log.burst, 65535u);
  EXPECT_THAT(configuration.relay.backends, IsEmpty());
  EXPECT_EQ(configuration.store.maxAgeDays, 3u);
  EXPECT_EQ(configuration.store.commit.interval.count(), 5);
  EXPECT_EQ(configuration.memory.maxWaitingBytes, 65536u);
  EXPECT_EQ(configuration.store.commit.bytes, 16384u);
  EXPECT_THAT(
      complaintsOf("[log]\nburst = 65536\nrefill_per_second = nan\n[listener]\n"
                   "max_frame_bytes = 1048577\n[store]\nmax_bytes = \"9999999999GiB\"\n"
                   "[relay]\nbackends = [\"store\", 1, \"store\"]\n"
                   "[[drivers.mapped]]\npath = \"/p\"\n[[drivers.mapped]]\ngroup = \"G\"\n"),
      SizeIs(7));
  EXPECT_EQ(configuration.listener.maxFrameBytes, 1u << 20);
  EXPECT_THAT(configuration.drivers.mapped, IsEmpty());
}

// The parser recurses once per part of a key, without a limit of its own.
TEST_F(ConfigurationTest, KeysNestedWithoutEndAreRefused) {
  std::string deep;
  for (int i = 0; i < 250'000; ++i) deep += "a.";
  EXPECT_THAT(complaintsOf("\n" + deep + "a = 1\n"),
              ElementsAre(HasSubstr("platform.toml:2: a key")));
  EXPECT_THAT(complaintsOf("[" + deep + "a]\n"), SizeIs(1));
  EXPECT_THAT(complaintsOf("s = '''\n'''\nx = {" + deep + "a = 1}\n"), SizeIs(1));
  // Dots elsewhere are none of a key.
  const std::string dots(100, '.');
  write("d.toml", "# " + dots + "\na = \"" + dots + "\\\"" + dots + "\"\nb = '" + dots +
                      "'\nc = \"\"\"" + dots + "\n\"" + dots + "\"\"\"\nd = 1\n");
  EXPECT_TRUE(TomlPreferences(folder).open("d")->hasObject("d"));
}

TEST_F(ConfigurationTest, PreferencesAreCheckedForWhatTheServicePassesOver) {
  std::filesystem::create_directory(folder + "/preferences");
  auto check = [&](const std::string& text) {
    write("preferences/com.quorvel.sonik.toml", text);
    return checkConfiguration(folder);
  };
  EXPECT_THAT(check("disable_reporting = \"No\"\ndevice_name = 3\n"
                    "reporting_server_verbose = 1\nreporting_session_verbose = false\n"),
              IsEmpty());
  EXPECT_THAT(check("disable_reporting = \"off\"\ndevice_name = [\"a\"]\n"
                    "disable_reportin = true\n[reporting_server_verbose]\n"),
              UnorderedElementsAre(HasSubstr("sonik.toml:1: disable_reporting: counts as false"),
                                   HasSubstr(":2: device_name: counts as absent"),
                                   HasSubstr(":3: disable_reportin: unknown key"),
                                   HasSubstr(":4: reporting_server_verbose: counts as false")));
  EXPECT_THAT(check("device_name = \n"), ElementsAre(HasSubstr("sonik.toml:1:")));
}

TEST_F(ConfigurationTest, PreferencesKeepTheLastGoodValuesAndComplainOnce) {
  TomlPreferences preferences(folder);
  EXPECT_FALSE(preferences.open("d")->hasObject("k"));
  write("d.toml", "k = \"yes\"\nn = 3\nt = { a = 1 }\n");
  EXPECT_TRUE(preferences.open("d")->boolean("k"));
  EXPECT_EQ(preferences.open("d")->string("n"), "3");
  EXPECT_TRUE(preferences.open("d")->boolean("n"));
  EXPECT_EQ(preferences.open("d")->string("t"), std::nullopt);
  write("d.toml", "ok = 1\nk = \n");
  EXPECT_TRUE(preferences.open("d")->boolean("k"));
  EXPECT_TRUE(preferences.open("d")->boolean("k"));
  EXPECT_THAT(p.log.lines, ElementsAre(HasSubstr("d.toml:2:")));
  std::string large((1 << 20) + 1, '\n');
  write("d.toml", large);
  EXPECT_TRUE(preferences.open("d")->boolean("k"));
  large.replace(0, 6, "j = 1");
  write("d.toml", large);
  EXPECT_TRUE(preferences.open("d")->boolean("j"));
  std::filesystem::remove(folder + "/d.toml");
  EXPECT_FALSE(preferences.open("d")->hasObject("k"));
}

}  // namespace
}  // namespace vx::lnx
