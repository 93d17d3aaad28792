#include <cerrno>

#include "platform/linux/settings/PreferencesWatcher.h"
#include "tests/linux/FolderTest.h"

namespace vx::lnx {
namespace {

using namespace std::chrono_literals;

class PreferencesWatcherTest : public FolderTest {
 protected:
  void start(Result<UniqueFd> inotify) {
    watcher.start(std::move(inotify));
    int token = 0;
    EXPECT_EQ(watcher.registerHandler("name", token, queue,
                                      [this](int told) { fired += told == token_ ? 1 : 100; }),
              0u);
    token_ = token;
  }
  void edit(const std::string& name = "preferences/d.toml") {
    write(name, "a = " + std::to_string(++edits_) + "\n");
  }
  void pointLinkAt(const std::string& target) {
    std::filesystem::create_symlink(target, folder + "/new");
    std::filesystem::rename(folder + "/new", folder + "/preferences/d.toml");
  }
  // How often it has fired after that time.
  int pass(std::chrono::milliseconds time) {
    watcher.onReadable();
    p.clock.advance(time);
    watcher.onDue();
    p.queues.runAll();
    return fired;
  }
  std::shared_ptr<WorkQueue> queue = p.queues.makeSerial("q", QualityOfService::Utility);
  PreferencesWatcher watcher{folder + "/preferences",
                             folder + "/notify",
                             {{"name", "d.toml"}},
                             PreferencesOptions{},
                             p.clock};
  int fired = 0;

 private:
  int token_ = 0;
  int edits_ = 0;
};

TEST_F(PreferencesWatcherTest, SettlesBeforeItFires) {
  start(PreferencesWatcher::openInotify());
  std::string posted;
  watcher.setPoster([&](std::string_view name, const PreferencesWatcher::Post& post) {
    const bool idle = !p.queues.nextDue();
    post();
    if (idle && p.queues.nextDue()) posted = name;
  });
  EXPECT_FALSE(watcher.nextDue());
  edit();  // with its folder
  EXPECT_EQ(pass(99ms), 0);
  EXPECT_EQ(*watcher.nextDue() - p.clock.monotonic(), 1ms);
  EXPECT_EQ(pass(1ms), 1);
  EXPECT_EQ(posted, "name");
  for (int i = 0; i < 30; ++i) {  // never left alone: told all the same, now and then
    edit();
    pass(90ms);
  }
  EXPECT_EQ(fired, 2);
  pass(100ms);
  const int before = fired;
  edit("preferences/other.toml");
  EXPECT_EQ(pass(1s), before);
  std::filesystem::remove_all(folder + "/preferences");
  EXPECT_EQ(pass(100ms), before + 1);
  edit();
  EXPECT_EQ(pass(100ms), before + 2);
}

TEST_F(PreferencesWatcherTest, APostFiresOnceInWhateverStepsAndAlsoInAFolderThatCameAnew) {
  start(PreferencesWatcher::openInotify());
  edit("notify/unheard");
  EXPECT_EQ(pass(1s), 0);
  edit("notify/name");
  watcher.onReadable();
  std::filesystem::last_write_time(folder + "/notify/name", {});
  EXPECT_EQ(pass(100ms), 1);
  std::filesystem::remove_all(folder + "/notify");
  EXPECT_EQ(pass(1s), 1);
  edit("notify/name");  // before the folder is known
  EXPECT_EQ(pass(100ms), 2);
  edit("notify/name");
  EXPECT_EQ(pass(100ms), 3);
}

TEST_F(PreferencesWatcherTest, WhatComesBesideOrAboveAMissingFolderIsNothingToIt) {
  start(PreferencesWatcher::openInotify());
  edit("other.toml");
  EXPECT_EQ(pass(1s), 0);
  std::filesystem::create_directory(folder + "/preferences");
  EXPECT_EQ(pass(1s), 0) << "without the file";
  edit();
  EXPECT_EQ(pass(100ms), 1);
}

TEST_F(PreferencesWatcherTest, FollowsALinkToTheFileBehindIt) {
  edit("here/d.toml");
  edit("there/d.toml");
  std::filesystem::create_directory(folder + "/preferences");
  pointLinkAt(folder + "/here/d.toml");
  start(PreferencesWatcher::openInotify());
  EXPECT_EQ(pass(1s), 0);
  edit("here/d.toml");
  EXPECT_EQ(pass(1s), 1);
  pointLinkAt("../there/d.toml");
  EXPECT_EQ(pass(1s), 2);
  edit("here/d.toml");
  EXPECT_EQ(pass(1s), 2);
  edit("there/d.toml");
  EXPECT_EQ(pass(1s), 3);
}

TEST_F(PreferencesWatcherTest, PollsWhereInotifyCannotBeHad) {
  start(Status::posix("inotify", EMFILE));
  EXPECT_THAT(p.log.lines,
              ElementsAre(HasSubstr("(Too many open files); looking every 3000 ms instead")));
  EXPECT_EQ(watcher.fd(), -1);
  const auto look = [&] {
    pass(std::chrono::ceil<std::chrono::milliseconds>(*watcher.nextDue() - p.clock.monotonic()));
    return pass(100ms);
  };
  EXPECT_EQ(look(), 0);
  edit();
  EXPECT_EQ(look(), 1);
  EXPECT_EQ(look(), 1);
  std::filesystem::remove(folder + "/preferences/d.toml");
  EXPECT_EQ(look(), 2);
}

}  // namespace
}  // namespace vx::lnx
