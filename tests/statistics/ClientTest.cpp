#include <sstream>

#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

class ClientTest : public ServiceTest {
 protected:
  const Payload message = dictionary("EngineOnTime", 2, "HostApplicationDisplayID", "liar");
  const Payload configuration = dictionary("HostApplicationDisplayID", "app");
};

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
// operation traces, logs and answers (but the session's own lines), and what others are handed.
TEST_F(ClientTest, TheExportedInterface) {
  struct Target final : public ReplyTarget {
    explicit Target(fakes::Journal& to) : journal(to) {}
    void reply(uint64_t, ReplyValue value) override {
      std::string text = "none";
      if (const auto* yes = std::get_if<bool>(&value)) text = *yes ? "true" : "false";
      if (const auto* type = std::get_if<uint16_t>(&value)) text = std::to_string(*type);
      if (const auto* answer = std::get_if<Payload>(&value)) text = answer->text();
      if (const auto* error = std::get_if<Error>(&value)) text = error->domain;
      if (const auto* all = std::get_if<std::vector<int64_t>>(&value))
        text = ::testing::PrintToString(*all);
      journal.push_back("reply " + text);
    }
    void release(uint64_t) override {}
    fakes::Journal& journal;
  };
  const auto target = std::make_shared<Target>(p.journal);
  for (const int32_t pid : {200, 201, 202}) connect(pid);
  p.services.preferences["device_name"] = "Early";  // not read before the first notification
  p.log.verbose = true;
  const std::string expected = dataFile("interface.txt");
  std::istringstream file(expected);
  std::string seen;
  for (std::string line; std::getline(file, line);) {
    if (line[0] == ' ') continue;
    std::istringstream words(line);
    std::string who, what, list;
    words >> who >> what;
    mark();
    std::string called = who + " " + what, shown;
    if (who == "notify") {  // the token, and the preferences of now
      p.services.preferences.clear();
      for (std::string key, value; words >> key >> value; called += " " + key + " " + value)
        p.services.preferences[key] = value;
      notify(std::stoi(what));
    } else if (what == "lost") {
      connections.at(static_cast<std::size_t>(who[0] - 'a'))->invalidation();
    } else {  // the client, the operation's number and its numbers
      const auto client = static_cast<std::size_t>(who[0] - 'a');
      const OperationDescription& operation =
          connections.at(client)->interface->operations[std::stoul(what)];
      shown = " " + std::string(operation.name) + "(";
      CallArguments arguments;
      for (std::size_t i = 0; i < operation.arguments.size(); ++i) {
        const char kind = "iwud?*"[static_cast<int>(operation.arguments[i])];
        shown += kind;
        if (kind == 'd') arguments.set(i, std::optional(message));
        if (kind == '?') arguments.set(i, std::optional(configuration));
        if (kind == 'd' || kind == '?') continue;
        words >> list;
        called += " " + list;
        if (kind == 'i') arguments.set(i, int64_t{std::stoll(list)});
        if (kind == 'w' || kind == 'u') arguments.set(i, uint64_t{std::stoull(list)});
        if (kind != '*') continue;
        std::optional<std::vector<int64_t>> ids;
        if (list != "all") ids.emplace();
        std::istringstream numbers(list);
        for (int64_t id = 0; numbers >> id; numbers.ignore()) ids->push_back(id);
        arguments.set(i, ids);
      }
      shown += std::string(")") + "bwedn"[static_cast<int>(operation.reply)];
      if (operation.replyMayBeHeld) shown += " held";
      if (operation.resource == ResourceEffect::Acquire) shown += " acquires";
      if (operation.resource == ResourceEffect::Release) shown += " releases";
      operation.invoke(*clients[client], arguments, Reply(target, 1));
    }
    run();
    seen += called + shown + "\n";
    for (const std::string& gain : gained())
      if (!gain.starts_with("log vxrr")) seen += "  " + gain + "\n";
    const auto handed = [&](auto& items, const auto& payload) {
      for (const auto& item : items) seen += "    " + payload(item).text() + "\n";
      items.clear();
    };
    handed(p.services.events, [](const auto& event) { return (*event.builder)(); });
    handed(p.services.powers, [](const auto& power) { return power.record; });
    handed(p.vyr.sessions, [](const auto& session) { return session->userInfo; });
    handed(p.vyr.sent, [](const auto& sent) { return sent.payload; });
    handed(p.vyr.oneOffs, [](const auto& single) { return single.userInfo; });
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
  mark();
  p.clock.advance(2500ms);
  connections[0]->interruption();
  std::string seen = told("interrupted");
  EXPECT_THAT(onQueue([&] { return service->getAllClients(); }), IsEmpty());
  connections[0]->invalidation();
  seen += told("invalidated");
  clients.clear();
  connections.clear();
  seen += told("let go");
  connect();
  mark();
  p.clock.wall -= 4s;
  connections[0]->invalidation();
  seen += told("of a time to come");
  connect(555);
  mark();
  p.clock.advance(3s);
  connections[1]->invalidation();
  seen += told("nameless");
  connect();
  mark();
  p.clock.advance(std::chrono::seconds(int64_t{1} << 32));
  connections[2]->invalidation();
  seen += told("after ages");
  auto unregistered = std::make_shared<fakes::FakeConnection>(200);
  service->listener(p.listener, unregistered);
  unregistered->invalidation();
  seen += told("not registered yet");
  for (const auto& event : p.services.events) seen += (*event.builder)().text() + "\n";
  EXPECT_EQ(seen, dataFile("uptime.txt"));
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
