#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class PreferencesTest : public ServiceTest {};

TEST_F(PreferencesTest, NothingIsReadBeforeTheFirstNotification) {
  p.services.preferences["disable_reporting"] = "true";
  EXPECT_EQ(p.services.preferenceReads, 0);
  EXPECT_TRUE(service->isReportingEnabled());
  EXPECT_EQ(onQueue([&] { return service->getDefaults(); }), std::nullopt);
  EXPECT_EQ(p.services.notifyQueue, serviceQueue());
}

TEST_F(PreferencesTest, AbsentSwitchIsTheIntegerZeroPresentOneABoolean) {
  EXPECT_EQ(VXReportingServiceDelegate::VXReportingDefaults().find("disable_reporting")->kind(),
            ValueKind::Integer);
  p.services.preferences = {{"disable_reporting", "false"}, {"device_name", "<table>"}};
  const Payload defaults = VXReportingServiceDelegate::VXReportingDefaults();
  EXPECT_EQ(defaults.find("disable_reporting")->kind(), ValueKind::Boolean);
  EXPECT_FALSE(defaults.contains("device_name"));
}

TEST_F(PreferencesTest, SessionsLearnBeforeTheSwitchMoves) {
  auto& client = connect();
  create(client, 1);
  p.services.preferences = {{"disable_reporting", "true"}, {"device_name", "Pocket"}};
  notify();
  EXPECT_THAT(gained(),
              ElementsAre("log vxrs default re-reading sonik defaults",
                          "log vxrs info defaults {device_name=Pocket,disable_reporting=1}"));
  const auto told = [&](ReporterID id) {
    return session(client, id)->userInfo()->snapshot().text();
  };
  EXPECT_EQ(told(1), "{device_name=Pocket,disable_reporting=1}");
  create(client, 2);
  p.services.preferences.erase("device_name");
  notify(3);  // somebody else's
  EXPECT_EQ(told(2), "{}") << "until the next notification";
  notify();
  EXPECT_EQ(onQueue([&] { return service->getDefaults(); })->text(), "{disable_reporting=1}");
  EXPECT_EQ(told(2), "{disable_reporting=1}");
}

TEST_F(PreferencesTest, OffRefusesMessagesAndHidesOthersSessions) {
  auto &a = connect(200), &b = connect(201);
  started(b, 1);
  create(b, 2);
  p.services.preferences["disable_reporting"] = "true";
  notify();
  p.log.lines.clear();
  start(a, 2);
  EXPECT_FALSE(session(b, 2)->started());
  send(a, message, 1, 1);
  EXPECT_THAT(gained(),
              ElementsAre("trace 0x21042824", "reply send com.quorvel.audio.reporting 1"));
  EXPECT_EQ(onQueue([&] { return service->findReportingSessionForID(1); }), nullptr);
  EXPECT_NE(session(b, 1), nullptr);
  EXPECT_THAT(p.log.lines, IsEmpty());
  p.services.preferences.clear();
  notify();
  send(a, message, 1, 1);
  EXPECT_THAT(gained({"reply"}), ElementsAre("reply send"));
}

}  // namespace
}  // namespace vx
