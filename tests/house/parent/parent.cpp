// Somebody else's program, with somebody else's idea of warnings.
#include "client/ReportingClient.h"

static void neverCalled() {}

int main(int count, char**) {
  unsigned unused = (unsigned)count;
  int shadowed = 0;
  for (int shadowed = 0; shadowed < unused; ++shadowed) {
  }
  vx::ReportingClient client;
  const bool connected = client.connect("/nonexistent/service.socket").ok();
  return connected || vx::PayloadBuilder().set("gain", 0.5).build().empty();
}
