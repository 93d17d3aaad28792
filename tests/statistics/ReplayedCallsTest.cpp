#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class ReplayedCallsTest : public ServiceTest {};

// The outside has moved on when a call is run again: nobody looks there.
TEST_F(ReplayedCallsTest, CallsThatAreRunAgainFindWhatTheyFoundTheFirstTime) {
  p.services.preferences["device_name"] = "Then";
  p.services.random = 7;
  const auto liveThrough = [&] {
    auto& client = connect();
    create(client, 1);
    notify();
    VXReportingSession::sendSingleMessage(message, 1, 1, 4, std::nullopt, nullptr);
    return client.clientProcessName().value_or("none") + " " +
           session(client, 1)->userInfo()->snapshot().text();
  };
  const std::string then = "player {device_name=Then,disable_reporting=0}";
  EXPECT_EQ(liveThrough(), then);
  p.queues.advance(std::chrono::seconds(2));

  p.inputs.replaying = true;
  p.services.preferences["device_name"] = "Now";
  p.services.random = 59;
  p.services.processNames.clear();
  EXPECT_EQ(liveThrough(), then);
  p.queues.advance(std::chrono::milliseconds(4999));
  EXPECT_THAT(p.vyr.oneOffs, IsEmpty());
  p.queues.advance(std::chrono::milliseconds(1));
  EXPECT_EQ(p.vyr.oneOffs.size(), 2u);  // the second waited for what was left
  drivers.onSample = [] { ADD_FAILURE() << "the drivers were asked"; };
  p.inputs.answers["driver statistics"] = PayloadBuilder().set("AE2", 3).build();
  (void)gained();
  stop(*clients[0], 1);
  EXPECT_THAT(gained({"fetching"}), ElementsAre("log vxrs default fetching driver logs {AE2=3}"));

  p.inputs.answers.clear();  // what was not found then
  EXPECT_EQ(liveThrough(), "none {}");
  EXPECT_EQ(onQueue([&] { return service->getDefaults(); })->find("device_name")->text(), "Then");
}

}  // namespace
}  // namespace vx
