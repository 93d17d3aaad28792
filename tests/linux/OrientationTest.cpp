#include <cerrno>
#include <system_error>

#include "platform/linux/device/InterfaceStateFile.h"
#include "platform/linux/device/LinuxOrientation.h"
#include "platform/linux/device/OrientationHandlers.h"
#include "platform/linux/execution/SystemThreading.h"
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
  handlers.add("a", &words, handler("a:"));
  handlers.report("portrait");  // the first that is known
  handlers.report("portrait");
  EXPECT_THAT(told, IsEmpty());
  handlers.add("b", &words, handler("b:"));
  handlers.add("a", &words, handler("again:"));
  handlers.add("a", &told, handler("other:"));  // of the same name, and somebody else's
  handlers.report("left-up");
  handlers.report("left-up");
  EXPECT_THAT(std::exchange(told, {}),
              testing::UnorderedElementsAre("again:left-up", "other:left-up", "b:left-up"));
  EXPECT_FALSE(handlers.remove("a", &handlers));
  EXPECT_TRUE(handlers.remove("a", &words));
  EXPECT_TRUE(handlers.remove("b", &words));
  handlers.report("portrait");
  EXPECT_THAT(std::exchange(told, {}), ElementsAre("other:portrait"));
  handlers.forgetLast();
  handlers.report("left-up");
  EXPECT_THAT(told, IsEmpty());
}

TEST_F(OrientationTest, ThreadsMayBeLackingAndHandlersAreRefusedBeyondABound) {
  int started = -1;
  LinuxOrientation notifier({.deviceSensor = false, .interfaceStateFile = folder + "/state"},
                            [&](Function<void()> body) {
                              if (started++ < 0)
                                throw std::system_error(EAGAIN, std::generic_category());
                              return std::thread(std::move(body));
                            });
  const auto held = std::make_shared<int>();
  const auto add = [&](std::size_t registrant) {
    notifier.registerInterfaceOrientationHandler("a", reinterpret_cast<const void*>(registrant),
                                                 [held](int64_t) {});
  };
  add(1);
  EXPECT_THAT(p.log.lines, ElementsAre(HasSubstr("no thread for it")));
  for (std::size_t i = 2; i <= OrientationHandlers::kMaxHandlers; ++i) add(i);
  add(1);  // known
  EXPECT_EQ(started, 1);
  EXPECT_EQ(notifier.refusedHandlers(), 0u);
  add(0);
  EXPECT_EQ(notifier.refusedHandlers(), 1u);
  EXPECT_TRUE(notifier.stop(SystemClock().monotonic() + std::chrono::seconds(10)));
  EXPECT_EQ(held.use_count(), 1) << "what is left goes while the services are there";
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
  EXPECT_THAT(p.log.lines, ElementsAre(HasSubstr("interface orientation is off for now")));
  write("run/state", " portrait\n");
  EXPECT_THAT(events(), ElementsAre("portrait"));
  file.start();
  EXPECT_THAT(events(), IsEmpty());
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
  std::filesystem::remove_all(folder + "/run");
  EXPECT_THAT(events(), IsEmpty());
  EXPECT_EQ(p.log.lines.size(), 2u);
  write("run/state", "portrait");
  EXPECT_THAT(events(), ElementsAre("portrait"));
  write("run/state", "left-up");
  EXPECT_THAT(events(), ElementsAre("left-up"));
}

}  // namespace
}  // namespace vx::lnx
