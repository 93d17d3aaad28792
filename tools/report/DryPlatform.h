// The platform on which a message is tried out: the service's own code runs, nothing leaves it.
#pragma once

#include <cstdint>
#include <memory>
#include <string>
#include <utility>
#include <vector>

#include "platform/Platform.h"

namespace vx::report {

// What would have left.
struct DryOutcome {
  struct Relayed {
    uint16_t category;
    uint16_t type;
    Payload payload;
  };
  std::vector<Relayed> relayed;
  std::vector<std::pair<std::string, Payload>> events;
  std::vector<std::pair<std::string, Payload>> powerRecords;
  std::vector<std::string> lines;  // of the log
};

// Installed for as long as it lives; one at a time, on one thread. There are relay back ends, no
// drivers, no orientation, no preferences, and the build is not an internal one. Keeps what it
// outlives: as much as the few messages that are tried out.
class DryPlatform {
 public:
  DryPlatform();
  ~DryPlatform();
  DryPlatform(const DryPlatform&) = delete;
  DryPlatform& operator=(const DryPlatform&) = delete;

  // Does the queued work, and what it queues; what has left since the last time.
  DryOutcome take();

 private:
  struct Parts;
  const std::unique_ptr<Parts> parts_;
};

}  // namespace vx::report
