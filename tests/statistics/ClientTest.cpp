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

// Each operation through its description: what the connection checks and bounds by, then what the
// operation traces, logs and answers.
TEST_F(ClientTest, TheExportedInterface) {
  class Target final : public ReplyTarget {
   public:
    explicit Target(fakes::Journal& journal) : journal_(journal) {}
    void reply(uint64_t, ReplyValue value) override {
      std::string text = "none";
      if (const auto* yes = std::get_if<bool>(&value)) text = *yes ? "true" : "false";
      if (const auto* type = std::get_if<uint16_t>(&value)) text = std::to_string(*type);
      if (const auto* answer = std::get_if<Payload>(&value)) text = answer->text();
      if (const auto* all = std::get_if<std::vector<int64_t>>(&value))
        text = std::to_string(all->at(0));
      journal_.push_back("reply " + text);
    }
    void release(uint64_t) override {}
    fakes::Journal& journal_;
  };
  const auto target = std::make_shared<Target>(p.journal);
  connect();
  p.log.verbose = true;
  const Argument five = int64_t{5}, none = int64_t{0}, text = std::optional(message());
  const std::string start = "startReportingSessionForID(i)b held";
  const std::string destroy = "destroyReportingSession(i)b releases";
  const std::string created = "log vxrs default session created for reporter 5";
  struct {
    std::size_t operation;
    std::vector<Argument> arguments;
    std::string description;
    std::vector<std::string> journal;  // but the session's own lines; "d ": a verbose one
  } const calls[] = {
      {0,
       {five},
       "createReportingSession(i)b acquires",
       {"d creating session for reporter 5", "trace 0x21042814", "trace 0x21042828", created,
        "reply true"}},
      {1,
       {uint64_t{3}, five},
       "setServiceType(wi)b",
       {"d setting service type 3 for reporter 5",
        "log vxrs default service type 3 set for reporter  5", "reply true"}},
      {1,
       {uint64_t{3}, none},
       "setServiceType(wi)b",
       {"d setting service type 3 for reporter 0", "reply true"}},
      {2,
       {five},
       "getServiceNameForReporterID(i)w",
       {"d fetching seviceType", "reply 3",
        "log vxrs default returnning service type 3 for reporter  5"}},
      {2,
       {none},
       "getServiceNameForReporterID(i)w",
       {"d fetching seviceType", "reply 65535", "reply 65535",
        "log vxrs default returnning service type 65535 for reporter  0"}},
      {3, {text, five}, "setConfiguration(?i)b", {"d setting configuration", "reply true"}},
      {4,
       {five},
       start,
       {"d starting session for reporter 5", "trace 0x21042818", "trace 0x2104282C",
        "relay session"}},
      {5,
       {text, uint64_t{0x40000007}, uint64_t{2}, std::optional(std::vector<int64_t>{5, 0})},
       "sendMessage(duw*)e",
       {"d sending message for reporter (5, 0)", "trace 0x21042824",
        "event com.quorvel.sonik.Routing_RouteChange.Stop", "trace 0x21042838", "reply none",
        "relay 7 2"}},
      {6,
       {five},
       "stopReportingSessionForID(i)b",
       {"d stopping session for reporter 5", "trace 0x2104281C",
        "log vxrs default nothing interesting to fetch from the drivers", "trace 0x21042830",
        "trace 0x21042838", "reply true", "log vxrs default stopping 5", "reply true",
        "relay 65535 65535", "flush"}},
      {8,
       {five},
       "reporterID(i)d",
       {"d validating reporter 5", "log vxrs default validating reporter 5",
        "reply {reporterID=5,serviceType=3}"}},
      {9, {}, "getAllReporters()n", {"reply 5"}},
      {4,
       {five},
       start,
       {"d starting session for reporter 5", "trace 0x21042818", "trace 0x2104282C",
        "relay session"}},
      {7,
       {five},
       destroy,
       {"d destroying session for reporter 5", "trace 0x21042820", "trace 0x21042830",
        "log vxrs default destroying 5", "reply true", "flush", "trace 0x21042834"}},
      {7,
       {five},
       destroy,
       {"d destroying session for reporter 5", "trace 0x21042820", "log vxrs default destroying 5",
        "reply true"}},
      {7,
       {none},
       destroy,
       {"d destroying session for reporter 0", "trace 0x21042820", "reply true"}},
      {10, {}, "killService()b", {"log vxrs default DESTROYING SERVICE", "exit 2"}},
  };
  for (const auto& call : calls) {
    const OperationDescription& operation = connections[0]->interface->operations[call.operation];
    std::string shown = std::string(operation.name) + "(";
    for (const ArgumentKind kind : operation.arguments) shown += "iwud?*"[static_cast<int>(kind)];
    shown += std::string(")") + "bwedn"[static_cast<int>(operation.reply)];
    if (operation.replyMayBeHeld) shown += " held";
    if (operation.resource == ResourceEffect::Acquire) shown += " acquires";
    if (operation.resource == ResourceEffect::Release) shown += " releases";
    EXPECT_EQ(shown, call.description);
    fakes::Journal expected;
    for (const std::string& line : call.journal)
      expected.push_back(line.starts_with("d ") ? "log vxrs debug " + line.substr(2) : line);
    auto gained = during([&] {
      CallArguments arguments;
      for (std::size_t i = 0; i < call.arguments.size(); ++i) arguments.set(i, call.arguments[i]);
      operation.invoke(*clients[0], arguments, Reply(target, 1));
      p.queues.runAll();
    });
    std::erase_if(gained, [](const std::string& line) { return line.starts_with("log vxrr"); });
    EXPECT_EQ(gained, expected) << shown;
  }
  p.log.verbose = false;
  EXPECT_THAT(during([&] { send(*clients[0], message(), 1, 1, {{5}}); }),
              Not(Contains(HasSubstr(" debug "))));
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

}  // namespace
}  // namespace vx
