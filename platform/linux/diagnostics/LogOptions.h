// What the system log may be told.
#pragma once

#include <cstdint>
#include <string>

namespace vx::lnx {

struct LogOptions {
  enum class Destination { Auto, Journal, Stderr };
  // Lines below it are not written (verbose ones always are).
  enum class Level { Debug, Info, Default, Error };
  Destination destination = Destination::Auto;
  Level level = Level::Default;
  uint32_t burst = 100;         // lines of one log statement at once; 0: no limit
  double refillPerSecond = 10;  // and how fast its allowance comes back
  std::string journalSocket = "/run/systemd/journal/socket";
};

}  // namespace vx::lnx
