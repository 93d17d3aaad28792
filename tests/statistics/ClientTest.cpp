#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class ClientTest : public ServiceTest {};

TEST_F(ClientTest, CreationRegistersInOrder) {
  EXPECT_THAT(p.log.registrations,
              ElementsAre("vxrs 1987605107 com.quorvel.sonik reporting_server_verbose 31",
                          "vxrd 1987605092 com.quorvel.sonik reporting_driver_verbose 31"));
  EXPECT_THAT(p.journal, ElementsAre("notify com.quorvel.sonik.reporting",
                                     "log vxrs default notify setup result 0",
                                     "log vxrd info creating channelreporting driver utility"));
  p.services.notifyStatus = 9;
  service = VXReportingServiceDelegate::create();
  EXPECT_THAT(p.journal, Contains("log vxrs default notify setup result 9"));
  EXPECT_THAT(p.queues.made[0],
              Pair("com.quorvel.sonik.reporting.server", QualityOfService::UserInteractive));
}

TEST_F(ClientTest, RegistrationPrecedesTheClientsFirstOperation) {
  auto connection = std::make_shared<fakes::FakeConnection>(200);
  connections.push_back(connection);
  EXPECT_TRUE(service->listener(p.listener, connection));
  EXPECT_TRUE(connection->resumed);
  EXPECT_THAT(onQueue([&] { return service->getAllClients(); }), IsEmpty());
  auto client = std::static_pointer_cast<Client>(connection->object);
  client->getAllReporters([&](const auto&) { EXPECT_EQ(service->getAllClients().size(), 1u); });
  run();
  EXPECT_EQ(client->clientProcessName(), "player");
  EXPECT_EQ(connect(1000).clientProcessName(), "vxreportingd");
  for (const int32_t impossible : {0, 555})
    EXPECT_EQ(connect(impossible).clientProcessName(), std::nullopt);
}

TEST_F(ClientTest, AbsentSwitchIsTheIntegerZeroPresentOneABoolean) {
  const auto defaults = [] { return VXReportingServiceDelegate::VXReportingDefaults(); };
  EXPECT_EQ(defaults().find("disable_reporting")->kind(), ValueKind::Integer);
  p.services.preferences = {{"disable_reporting", "false"}, {"device_name", "<table>"}};
  EXPECT_EQ(defaults().find("disable_reporting")->kind(), ValueKind::Boolean);
  EXPECT_FALSE(defaults().contains("device_name"));
}

}  // namespace
}  // namespace vx
