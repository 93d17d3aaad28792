#include "platform/linux/device/InterfaceStateFile.h"
#include "platform/linux/device/OrientationHandlers.h"
#include "tests/linux/FolderTest.h"

namespace vx::lnx {
namespace {

using OrientationTest = FolderTest;
using Told = std::vector<std::string>;

TEST_F(OrientationTest, HandlersAreToldOfChangesAlone) {
  OrientationWords words;
  OrientationHandlers handlers(words);
  Told told;
  auto handler = [&](const char* name) {
    return [&, name](int64_t value) { told.push_back(name + words.textOf(value)); };
  };
  handlers.add("a", handler("a:"));
  handlers.report("portrait");  // the first that is known
  handlers.report("portrait");
  EXPECT_THAT(told, IsEmpty());
  handlers.add("b", handler("b:"));
  handlers.add("a", handler("again:"));
  handlers.report("left-up");
  handlers.report("left-up");
  EXPECT_THAT(std::exchange(told, {}), ElementsAre("again:left-up", "b:left-up"));
  EXPECT_TRUE(handlers.remove("a"));
  handlers.report("portrait");
  EXPECT_THAT(std::exchange(told, {}), ElementsAre("b:portrait"));
  handlers.forgetLast();
  handlers.report("left-up");
  EXPECT_THAT(told, IsEmpty());
}

TEST_F(OrientationTest, WordsHaveNumbersOfTheirOwnUpToALimit) {
  OrientationWords words;
  EXPECT_EQ(words.textOf(words.valueOf("normal")), "normal");
  EXPECT_EQ(words.valueOf("unknown"), 0);
  for (int i = 10; i < 64; ++i) EXPECT_EQ(words.valueOf("w" + std::to_string(i)), i);
  EXPECT_EQ(words.valueOf("one too many"), 0);
  EXPECT_EQ(words.valueOf("w63"), 63);
  EXPECT_EQ(words.textOf(64), "unknown");
  EXPECT_EQ(words.textOf(-1), "unknown");
}

TEST_F(OrientationTest, TheStateFileIsReadWheneverItIsWrittenOrRenamedOver) {
  Told told;
  InterfaceStateFile file(folder + "/run/state", [&](const std::string& w) { told.push_back(w); });
  auto events = [&] {  // inotify reports before the write returns
    file.onReadable();
    return std::exchange(told, {});
  };
  file.start();
  file.start();
  EXPECT_EQ(file.fd(), -1);
  EXPECT_THAT(p.log.lines, ElementsAre(HasSubstr("interface orientation is off for now")));
  write("run/state", " portrait\n");
  file.start();
  file.start();
  EXPECT_THAT(std::exchange(told, {}), ElementsAre("portrait"));
  write("run/state", "\tlandscape-left");
  EXPECT_THAT(events(), ElementsAre("landscape-left"));
  write("run/other", "portrait");
  EXPECT_THAT(events(), IsEmpty());
  std::filesystem::rename(folder + "/run/other", folder + "/run/state");
  EXPECT_THAT(events(), ElementsAre("portrait"));
  for (const std::string& none : {std::string(" \n"), std::string(65, 'x')}) {
    write("run/state", none);
    EXPECT_THAT(events(), IsEmpty());
  }
  write("run/state", std::string(64, 'x'));
  EXPECT_THAT(events(), ElementsAre(std::string(64, 'x')));
}

}  // namespace
}  // namespace vx::lnx
