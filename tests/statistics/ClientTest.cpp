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
  const auto again = during([&] { service = VXReportingServiceDelegate::create(); }, {"setup"});
  EXPECT_THAT(again, ElementsAre("log vxrs default notify setup result 9"));
  EXPECT_EQ(p.queues.made[0],
            (std::pair<std::string, QualityOfService>("com.quorvel.sonik.reporting.server",
                                                      QualityOfService::UserInteractive)));
}

// What the connection checks arguments against and bounds resources by.
TEST_F(ClientTest, TheExportedInterface) {
  connect();
  std::string text;
  for (const OperationDescription& operation : connections[0]->interface->operations) {
    text += std::string(operation.name) + "(";
    for (const ArgumentKind kind : operation.arguments) text += "iwud?*"[static_cast<int>(kind)];
    text += std::string(")") + "bwedn"[static_cast<int>(operation.reply)];
    if (operation.replyMayBeHeld) text += " held";
    if (operation.resource == ResourceEffect::Acquire) text += " acquires";
    text += operation.resource == ResourceEffect::Release ? " releases; " : "; ";
  }
  EXPECT_EQ(text,
            "createReportingSession(i)b acquires; setServiceType(wi)b; "
            "getServiceNameForReporterID(i)w; setConfiguration(?i)b; "
            "startReportingSessionForID(i)b held; sendMessage(duw*)e; "
            "stopReportingSessionForID(i)b; destroyReportingSession(i)b releases; reporterID(i)d; "
            "getAllReporters()n; killService()b; ");
}

TEST_F(ClientTest, EveryOperationIsInvokedWithItsArguments) {
  class Target final : public ReplyTarget {
   public:
    void reply(uint64_t, ReplyValue value) override { last = std::move(value); }
    void release(uint64_t) override {}
    ReplyValue last = std::monostate();
  };
  auto& client = connect();
  const auto target = std::make_shared<Target>();
  const auto call = [&](std::size_t operation, const std::vector<Argument>& given) {
    CallArguments arguments;
    for (std::size_t i = 0; i < given.size(); ++i) arguments.set(i, given[i]);
    connections[0]->interface->operations[operation].invoke(client, arguments, Reply(target, 1));
    p.queues.runAll();
    return target->last;
  };
  const Argument five = int64_t{5};
  EXPECT_EQ(call(0, {five}), ReplyValue(true));
  EXPECT_EQ(call(1, {uint64_t{3}, five}), ReplyValue(true));
  EXPECT_EQ(call(2, {five}), ReplyValue(uint16_t{3}));
  EXPECT_EQ(call(3, {std::optional(message()), five}), ReplyValue(true));
  EXPECT_EQ(session(client, 5)->userInfo()->snapshot().text(), "{a=1}");
  target->last = std::monostate();
  EXPECT_EQ(call(4, {five}), ReplyValue());
  EXPECT_EQ(call(5, {std::optional(message()), uint64_t{0x40000007}, uint64_t{2},
                     std::optional(std::vector<int64_t>{5})}),
            ReplyValue());
  EXPECT_EQ(p.vyr.sent.back().category, 7);
  EXPECT_EQ(p.vyr.sent.back().type, 2);
  EXPECT_EQ(call(6, {five}), ReplyValue(true));
  EXPECT_FALSE(session(client, 5)->started());
  EXPECT_EQ(std::get<Payload>(call(8, {five})).text(), "{reporterID=5,serviceType=3}");
  EXPECT_EQ(call(9, {}), ReplyValue(std::vector<int64_t>{5}));
  EXPECT_EQ(call(7, {five}), ReplyValue(true));
  EXPECT_EQ(session(client, 5), nullptr);
  call(10, {});
  EXPECT_EQ(p.journal.back(), "exit 2");
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
  EXPECT_THAT(during([&] { connect(); }),
              ElementsAre("log vxrs default newConnection: <connection>",
                          "log vxrs default new client with pid 200"));
  p.clock.advance(std::chrono::milliseconds(2500));
  EXPECT_THAT(during([&] {
                connections[0]->interruption();
                p.queues.runAll();
              }),
              ElementsAre("log vxrs default InterruptionHandler: connection exited",
                          "log vxrs default removing 200 from the server client list"));
  EXPECT_THAT(onQueue([&] { return service->getAllClients(); }), IsEmpty());
  EXPECT_THAT(
      during([&] {
        connections[0]->invalidation();
        p.queues.runAll();
      }),
      ElementsAre(
          "log vxrs default InvalidationHandler: connection exited process=player uptime_sec=2",
          "event com.quorvel.sonik.vxreportingclientuptime"));
  EXPECT_EQ((*p.services.events[0].builder)().text(), "{processName=player,seconds=2.5}");
  clients.clear();
  EXPECT_THAT(during([&] { connections.clear(); }),
              ElementsAre("log vxrs default dealloc 200 from the server client list"));
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

TEST_F(ClientTest, WithoutANameNoUptime) {
  connect(555);
  p.clock.advance(std::chrono::seconds(3));
  auto unregistered = std::make_shared<fakes::FakeConnection>(200);
  service->listener(p.listener, unregistered);
  const std::string gone =
      "log vxrs default InvalidationHandler: connection exited process=unknown";
  const std::string nameless = "log vxrs default clientProcessName is nil. clientpid=";
  EXPECT_THAT(during([&] { connections[0]->invalidation(); }),
              ElementsAre(gone + " uptime_sec=3", nameless + "555"));
  EXPECT_THAT(during([&] { unregistered->invalidation(); }),
              ElementsAre("log vxrs default clientStartDate is nil. clientpid=200 "
                          "clientprocessname=unknown",
                          gone + " uptime_sec=-1", nameless + "200"));
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
  EXPECT_FALSE(onQueue([&] { return client.clientReportingSessionMap().at(1)->started(); }));
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
  started(client, 6);
  EXPECT_THAT(during(
                  [&] {
                    client.destroyReportingSession(6, booleans("destroy"));
                    p.queues.runAll();
                  },
                  {"trace", "flush", "reply"}),
              ElementsAre("trace 0x21042820", "trace 0x21042830", "reply destroy true", "flush",
                          "trace 0x21042834"));
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
  auto frontHalves = [&] {
    return during([&] {
      client.createReportingSession(1, booleans(""));
      client.setServiceType(2, 1, booleans(""));
      client.getServiceNameForReporterID(1, [](ServiceType) {});
      client.setConfiguration(message(), 1, booleans(""));
      client.startReportingSessionForID(1, booleans(""));
      client.sendMessage(message(), 1, 1, std::vector<ReporterID>{4, 5}, [](const auto&) {});
      client.sendMessage(message(), 1, 1, std::nullopt, [](const auto&) {});
      client.stopReportingSessionForID(1, booleans(""));
      client.destroyReportingSession(1, booleans(""));
      client.reporterID(1, [](const Payload&) {});
    });
  };
  EXPECT_THAT(frontHalves(), IsEmpty());
  p.log.verbose = true;
  const std::string before = "log vxrs debug ";
  EXPECT_THAT(
      frontHalves(),
      ElementsAre(before + "creating session for reporter 1",
                  before + "setting service type 2 for reporter 1", before + "fetching seviceType",
                  before + "setting configuration", before + "starting session for reporter 1",
                  before + "sending message for reporter (4, 5)",
                  before + "sending message for reporter (null)",
                  before + "stopping session for reporter 1",
                  before + "destroying session for reporter 1", before + "validating reporter 1"));
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
  EXPECT_EQ(typeOf(c, 7), 3);  // then the client that was registered first
  // What is not its own stays as it is.
  a.setServiceType(9, 8, booleans("type"));
  configure(a, 8, message());
  a.destroyReportingSession(8, booleans("destroy"));
  p.queues.runAll();
  EXPECT_EQ(typeOf(b, 8), 65535);
  EXPECT_EQ(session(b, 8)->userInfo()->snapshot().size(), 0u);
  for (const auto& [id, answer] : {std::pair(ReporterID{7}, "{reporterID=7,serviceType=3}"),
                                   {8, "{reporterID=8,serviceType=65535}"},
                                   {99, "{reporterID=0,serviceType=65535}"}}) {
    c.reporterID(id, [expected = answer](const Payload& p) { EXPECT_EQ(p.text(), expected); });
    p.queues.runAll();
  }
  c.getAllReporters([](const auto& all) { EXPECT_THAT(all, ElementsAre(7, 7, 8)); });
  const OnServiceQueue here{p};
  EXPECT_NE(service->findReportingSessionForID(8), nullptr);
  EXPECT_EQ(p.log.lines.back(), "vxrs info found reporting session 8 for client 201");
  EXPECT_EQ(service->findReportingSessionForID(99), nullptr);
  EXPECT_EQ(p.log.lines.back(), "vxrs error failed to find reporting session 99");
  create(a, 0);
  EXPECT_EQ(service->findReportingSessionForID(0), nullptr);
  EXPECT_NE(session(a, 0), nullptr);
}

TEST_F(ClientTest, KillEndsWithStatus2AndNoReply) {
  auto& client = connect();
  const auto gained = during([&] { client.killService(booleans("kill")); });
  EXPECT_THAT(gained, ElementsAre("log vxrs default DESTROYING SERVICE", "exit 2"));
}

}  // namespace
}  // namespace vx
