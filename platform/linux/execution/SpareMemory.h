// What the service has left when there is no memory.
#pragma once

namespace vx::lnx {

// Some MiB of addresses that nothing has touched. The first request for memory that cannot be met
// gives them up and fails; what follows from that (an answer, a line of the log) is small and can
// be met. One per process; thread-safe.
class SpareMemory {
 public:
  // Sees to it that there is some, again and again: cheap while there is.
  static void keep();
};

}  // namespace vx::lnx
