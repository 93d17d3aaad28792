// The running service's account of itself, its sessions and the messages that pass.
#include <unistd.h>

#include <algorithm>
#include <cctype>
#include <chrono>
#include <cstdio>
#include <ctime>
#include <functional>
#include <map>
#include <sstream>
#include <string>
#include <thread>

#include "propertylist/JsonWriter.h"
#include "tools/report/AccountText.h"
#include "tools/report/Command.h"
#include "tools/report/InspectClient.h"

namespace vx::report {

namespace {

using Operation = wire::InspectOperation;
using Rows = std::vector<std::vector<std::string>>;

void print(const std::string& text) { std::fwrite(text.data(), 1, text.size(), stdout); }

void printJsonLine(const Payload& payload) {
  std::string line;
  appendJson(line, payload);
  print(line + "\n");
}

std::string field(const Payload& facts, std::string_view key) {
  const auto value = facts.find(key);
  if (!value) return "-";
  if (value->kind() == ValueKind::Date) return utcText(value->asDouble());
  if (value->kind() == ValueKind::Boolean) return value->asBool() ? "yes" : "no";
  const std::string text = printable(value->text());
  return text.empty() ? "-" : text;
}

void printTable(const std::vector<std::string>& keys, const std::vector<Payload>& lines) {
  Rows rows = {keys};
  for (std::string& title : rows[0]) {
    for (char& c : title) c = c == '_' ? ' ' : static_cast<char>(std::toupper(c));
  }
  for (const Payload& line : lines) {
    rows.emplace_back();
    for (const std::string& key : keys) rows.back().push_back(field(line, key));
  }
  print(tableText(rows));
}

int printStatus(const Words& words) {
  const Options options(words, {"--json", "--metrics"});
  (void)options.words(0, 0);
  if (options.has("--json") && options.has("--metrics")) throw UsageError();
  InspectClient client;
  const Payload account = client.call(Operation::Status);
  std::string text;
  if (options.has("--json")) {
    appendPrettyJson(text, account, 0);
    text += "\n";
  } else {
    text = options.has("--metrics") ? metricsText(account) : statusText(account);
  }
  print(text);
  return 0;
}

int printList(const Words& words, Operation operation, const char* key,
              const std::vector<std::string>& columns) {
  const Options options(words, {"--json"});
  (void)options.words(0, 0);
  InspectClient client;
  const std::vector<Payload> lines = client.all(operation, key);
  if (options.has("--json")) {
    for (const Payload& line : lines) printJsonLine(line);
  } else {
    printTable(columns, lines);
  }
  return 0;
}

const std::vector<std::string> kSessionColumns = {
    "session", "pid",   "process",  "service_type", "application",
    "started", "since", "messages", "bytes_held",   "relay"};

int printConnections(const Words& words) {
  return printList(words, Operation::Connections, "connections",
                   {"pid", "user", "process", "since", "sessions", "calls_in_flight",
                    "unread_reply_bytes", "reading_paused"});
}

int printSessions(const Words& words) {
  return printList(words, Operation::Sessions, "sessions", kSessionColumns);
}

int printSession(const Words& words) {
  const Options options(words, {"--json"});
  const int64_t id = numberOf(options.words(1, 1)[0]);
  InspectClient client;
  const Payload answer = client.callOn(Operation::Session, id);
  const auto found = answer.find("sessions");
  if (!found || found->asArray().empty())
    throw Failure("nobody has a session " + std::to_string(id));
  for (const Value& session : found->asArray()) {
    std::string text;
    if (options.has("--json"))
      appendJson(text, session);
    else
      appendPrettyJson(text, session, 0);
    print(text + "\n");
  }
  return 0;
}

// ---------------------------------------------------------------------------------------------------------------------
// What changes

constexpr std::size_t kMostSessionsOnTop = 20;

std::string topText(const Payload& before, const Payload& now,
                    std::map<std::string, double>& messagesBefore,
                    const std::vector<Payload>& sessions) {
  std::map<std::string, double> messages;
  std::vector<std::pair<double, const Payload*>> busiest;
  for (const Payload& session : sessions) {
    const std::string key = field(session, "pid") + " " + field(session, "session");
    const auto count = session.find("messages");
    messages[key] = count ? count->asDouble() : 0;
    const auto known = messagesBefore.find(key);
    busiest.emplace_back(messages[key] - (known != messagesBefore.end() ? known->second : 0),
                         &session);
  }
  std::ranges::stable_sort(busiest, std::greater(), &std::pair<double, const Payload*>::first);
  const std::size_t listed = std::min(busiest.size(), kMostSessionsOnTop);
  Rows rows = {{"SESSION", "PID", "PROCESS", "SERVICE TYPE", "APPLICATION", "NEW", "MESSAGES",
                "BYTES HELD", "RELAY"}};
  for (std::size_t i = 0; i < listed; ++i) {
    const Payload& s = *busiest[i].second;
    rows.push_back({field(s, "session"), field(s, "pid"), field(s, "process"),
                    field(s, "service_type"), field(s, "application"),
                    std::to_string(static_cast<int64_t>(busiest[i].first)), field(s, "messages"),
                    field(s, "bytes_held"), field(s, "relay")});
  }
  messagesBefore = std::move(messages);
  const auto lag = now.find("durability");
  std::string text = utcText(static_cast<double>(std::time(nullptr))) + " UTC, " +
                     std::to_string(sessions.size()) + " sessions, commit lag " +
                     (lag ? field(Payload::copyOf(*lag), "commit_lag_ms") : "-") + " ms\n\n" +
                     ratesText(before, now) + "\n" + tableText(rows);
  if (listed < busiest.size()) text += "and " + std::to_string(busiest.size() - listed) + " more\n";
  return text;
}

int showTop(const Words& words) {
  const Options options(words, {"--interval=", "--count="});
  (void)options.words(0, 0);
  const int64_t interval = numberOf(options.value("--interval").value_or("2"));
  int64_t left = numberOf(options.value("--count").value_or("-1"));
  if (interval < 1 || interval > 86400) throw UsageError();
  const bool terminal = isatty(STDOUT_FILENO) == 1;
  InspectClient client;
  Payload before = client.call(Operation::Status);
  std::map<std::string, double> messages;
  (void)topText(before, before, messages, client.all(Operation::Sessions, "sessions"));
  while (left != 0) {
    std::this_thread::sleep_for(std::chrono::seconds(interval));
    const Payload now = client.call(Operation::Status);
    const std::string text =
        topText(before, now, messages, client.all(Operation::Sessions, "sessions"));
    print((terminal ? "\033[H\033[2J" : "") + text + (terminal ? "" : "\n"));
    if (std::fflush(stdout) != 0) return 1;
    before = now;
    if (left > 0) --left;
  }
  return 0;
}

void printMessage(const Payload& message) {
  const auto time = message.find("time");
  std::string line = time ? utcText(time->asDouble(), true).substr(11) : "-";
  line += " " + field(message, "fate") + " session " + field(message, "session") + " " +
          field(message, "service_type") + " " + field(message, "kind") + " ";
  if (const auto payload = message.find("message"))
    appendJson(line, *payload);
  else
    line += "(" + field(message, "message_left_out_bytes") + " bytes)";
  print(printable(line) + "\n");
}

int followMessages(const Words& words) {
  const Options options(words, {"--session=", "--category=", "--count=", "--json"});
  (void)options.words(0, 0);
  const int64_t session = numberOf(options.value("--session").value_or("0"));
  std::vector<int64_t> categories;
  std::stringstream list(options.value("--category").value_or(""));
  for (std::string category; std::getline(list, category, ',');)
    categories.push_back(numberOf(category));
  int64_t left = numberOf(options.value("--count").value_or("-1"));
  InspectClient client;
  client.waitForEver();
  while (left != 0) {
    const Payload told = client.call(Operation::Follow, 2, [&](CborWriter& items) {
      items.integer(session);
      if (categories.empty()) return items.null();
      items.array(categories.size());
      for (const int64_t category : categories) items.integer(category);
    });
    const auto messages = told.find("messages");
    for (const Value& each : messages ? messages->asArray() : ArrayView()) {
      if (left == 0) break;
      const Payload message = Payload::copyOf(each);
      options.has("--json") ? printJsonLine(message) : printMessage(message);
      if (left > 0) --left;
    }
    if (std::fflush(stdout) != 0) return 1;
    if (const auto missed = told.find("left_out"); missed && missed->asInt64() > 0) {
      std::fprintf(stderr, "vxreport: %lld messages came too fast and are left out\n",
                   static_cast<long long>(missed->asInt64()));
    }
  }
  return 0;
}

constexpr Command kCommands[] = {
    {"status", "[--json|--metrics]", "how the service is",
     "Version, uptime, queues, durability, the store, and what was accepted, relayed, stored,\n"
     "refused and left out, by cause; rates are means since the start.\n\n"
     "  --json       all of it, with the configuration in force\n"
     "  --metrics    in the text format that Prometheus reads\n" VX_INSPECT_HELP,
     printStatus},
    {"top", "[--interval SECONDS] [--count N]", "what moves, again and again",
     "Counters per second and the busiest sessions, every 2 seconds or as given, N times or until\n"
     "it is interrupted.\n" VX_INSPECT_HELP,
     showTop},
    {"connections", "[--json]", "the clients that are connected",
     "One line a client; --json: one JSON object a line.\n" VX_INSPECT_HELP, printConnections},
    {"sessions", "[--json]", "the sessions that there are",
     "One line a session; --json: one JSON object a line.\n" VX_INSPECT_HELP, printSessions},
    {"session", "ID [--json]", "one session in full",
     "Its messages by kind, its configuration, and what became of its messages since the last\n"
     "start, as JSON: everybody's session of that identifier, one after the "
     "other.\n" VX_INSPECT_HELP,
     printSession},
    {"tail", "[--session ID] [--category N[,N...]] [--count N] [--json]", "messages as they pass",
     "One line a message that is routed, until it is interrupted or N have come. The service does\n"
     "not wait for it: what comes too fast (2560 a second) is left out, and how many is said.\n\n"
     "  --category N   such as 0x08000005\n" VX_INSPECT_HELP,
     followMessages},
};

}  // namespace

std::span<const Command> inspectCommands() { return kCommands; }

}  // namespace vx::report
