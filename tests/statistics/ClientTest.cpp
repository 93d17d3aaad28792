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
  EXPECT_EQ(p.queues.made[0],
            (std::pair<std::string, QualityOfService>("com.quorvel.sonik.reporting.server",
                                                      QualityOfService::UserInteractive)));
}

TEST_F(ClientTest, RegistrationPrecedesTheClientsFirstOperation) {
  auto connection = std::make_shared<fakes::FakeConnection>(200);
  connections.push_back(connection);
  EXPECT_TRUE(service->listener(p.listener, connection));
  EXPECT_TRUE(connection->resumed);
  EXPECT_THAT(onQueue([&] { return service->getAllClients(); }), IsEmpty());
  auto client = std::static_pointer_cast<VXReportingServerInstance>(connection->object);
  client->getAllReporters([&](const auto&) { EXPECT_EQ(service->getAllClients().size(), 1u); });
  p.queues.runAll();
  EXPECT_EQ(client->clientProcessName(), "player");
}

TEST_F(ClientTest, OwnProcessHasItsOwnNameAndImpossibleOnesNone) {
  EXPECT_EQ(connect(1000).clientProcessName(), "vxreportingd");
  EXPECT_EQ(connect(0).clientProcessName(), std::nullopt);
  EXPECT_EQ(connect(555).clientProcessName(), std::nullopt);
}

TEST_F(ClientTest, UptimeIsSentOnInvalidationOnlyAndOnce) {
  connect();
  p.clock.advance(std::chrono::milliseconds(2500));
  connections[0]->interruption();
  p.queues.runAll();
  EXPECT_THAT(p.services.events, IsEmpty());
  EXPECT_THAT(onQueue([&] { return service->getAllClients(); }), IsEmpty());
  const auto gained = during([&] {
    connections[0]->invalidation();
    p.queues.runAll();
  });
  EXPECT_THAT(
      gained,
      ElementsAre(
          "log vxrs default InvalidationHandler: connection exited process=player uptime_sec=2",
          "event com.quorvel.sonik.vxreportingclientuptime"));
  EXPECT_EQ((*p.services.events[0].builder)().text(), "{processName=player,seconds=2.5}");
}

TEST_F(ClientTest, StartDateInTheFutureIsCalledThePastAndCountsAllTheSame) {
  connect();
  p.clock.wall -= std::chrono::seconds(4);
  connections[0]->invalidation();
  EXPECT_THAT(
      p.log.lines,
      Contains(
          "vxrs default clientStartDate is in the past. clientpid=200 clientprocessname=player"));
  EXPECT_EQ((*p.services.events[0].builder)().find("seconds")->text(), "4");
}

TEST_F(ClientTest, MissingStartDateGivesMinusOneAsAnInteger) {
  auto connection = std::make_shared<fakes::FakeConnection>(200);
  connections.push_back(connection);
  service->listener(p.listener, connection);
  std::static_pointer_cast<VXReportingServerInstance>(connection->object);
  connection->invalidation();  // before registration ran
  EXPECT_THAT(
      p.log.lines,
      Contains("vxrs default clientStartDate is nil. clientpid=200 clientprocessname=unknown"));
  EXPECT_THAT(p.log.lines, Contains("vxrs default clientProcessName is nil. clientpid=200"));
  EXPECT_THAT(p.services.events, IsEmpty());
}

TEST_F(ClientTest, LostConnectionStopsStartedSessionsAndKeepsTheirReplies) {
  auto& client = connect();
  started(client, 1);
  create(client, 2);
  const auto gained = during(
      [&] {
        connections[0]->interruption();
        connections[0]->invalidation();
        p.queues.runAll();
      },
      {"0x21042830", "reply", "removing"});
  EXPECT_THAT(gained, ElementsAre("trace 0x21042830",
                                  "log vxrs default removing 200 from the server client list"));
  EXPECT_EQ(onQueue([&] { return client.clientReportingSessionMap().size(); }), 2u);
}

TEST_F(ClientTest, OperationsTraceLogAndReplyInOrder) {
  auto& client = connect();
  EXPECT_THAT(during([&] { create(client, 5); }),
              ElementsAre("trace 0x21042814", "log vxrr info created reporting session for ID: 5",
                          "trace 0x21042828", "log vxrs default session created for reporter 5",
                          "reply create true"));
  EXPECT_THAT(
      during([&] {
        client.setServiceType(13, 5, booleans("type"));
        p.queues.runAll();
      }),
      ElementsAre("log vxrr info setting service type telephony",
                  "log vxrs default service type 13 set for reporter  5", "reply type true"));
  EXPECT_THAT(during([&] { configure(client, 5, message()); }),
              ElementsAre("reply configure true"));
  EXPECT_THAT(
      during([&] {
        client.reporterID(
            5, [&](const Payload& answer) { p.journal.push_back("reply " + answer.text()); });
        p.queues.runAll();
      }),
      ElementsAre("log vxrs default validating reporter 5", "reply {reporterID=5,serviceType=13}"));
  EXPECT_THAT(
      during([&] {
        client.destroyReportingSession(5, booleans("destroy"));
        p.queues.runAll();
      }),
      ElementsAre("trace 0x21042820", "trace 0x21042834", "log vxrr info deallocing this session 5",
                  "log vxrs default destroying 5", "reply destroy true"));
  EXPECT_THAT(during([&] {
                client.destroyReportingSession(5, booleans("destroy"));
                client.destroyReportingSession(0, booleans("destroy"));
                p.queues.runAll();
              }),
              ElementsAre("trace 0x21042820", "log vxrs default destroying 5", "reply destroy true",
                          "trace 0x21042820", "reply destroy true"));
}

TEST_F(ClientTest, ServiceTypeOfReporter0IsAnsweredTwice) {
  auto& client = connect();
  const auto gained = during([&] {
    client.getServiceNameForReporterID(
        0, [&](ServiceType type) { p.journal.push_back("reply " + std::to_string(type)); });
    p.queues.runAll();
  });
  EXPECT_THAT(gained,
              ElementsAre("reply 65535", "reply 65535",
                          "log vxrs default returnning service type 65535 for reporter  0"));
}

TEST_F(ClientTest, FrontHalvesSpeakOnlyWhenVerbose) {
  auto& client = connect();
  auto frontHalf = [&] {
    return during([&] {
      client.getServiceNameForReporterID(1, [](ServiceType) {});
      client.sendMessage(message(), 1, 1, std::vector<ReporterID>{4, 5}, [](const auto&) {});
    });
  };
  EXPECT_THAT(frontHalf(), IsEmpty());
  p.log.verbose = true;
  EXPECT_THAT(frontHalf(), ElementsAre("log vxrs debug fetching seviceType",
                                       "log vxrs debug sending message for reporter (4, 5)"));
  p.log.verbose = false;
}

TEST_F(ClientTest, SameIdentifierReplacesWithoutStopping) {
  auto& client = connect();
  started(client, 1);
  const auto old = session(client, 1);
  const auto gained = during([&] { create(client, 1); }, {"0x21042830", "flush"});
  EXPECT_THAT(gained, IsEmpty());
  EXPECT_TRUE(old->started());
  EXPECT_NE(session(client, 1), old);
}

TEST_F(ClientTest, LookupsOfOwnMapAndAcrossClients) {
  auto& a = connect(200);
  auto& b = connect(201);
  create(a, 7);
  create(b, 7);
  a.setServiceType(3, 7, booleans("type"));
  b.setServiceType(4, 7, booleans("type"));
  create(b, 8);
  p.queues.runAll();
  auto typeOf = [&](VXReportingServerInstance& client, ReporterID id) {
    ServiceType answer = 0;
    client.getServiceNameForReporterID(id, [&](ServiceType type) { answer = type; });
    p.queues.runAll();
    return answer;
  };
  EXPECT_EQ(typeOf(b, 7), 4);  // its own comes first
  auto& c = connect(202);
  EXPECT_EQ(typeOf(c, 7), 3);                // then the client that was registered first
  a.setServiceType(9, 8, booleans("type"));  // not its own: nothing happens
  p.queues.runAll();
  EXPECT_EQ(typeOf(b, 8), 65535);
  EXPECT_EQ(onQueue([&] { return service->findReportingSessionForID(99); }), nullptr);
  EXPECT_EQ(p.log.lines.back(), "vxrs error failed to find reporting session 99");
  create(a, 0);
  EXPECT_EQ(onQueue([&] { return service->findReportingSessionForID(0); }), nullptr);
  EXPECT_NE(session(a, 0), nullptr);
}

TEST_F(ClientTest, KillEndsWithStatus2AndNoReply) {
  auto& client = connect();
  const auto gained = during([&] { client.killService(booleans("kill")); });
  EXPECT_THAT(gained, ElementsAre("log vxrs default DESTROYING SERVICE", "exit 2"));
}

}  // namespace
}  // namespace vx
