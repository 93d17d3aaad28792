// The platform of this process on Linux: every service, made from the environment and
// platform.toml, and its end.
#pragma once

#include <memory>
#include <string>

#include "base/Function.h"
#include "platform/Platform.h"

namespace vx::lnx {

// Owned by main, on the interactive thread. start() and shutDown() bracket the life of every other
// thread.
class LinuxPlatform {
 public:
  // Null and one clear sentence in `problem` when the service cannot start (directories, locks,
  // socket).
  static std::unique_ptr<LinuxPlatform> start(std::string& problem);
  virtual ~LinuxPlatform() = default;

  virtual Platform& services() = 0;

  // Starts what works in the background. The services must be installed.
  virtual void begin() = 0;

  // Finishes what a process before this one had accepted, if it did not. `makeDelegate` makes the
  // service that does it, which is gone when this returns. After begin().
  virtual void recover(
      const Function<std::shared_ptr<ServiceListenerDelegate>()>& makeDelegate) = 0;

  // After the listener's resume has returned: drains the relay queues, commits the store and ends
  // all threads, within five seconds of the request to end, or longer while rows are still being
  // committed. What is not committed then moves to the state folder, as journal, for the next
  // start. The exit status: 0, or 1 when something accepted is lost.
  virtual int shutDown() = 0;
};

}  // namespace vx::lnx
