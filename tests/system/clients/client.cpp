// As client.c, by the C++ interface.
#include <cstdlib>
#include <iostream>
#include <string>

#include "client/ReportingClient.h"

int main(int argc, char** argv) {
  const int64_t id = argc > 1 ? std::atoll(argv[1]) : 0;
  vx::ReportingClient::Options options;
  options.keepSessions = true;
  vx::ReportingClient client(options);
  if (!client.connect().ok()) return 1;
  client.createReportingSession(id);
  client.setServiceType(2, id);
  client.startReportingSession(id, [](const auto&) {});
  for (std::string line; std::getline(std::cin, line);) {
    const vx::Payload message = vx::PayloadBuilder().set("gain", 0.5).build();
    const vx::ClientStatus sent = client.sendMessage(message, 5, 2, {id});
    std::cout << (sent.ok() ? "accepted" : sent.text) << std::endl;
  }
  client.stopReportingSession(id);
  return client.goodbye().ok() ? 0 : 1;
}
