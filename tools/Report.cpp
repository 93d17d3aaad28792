// vxreport: talks to the service from a shell. `vxreport help` lists the commands; `vxreport
// script` reads them from standard input, one a line, over one connection.
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <iostream>
#include <limits>
#include <sstream>
#include <string>
#include <vector>

#include "client/ReportingClient.h"
#include "platform/linux/ConfigurationCheck.h"
#include "platform/linux/PlatformConfiguration.h"

namespace {

using vx::PayloadBuilder;
using Words = std::vector<std::string>;

constexpr const char* kHelp =
    "commands:\n"
    "  create ID                     a reporting session\n"
    "  type ID SERVICE_TYPE          0 generic, 2 telephony, 3 haptics, 4 alarms, 7 longformaudio "
    "...\n"
    "  configure ID KEY=VALUE...     for example HostApplicationDisplayID=com.example.app\n"
    "  start ID                      answered when the session stops\n"
    "  send CATEGORY TYPE KEY=VALUE...           to every started session; CATEGORY such as "
    "0x08000005\n"
    "  sendto ID[,ID...] CATEGORY TYPE KEY=VALUE...\n"
    "  stop ID / destroy ID / validate ID / service ID\n"
    "  reporters                     every client's sessions\n"
    "  kill                          ends the service\n"
    "  script                        reads commands from standard input over one connection\n"
    "  check-config [FOLDER]         what is wrong in platform.toml and the preferences; asks no "
    "service\n"
    "values: true, false, whole and floating numbers, everything else is text\n"
    "the socket: $VXREPORTING_SOCKET, or /run/vxreporting/service.socket\n";

class UsageError : public std::exception {};

int64_t number(const std::string& text) {
  char* end = nullptr;
  errno = 0;
  const long long value = std::strtoll(text.c_str(), &end, 0);
  if (end == text.c_str() || *end != '\0' || errno == ERANGE) throw UsageError();
  return value;
}

// A code of the service: a service type, a category or a message type.
template <class Code>
Code codeOf(const std::string& text) {
  const int64_t value = number(text);
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
  if (command == "create") return answered(client.createReportingSession(number(at(words, 1))));
  if (command == "type") {
    return answered(client.setServiceType(codeOf<uint16_t>(at(words, 2)), number(at(words, 1))));
  }
  if (command == "configure")
    return answered(client.setConfiguration(payload(words, 2), number(at(words, 1))));
  if (command == "start") {
    const std::string id = at(words, 1);
    return report(client.startReportingSession(
                      number(id),
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
    for (std::string id; std::getline(list, id, ',');) ids.push_back(number(id));
    return report(client.sendMessage(payload(words, 4), codeOf<uint32_t>(at(words, 2)),
                                     codeOf<uint16_t>(at(words, 3)), ids),
                  "taken");
  }
  if (command == "stop") return answered(client.stopReportingSession(number(at(words, 1))));
  if (command == "destroy") return answered(client.destroyReportingSession(number(at(words, 1))));
  if (command == "service") {
    const auto result = client.getServiceType(number(at(words, 1)));
    return report(result.status, std::to_string(result.value));
  }
  if (command == "validate") {
    const auto result = client.validateReporter(number(at(words, 1)));
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

// 0: nothing is wrong; 1: something is.
int checkConfig(const Words& words) {
  if (words.size() > 2) throw UsageError();
  const std::string folder =
      words.size() > 1 ? words[1] : vx::lnx::Directories::fromEnvironment().configuration;
  std::error_code unknown;
  if (!std::filesystem::is_directory(folder, unknown)) {
    std::fprintf(stderr, "vxreport: %s is not a folder; every key would have its default\n",
                 folder.c_str());
    return 1;
  }
  const std::vector<std::string> complaints = vx::lnx::checkConfiguration(folder);
  for (const std::string& complaint : complaints) std::fprintf(stderr, "%s\n", complaint.c_str());
  if (complaints.empty()) std::printf("nothing is wrong in %s\n", folder.c_str());
  return complaints.empty() ? 0 : 1;
}

}  // namespace

int main(int argc, char** argv) {
  std::setvbuf(stdout, nullptr, _IOLBF,
               0);  // a script's answers come one by one, through a pipe too
  const Words words(argv + 1, argv + argc);
  if (words.empty() || words[0] == "help" || words[0] == "--help") {
    std::fputs(kHelp, words.empty() ? stderr : stdout);
    return words.empty() ? 2 : 0;
  }
  try {
    if (words[0] == "check-config") return checkConfig(words);
    vx::ReportingClient client;
    if (const vx::ClientStatus status = client.connect(); !status.ok()) return report(status, "");
    const int status = words[0] == "script" ? runScript(client) : run(client, words);
    if (client.isConnected()) (void)client.goodbye();
    return status;
  } catch (const UsageError&) {
    std::fputs(kHelp, stderr);
    return 2;
  }
}
