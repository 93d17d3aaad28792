// Calls of the running service, as a client makes them; `vxreport script` reads them from standard
// input, one a line, over one connection.
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <iostream>
#include <limits>
#include <sstream>
#include <string>
#include <vector>

#include "client/ReportingClient.h"
#include "tools/report/Command.h"

namespace vx::report {

namespace {

// A code of the service: a service type, a category or a message type.
template <class Code>
Code codeOf(const std::string& text) {
  const int64_t value = numberOf(text);
  if (value < 0 || value > int64_t{std::numeric_limits<Code>::max()}) throw UsageError();
  return static_cast<Code>(value);
}

vx::Payload payload(const Words& words, std::size_t from) {
  PayloadBuilder builder;
  for (std::size_t i = from; i < words.size(); ++i) {
    const std::size_t equals = words[i].find('=');
    if (equals == std::string::npos) throw UsageError();
    const std::string key = words[i].substr(0, equals);
    const std::string value = words[i].substr(equals + 1);
    char* end = nullptr;
    errno = 0;
    if (value == "true" || value == "false") {
      builder.set(key, value == "true");
    } else if (const long long whole = std::strtoll(value.c_str(), &end, 10);
               !value.empty() && *end == '\0' && errno != ERANGE) {
      builder.set(key, int64_t{whole});
    } else if (const double real = std::strtod(value.c_str(), &end);
               !value.empty() && *end == '\0') {
      builder.set(key, real);
    } else {
      builder.set(key, value);
    }
  }
  return builder.build();
}

int report(const vx::ClientStatus& status, const std::string& answer) {
  if (status.ok())
    std::printf("%s\n", answer.c_str());
  else
    std::fprintf(stderr, "vxreport: %s\n", status.text.c_str());
  return status.ok() ? 0 : 1;
}

int answered(const vx::ClientResult<bool>& result) {
  return report(result.status, result.value ? "true" : "false");
}

const std::string& at(const Words& words, std::size_t i) {
  if (i >= words.size()) throw UsageError();
  return words[i];
}

int run(vx::ReportingClient& client, const Words& words) {
  const std::string& command = at(words, 0);
  if (command == "create") return answered(client.createReportingSession(numberOf(at(words, 1))));
  if (command == "type") {
    return answered(client.setServiceType(codeOf<uint16_t>(at(words, 2)), numberOf(at(words, 1))));
  }
  if (command == "configure")
    return answered(client.setConfiguration(payload(words, 2), numberOf(at(words, 1))));
  if (command == "start") {
    const std::string id = at(words, 1);
    return report(client.startReportingSession(
                      numberOf(id),
                      [id](const auto& result) {
                        std::printf("session %s: %s\n", id.c_str(),
                                    result.ok() ? "ended" : result.status.text.c_str());
                      }),
                  "started; answered when it stops");
  }
  if (command == "send") {
    return report(client.sendMessage(payload(words, 3), codeOf<uint32_t>(at(words, 1)),
                                     codeOf<uint16_t>(at(words, 2))),
                  "taken");
  }
  if (command == "sendto") {
    std::vector<int64_t> ids;
    std::stringstream list(at(words, 1));
    for (std::string id; std::getline(list, id, ',');) ids.push_back(numberOf(id));
    return report(client.sendMessage(payload(words, 4), codeOf<uint32_t>(at(words, 2)),
                                     codeOf<uint16_t>(at(words, 3)), ids),
                  "taken");
  }
  if (command == "stop") return answered(client.stopReportingSession(numberOf(at(words, 1))));
  if (command == "destroy") return answered(client.destroyReportingSession(numberOf(at(words, 1))));
  if (command == "service") {
    const auto result = client.getServiceType(numberOf(at(words, 1)));
    return report(result.status, std::to_string(result.value));
  }
  if (command == "validate") {
    const auto result = client.validateReporter(numberOf(at(words, 1)));
    return report(result.status, "reporterID=" + std::to_string(result.value.reporterID) +
                                     " serviceType=" + std::to_string(result.value.serviceType));
  }
  if (command == "reporters") {
    const auto result = client.getAllReporters();
    std::string text;
    for (const int64_t id : result.value) text += (text.empty() ? "" : " ") + std::to_string(id);
    return report(result.status, text);
  }
  if (command == "kill") return report(client.killService(), "asked the service to end");
  throw UsageError();
}

int runScript(vx::ReportingClient& client) {
  int worst = 0;
  for (std::string line; std::getline(std::cin, line);) {
    std::stringstream stream(line);
    Words words;
    for (std::string word; stream >> word;) words.push_back(word);
    if (words.empty() || words[0][0] == '#') continue;
    try {
      worst |= run(client, words);
    } catch (const UsageError&) {
      std::fprintf(stderr, "vxreport: cannot use: %s\n", line.c_str());
      worst = 2;
    }
  }
  return worst;
}

int callService(const Words& words) {
  vx::ReportingClient client;
  if (const vx::ClientStatus status = client.connect(); !status.ok()) return report(status, "");
  const int status = words[0] == "script" ? runScript(client) : run(client, words);
  if (client.isConnected()) (void)client.goodbye();
  return status;
}

#define VX_SOCKET_HELP "The socket: $VXREPORTING_SOCKET, or /run/vxreporting/service.socket.\n"
#define VX_PAIRS_HELP "Values are true, false, whole or floating numbers; all else is text.\n"
constexpr Command kCommands[] = {
    {"create", "ID", "a reporting session",
     "Creates a session of that identifier.\n" VX_SOCKET_HELP, callService},
    {"type", "ID SERVICE_TYPE", "its service type",
     "0 generic, 2 telephony, 3 haptics, 4 alarms, 7 longformaudio, 8 nonlongformaudio, 10 "
     "alerts,\n"
     "12 apiusage.\n" VX_SOCKET_HELP,
     callService},
    {"configure", "ID KEY=VALUE...", "its configuration",
     "For example HostApplicationDisplayID=com.example.app.\n" VX_PAIRS_HELP VX_SOCKET_HELP,
     callService},
    {"start", "ID", "answered when the session stops", "Starts a session.\n" VX_SOCKET_HELP,
     callService},
    {"send", "CATEGORY TYPE KEY=VALUE...", "a message to every started session",
     "CATEGORY such as 0x08000005.\n" VX_PAIRS_HELP VX_SOCKET_HELP, callService},
    {"sendto", "ID[,ID...] CATEGORY TYPE KEY=VALUE...", "a message to the listed sessions",
     "CATEGORY such as 0x08000005.\n" VX_PAIRS_HELP VX_SOCKET_HELP, callService},
    {"stop", "ID", "a session, with its summary", "Stops a session.\n" VX_SOCKET_HELP, callService},
    {"destroy", "ID", "a session", "Destroys a session.\n" VX_SOCKET_HELP, callService},
    {"service", "ID", "its service type's number",
     "65535 when nobody has that session.\n" VX_SOCKET_HELP, callService},
    {"validate", "ID", "whether there is such a session",
     "Its identifier and service type; 0 and 65535 when nobody has it.\n" VX_SOCKET_HELP,
     callService},
    {"reporters", "", "every client's sessions", "Their identifiers.\n" VX_SOCKET_HELP,
     callService},
    {"kill", "", "ends the service", "For users whom kill_allowed_users names.\n" VX_SOCKET_HELP,
     callService},
    {"script", "", "commands from standard input, over one connection",
     "One of the calls above a line; lines that begin with # are left out.\n" VX_SOCKET_HELP,
     callService},
};

}  // namespace

std::span<const Command> serviceCommands() { return kCommands; }

}  // namespace vx::report
