// The platform on which recorded calls are run again.
#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Platform.h"

namespace vx::lnx {

// The running platform, but: the time is the recorded one, what was learned from outside is what
// was recorded, nobody is asked or watched, nothing is waited for, and what a call did that was
// done does not happen again. Thread-safe, as what it stands for is. Must outlive the work that the
// replay leaves behind.
class ReplayPlatform {
 public:
  // `backends`: the relay's. `live` and `inputs` outlive it.
  ReplayPlatform(Platform& live, std::vector<std::string> backends, RecordedInputs& inputs);
  ~ReplayPlatform();
  ReplayPlatform(const ReplayPlatform&) = delete;
  ReplayPlatform& operator=(const ReplayPlatform&) = delete;

  Platform& services();
  // Queues what the service registered for that notification.
  void notify(std::string_view name);

 private:
  struct Parts;
  const std::unique_ptr<Parts> parts_;
};

}  // namespace vx::lnx
