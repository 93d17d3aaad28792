#include <cerrno>

#include "platform/linux/settings/PreferencesWatcher.h"
#include "tests/linux/FolderTest.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;
using PreferencesWatcherTest = FolderTest;

TEST_F(PreferencesWatcherTest, SettlesBeforeItFires) {
  fakes::FakeClock clock;
  PreferencesOptions options;
  PreferencesWatcher watcher(folder + "/preferences", folder + "/notify", {{"name", "d.toml"}},
                             options, clock);
  watcher.start(PreferencesWatcher::openInotify());
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

TEST_F(PreferencesWatcherTest, FollowsALinkToTheFileBehindIt) {
  fakes::FakeClock clock;
  PreferencesOptions options;
  write("here/d.toml", "a = 1\n");
  write("there/d.toml", "a = 1\n");
  std::filesystem::create_directory(folder + "/preferences");
  const std::string link = folder + "/preferences/d.toml";
  std::filesystem::create_symlink(folder + "/here/d.toml", link);
  PreferencesWatcher watcher(folder + "/preferences", folder + "/notify", {{"name", "d.toml"}},
                             options, clock);
  watcher.start(PreferencesWatcher::openInotify());
  int fired = 0;
  int token = 0;
  watcher.registerHandler("name", token, p.queues.makeSerial("q", QualityOfService::Utility),
                          [&](int) { ++fired; });
  auto pass = [&] {
    watcher.onReadable();
    clock.advance(1s);
    if (watcher.nextDue()) watcher.onDue();
    p.queues.runAll();
    return fired;
  };
  EXPECT_EQ(pass(), 0);
  write("here/d.toml", "a = 2\n");
  EXPECT_EQ(pass(), 1);
  write("here/other.toml", "a = 2\n");
  EXPECT_EQ(pass(), 1);
  std::filesystem::create_symlink(folder + "/there/d.toml", link + ".new");
  std::filesystem::rename(link + ".new", link);
  EXPECT_EQ(pass(), 2);
  write("here/d.toml", "a = 3\n");
  EXPECT_EQ(pass(), 2);
  write("there/d.toml", "a = 3\n");
  EXPECT_EQ(pass(), 3);
  write("preferences/real.toml", "a = 3\n");
  std::filesystem::create_symlink("real.toml", link + ".new");
  std::filesystem::rename(link + ".new", link);
  EXPECT_EQ(pass(), 4);
  for (int i = 5; i < 8; ++i) {
    write("preferences/real.toml", "a = 4\n");
    EXPECT_EQ(pass(), i);
  }
  std::filesystem::remove(link);
  EXPECT_EQ(pass(), 8);
}

TEST_F(PreferencesWatcherTest, PollsWhereInotifyCannotBeHad) {
  fakes::FakeClock clock;
  PreferencesOptions options;
  PreferencesWatcher watcher(folder + "/preferences", folder + "/notify", {{"name", "d.toml"}},
                             options, clock);
  watcher.start(Status::posix("inotify", EMFILE));
  EXPECT_THAT(p.log.lines,
              ElementsAre(HasSubstr("(Too many open files); looking every 3000 ms instead")));
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

}  // namespace
}  // namespace vx::lnx
