// Scripts of what clients and the platform do to the service, each step with what came of it: what
// is traced, logged and answered, what others are handed, and the time that passed by itself.
#include <cmath>
#include <iomanip>
#include <sstream>

#include "tests/statistics/ServiceFixture.h"

namespace vx {
namespace {

struct Target final : ReplyTarget {
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

std::string textOf(const VyrSessionInfo& info) {
  std::ostringstream text;
  for (const auto& [key, value] : info) {
    text << " " << key;
    const auto add = [&](const auto& v) {
      if constexpr (std::is_arithmetic_v<std::decay_t<decltype(v)>>) text << "=" << v;
    };
    std::visit(add, value);
  }
  return text.str();
}

std::chrono::nanoseconds milliseconds(const std::string& text) {
  return std::chrono::microseconds(std::llround(std::stod(text) * 1000));
}

class ScriptTest : public ServiceTest, public ::testing::WithParamInterface<const char*> {
 protected:
  static Payload dictionaryOf(std::istream& words) {
    PayloadBuilder builder;
    for (std::string key, value; words >> std::quoted(key) >> std::quoted(value);) {
      char* end = nullptr;
      const double number = std::strtod(value.c_str(), &end);
      if (value.empty() || *end != 0)
        builder.set(key, value);
      else if (value.find('.') == value.npos)
        builder.set(key, static_cast<int64_t>(number));
      else
        builder.set(key, number);
    }
    return builder.build();
  }
  void let(const std::string& name, int64_t value) {
    const auto broken = value != 0 ? std::optional(Error{"x", 5, "broken"}) : std::nullopt;
    if (name == "verbose") p.log.verbose = value != 0;
    if (name == "session_lines") sessionLines = value != 0;
    if (name == "internal_build") p.services.internalBuild = value != 0;
    if (name == "device_class") p.services.deviceClass = static_cast<int32_t>(value);
    if (name == "replaying") p.inputs.replaying = value != 0;
    if (name == "no_answers") p.inputs.answers.clear();
    if (name == "no_processes") p.services.processNames.clear();
    if (name == "sample_fails") drivers.failNext = true;
    if (name == "random") p.services.random = static_cast<uint32_t>(value);
    if (name == "send_error") p.vyr.sendError = broken;
    if (name == "flush_error") p.vyr.flushError = broken;
    if (name == "no_back_ends") p.vyr.backends.reset();
    if (name == "back_ends") p.vyr.backends = {{"store"}};
    if (name == "back_ends_after_s") p.vyr.configurationAfter = std::chrono::seconds(value);
  }
  // A call of a client's, with the operation's number and its numbers; what the connection checks
  // and bounds by is added to the line.
  std::string call(std::size_t client, std::size_t number, std::istream& words) {
    const OperationDescription& operation = connections.at(client)->interface->operations[number];
    std::string given, list, shown = " " + std::string(operation.name) + "(";
    CallArguments arguments;
    for (std::size_t i = 0; i < operation.arguments.size(); ++i) {
      const char kind = "iwud?*"[static_cast<int>(operation.arguments[i])];
      shown += kind;
      if (kind == 'd') arguments.set(i, std::optional(message));
      if (kind == '?') arguments.set(i, std::optional(configuration));
      if (kind == 'd' || kind == '?') continue;
      words >> list;
      given += " " + list;
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
    return given + shown;
  }
  // Takes a step; its line.
  std::string take(const std::string& line) {
    std::istringstream words(line);
    std::string who, what, value;
    words >> who;
    if (who == "message") return message = dictionaryOf(words), line;
    if (who == "configuration") return configuration = dictionaryOf(words), line;
    words >> what;
    const auto client = static_cast<std::size_t>(who[0] - 'a');
    if (who == "notify") {  // the token, and the preferences of now
      p.services.preferences.clear();
      for (std::string key; words >> key >> value;) p.services.preferences[key] = value;
      onQueue([&] { (*p.services.notifyHandler)(std::stoi(what)); });
    } else if (who == "let") {
      words >> value;
      let(what, std::stoll(value));
    } else if (who == "connect") {
      connect(std::stoi(what));
    } else if (who == "briefly") {  // gone before it was registered
      const auto connection = std::make_shared<fakes::FakeConnection>(std::stoi(what));
      service->listener(p.listener, connection);
      connection->invalidation();
    } else if (who == "after") {
      p.queues.advance(milliseconds(what));
    } else if (who == "clock") {
      p.clock.wall += milliseconds(what);
    } else if (who == "channel") {
      words >> value;
      drivers.write(what, value);
    } else if (who == "create") {
      service = VXReportingServiceDelegate::create();
    } else if (who == "device" || who == "interface") {
      (*(who == "device" ? deviceHandler : interfaceHandler))(std::stoll(what));
    } else if (what == "lost") {
      connections.at(client)->invalidation();
    } else if (what == "halted" || what == "unstarted" || what == "summarised") {
      words >> value;
      onQueue([&] {  // its session, by no call
        const auto session = clients.at(client)->findReportingSessionForID(std::stoll(value),
                                                                           Client::Lookup::OwnMap);
        if (what == "halted") session->stop();
        if (what == "unstarted") session->setStarted(false);
        if (what == "summarised") session->writeSummaryJson();
      });
    } else if (what == "interrupted") {
      connections.at(client)->interruption();
    } else if (what == "forgotten") {
      connections.at(client).reset();
      clients.at(client).reset();
    } else {
      return who + " " + what + call(client, std::stoul(what), words);
    }
    return line;
  }
  // What came of it.
  std::string outcome() {
    std::string seen;
    for (const std::string& gain : gained())
      if (sessionLines || !gain.starts_with("log vxrr")) seen += "  " + gain + "\n";
    const auto handed = [&](auto& items, const auto& text) {
      for (const auto& item : items) seen += "    " + text(item) + "\n";
      items.clear();
    };
    handed(p.services.events, [](const auto& event) { return (*event.builder)().text(); });
    handed(p.services.powers, [](const auto& power) { return power.record.text(); });
    handed(p.vyr.sessions, [](const auto& s) { return s->userInfo.text() + textOf(s->info); });
    handed(p.vyr.sent, [](const auto& sent) { return sent.payload.text(); });
    handed(p.vyr.oneOffs, [](const auto& single) {
      return single.payload.text() + " " + single.userInfo.text() + textOf(single.info);
    });
    handed(p.services.files, [](const auto& file) {
      const std::string text =
          file.second.substr(0, file.second.size() - 1);  // ends with a newline
      std::string indented;
      for (const char c : text) indented += c == '\n' ? std::string("\n    ") : std::string(1, c);
      return indented;
    });
    return seen;
  }

  Payload message = dictionary("EngineOnTime", 2, "HostApplicationDisplayID", "liar");
  Payload configuration = dictionary("HostApplicationDisplayID", "app");
  bool sessionLines = false;
  // The last ones that were registered: a call may be under way when they no longer are.
  std::shared_ptr<OrientationNotifier::Handler> deviceHandler, interfaceHandler;
  const std::shared_ptr<Target> target = std::make_shared<Target>(p.journal);
};

TEST_P(ScriptTest, EachStepHasItsOutcome) {
  p.services.preferences["device_name"] = "Early";  // not read before the first notification
  drivers.onSample = [this] { p.journal.push_back("sample"); };
  const std::string expected = dataFile("scripts/" + std::string(GetParam()) + ".txt");
  std::istringstream script(expected);
  std::string seen;
  mark();
  for (std::string line; std::getline(script, line);) {
    if (line[0] == ' ') continue;
    const Monotonic before = p.clock.monotonic();
    seen += take(line) + "\n";
    run();
    const auto passed = p.clock.monotonic() - before;
    if (!line.starts_with("after") && passed > 0ns)
      seen += "  " + std::to_string(passed / 1ms) + " ms pass\n";
    seen += outcome();
    for (const auto& [name, handler] : p.services.deviceHandlers) deviceHandler = handler;
    for (const auto& [name, handler] : p.services.interfaceHandlers) interfaceHandler = handler;
  }
  EXPECT_EQ(seen, expected);
  onQueue([this] {  // they hold sessions
    deviceHandler = interfaceHandler = nullptr;
    p.services.deviceHandlers.clear();
    p.services.interfaceHandlers.clear();
  });
}

INSTANTIATE_TEST_SUITE_P(, ScriptTest,
                         ::testing::Values("interface", "sessions", "relay", "orientation",
                                           "drivers", "uptime", "power", "replay", "summary"),
                         [](const auto& script) { return std::string(script.param); });

}  // namespace
}  // namespace vx
