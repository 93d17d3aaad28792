// The local store: one SQLite file, written by one thread, fed through one bounded queue.
#pragma once

#include <chrono>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "base/Clock.h"
#include "base/Function.h"
#include "platform/EventServices.h"
#include "platform/VyrReporting.h"
#include "platform/linux/store/StoreOptions.h"

namespace vx::lnx {

// Thread-safe. Owned by the platform. Appending never blocks and never drops: past its byte bound
// the store reports itself congested, and the listener stops reading from clients until it has
// drained.
class LocalStore {
 public:
  struct Counters {
    uint64_t rowsCommitted = 0;
    uint64_t commits = 0;
    uint64_t writeFailures = 0;
    uint64_t rowsLost = 0;  // only at an end with a store that cannot be written
  };

  // Opens or creates <state>/telemetry.db and locks <state>/telemetry.lock. Null and one clear
  // sentence in `problem` when another process has it or the folder cannot be used. The quick check
  // runs on the writer's thread before its first write, so start-up does not wait for it.
  static std::unique_ptr<LocalStore> open(const std::string& stateDirectory,
                                          const StoreOptions& options, Clock& clock,
                                          std::string& problem);
  virtual ~LocalStore() = default;

  // Starts the writer. Logs, so the platform must be installed; what is appended before is kept.
  virtual void start() = 0;

  virtual VyrReporting& relay() = 0;
  virtual AnalyticsEventService& analytics() = 0;
  virtual PowerEventLog& power() = 0;

  virtual bool isCongested() const = 0;  // cheap: one atomic load
  // Called on the writer's thread when a congested store has drained to half its bound. Set before
  // any traffic.
  virtual void setDrainedHandler(Function<void()> handler) = 0;
  // What startConfigurationWithCompletionHandler answers; the handler runs on the writer's thread.
  virtual void setBackends(std::vector<std::string> backends) = 0;

  // Commits what is queued and ends the writer. False when rows were lost because the store could
  // not be written by the deadline; counters() and the log say how many.
  virtual bool close(Monotonic deadline) = 0;
  virtual Counters counters() const = 0;
};

}  // namespace vx::lnx
