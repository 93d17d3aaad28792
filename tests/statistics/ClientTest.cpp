#include <sstream>

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

// Each operation through its description: what the connection checks and bounds by, then what the
// operation traces, logs and answers (but the session's own lines).
TEST_F(ClientTest, TheExportedInterface) {
  struct Target final : public ReplyTarget {
    explicit Target(fakes::Journal& to) : journal(to) {}
    void reply(uint64_t, ReplyValue value) override {
      std::string text = "none";
      if (const auto* yes = std::get_if<bool>(&value)) text = *yes ? "true" : "false";
      if (const auto* type = std::get_if<uint16_t>(&value)) text = std::to_string(*type);
      if (const auto* answer = std::get_if<Payload>(&value)) text = answer->text();
      if (const auto* all = std::get_if<std::vector<int64_t>>(&value))
        text = std::to_string(all->at(0));
      journal.push_back("reply " + text);
    }
    void release(uint64_t) override {}
    fakes::Journal& journal;
  };
  const auto target = std::make_shared<Target>(p.journal);
  connect();
  p.log.verbose = true;
  const std::string expected = dataFile("interface.txt");
  std::istringstream file(expected);
  std::string seen;
  for (std::string line; std::getline(file, line);) {
    if (line[0] == ' ') continue;  // calls are not indented: number, its numbers, what it is
    std::istringstream words(line);
    std::size_t number = 0;
    words >> number;
    const OperationDescription& operation = connections[0]->interface->operations[number];
    std::string called = std::to_string(number), shown = " " + std::string(operation.name) + "(";
    CallArguments arguments;
    for (std::size_t i = 0; i < operation.arguments.size(); ++i) {
      const char kind = "iwud?*"[static_cast<int>(operation.arguments[i])];
      shown += kind;
      int64_t value = 0;
      if (kind == 'd' || kind == '?') {
        arguments.set(i, std::optional(message));
      } else if (kind == '*') {
        arguments.set(i, std::optional(std::vector<int64_t>{5, 0}));
      } else {
        words >> value;
        called += " " + std::to_string(value);
        if (kind == 'i') arguments.set(i, value);
        if (kind != 'i') arguments.set(i, static_cast<uint64_t>(value));
      }
    }
    seen += called + shown + ")" + "bwedn"[static_cast<int>(operation.reply)];
    if (operation.replyMayBeHeld) seen += " held";
    if (operation.resource == ResourceEffect::Acquire) seen += " acquires";
    if (operation.resource == ResourceEffect::Release) seen += " releases";
    mark();
    operation.invoke(*clients[0], arguments, Reply(target, 1));
    run();
    for (const std::string& gain : gained())
      if (!gain.starts_with("log vxrr")) seen += "\n  " + gain;
    seen += "\n";
  }
  EXPECT_EQ(seen, expected);
  p.log.verbose = false;
  send(*clients[0], message, 1, 1, {{5}});
  EXPECT_THAT(gained({" debug "}), IsEmpty());
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

TEST_F(ClientTest, UptimeIsSentOnInvalidationOnlyAndOnce) {
  connect();
  EXPECT_THAT(gained(), ElementsAre("log vxrs default newConnection: <connection>",
                                    "log vxrs default new client with pid 200"));
  p.clock.advance(2500ms);
  connections[0]->interruption();
  run();
  EXPECT_THAT(gained(), ElementsAre("log vxrs default InterruptionHandler: connection exited",
                                    "log vxrs default removing 200 from the server client list"));
  EXPECT_THAT(onQueue([&] { return service->getAllClients(); }), IsEmpty());
  const std::string gone = "log vxrs default InvalidationHandler: connection exited process=";
  connections[0]->invalidation();
  run();
  EXPECT_THAT(gained(), ElementsAre(gone + "player uptime_sec=2",
                                    "event com.quorvel.sonik.vxreportingclientuptime"));
  EXPECT_EQ((*p.services.events[0].builder)().text(), "{processName=player,seconds=2.5}");
  clients.clear();
  connections.clear();
  EXPECT_THAT(gained(), ElementsAre("log vxrs default dealloc 200 from the server client list"));

  connect();
  p.clock.wall -= 4s;
  connections[0]->invalidation();
  EXPECT_THAT(gained(), Contains("log vxrs default clientStartDate is in the past. clientpid=200 "
                                 "clientprocessname=player"));
  EXPECT_EQ((*p.services.events[1].builder)().find("seconds")->text(), "4");

  connect(555);
  p.clock.advance(3s);
  auto unregistered = std::make_shared<fakes::FakeConnection>(200);
  service->listener(p.listener, unregistered);
  mark();
  const std::string nameless = "log vxrs default clientProcessName is nil. clientpid=";
  connections[1]->invalidation();
  EXPECT_THAT(gained(), ElementsAre(gone + "unknown uptime_sec=3", nameless + "555"));
  unregistered->invalidation();
  EXPECT_THAT(gained(), ElementsAre("log vxrs default clientStartDate is nil. clientpid=200 "
                                    "clientprocessname=unknown",
                                    gone + "unknown uptime_sec=-1", nameless + "200"));
  EXPECT_EQ(p.services.events.size(), 2u);
}

TEST_F(ClientTest, LostConnectionStopsStartedSessionsAndKeepsTheirReplies) {
  auto& client = connect();
  started(client, 1);
  create(client, 2);
  const auto old = session(client, 2);
  old->setStarted(true);
  create(client, 2);
  EXPECT_THAT(gained({"0x21042830", "flush"}), IsEmpty());
  EXPECT_TRUE(old->started()) << "replaced, not stopped";
  EXPECT_NE(session(client, 2), old);
  connections[0]->interruption();
  connections[0]->invalidation();
  run();
  EXPECT_THAT(
      gained({"0x21042830", "reply", "removing"}),
      ElementsAre("trace 0x21042830", "log vxrs default removing 200 from the server client list"));
  const OnServiceQueue here{p};
  EXPECT_FALSE(client.clientReportingSessionMap().at(1)->started());
  EXPECT_EQ(client.clientReportingSessionMap().size(), 2u);
}

TEST_F(ClientTest, LookupsOfOwnMapAndAcrossClients) {
  auto &a = connect(200), &b = connect(201), &c = connect(202);
  for (auto* client : {&a, &b}) create(*client, 7);
  create(b, 8);
  a.setServiceType(3, 7, booleans("type"));
  b.setServiceType(4, 7, booleans("type"));
  auto typeOf = [&](Client& client, ReporterID id) {
    ServiceType answer = 0;
    client.getServiceNameForReporterID(id, [&](ServiceType type) { answer = type; });
    run();
    return answer;
  };
  EXPECT_EQ(typeOf(b, 7), 4) << "its own comes first";
  EXPECT_EQ(typeOf(c, 7), 3) << "then the client that was registered first";
  // What is not its own stays as it is.
  a.setServiceType(9, 8, booleans("type"));
  configure(a, 8, message);
  a.destroyReportingSession(8, booleans("destroy"));
  EXPECT_EQ(typeOf(b, 8), 65535);
  EXPECT_EQ(session(b, 8)->userInfo()->snapshot().size(), 0u);
  for (const auto& [id, answer] : {std::pair(ReporterID{7}, "{reporterID=7,serviceType=3}"),
                                   {8, "{reporterID=8,serviceType=65535}"},
                                   {99, "{reporterID=0,serviceType=65535}"}})
    c.reporterID(id, [expected = answer](const Payload& p) { EXPECT_EQ(p.text(), expected); });
  c.getAllReporters([](const auto& all) { EXPECT_THAT(all, ElementsAre(7, 7, 8)); });
  run();
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
