// Whatever a service says: each call that was taken is answered once, and nothing hangs. With an
// odd first byte it is said in place of a greeting.
#include <sys/socket.h>
#include <unistd.h>

#include "client/ReportingClient.h"

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static constexpr uint8_t kHello[] = {3, 0, 0, 0, 0x82, 0, 1};
  int ends[2];
  if (size == 0 || size > 65536 || socketpair(AF_UNIX, SOCK_STREAM, 0, ends) != 0) return 0;
  const bool greets = (*data & 1) == 0;
  const auto sayAll = [&] {
    if (write(ends[0], data + 1, size - 1) < 0) __builtin_trap();
    shutdown(ends[0], SHUT_WR);
  };
  vx::ReportingClient client;
  if (!greets) sayAll();
  if (greets && write(ends[0], kHello, sizeof kHello) < 0) __builtin_trap();
  const bool connected = client.adopt(ends[1]).ok();
  if (greets && !connected) __builtin_trap();
  int waiting = 0;
  const auto made = [&](const vx::ClientStatus& taken) { waiting += taken.ok() ? 1 : 0; };
  const auto answered = [&](const auto&) { --waiting; };
  made(client.startReportingSession(1, answered));
  made(client.getServiceTypeAsync(1, answered));
  made(client.sendMessageAsync(vx::Payload(), 1, 1, answered));
  made(client.validateReporterAsync(1, answered));
  made(client.getAllReportersAsync(answered));
  if (greets) sayAll();
  while (client.isConnected()) (void)client.process();
  close(ends[0]);
  if (waiting != 0 || client.pendingCalls() != 0) __builtin_trap();
  return 0;
}
