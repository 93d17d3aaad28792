// Where the endpoint records what reaches the service.
#pragma once

#include <sys/types.h>

#include <cstddef>
#include <cstdint>
#include <optional>

#include "platform/linux/journal/JournalTicket.h"
#include "propertylist/Payload.h"

namespace vx::lnx {

// Asked on the interactive thread, in the order in which work reaches the service queue, right
// before that work is queued. This one records nothing.
class CallRecorder {
 public:
  // What a connection is known by when it is not recorded; neither is anything that it does.
  static constexpr uint64_t kUnrecorded = 0;

  enum class End : uint8_t { Interrupted, Orderly, ServiceStopped };
  struct Accepted {
    uint64_t connection = kUnrecorded;  // never the same twice, in whatever process
    JournalTicket ticket;
  };
  struct Called {
    JournalTicket ticket;
    std::optional<Payload> dictionary;  // the call's, where it was recorded
  };

  virtual ~CallRecorder() = default;
  virtual Accepted accepted(pid_t /*pid*/, uid_t /*uid*/) { return {}; }
  // A checked call. `dictionary`: which of the frame's elements is one.
  virtual Called called(uint64_t /*connection*/, const Frame& /*call*/,
                        std::optional<std::size_t> /*dictionary*/) {
    return {};
  }
  // Before the connection's handlers run.
  virtual JournalTicket ended(uint64_t /*connection*/, End /*how*/) { return {}; }
};

}  // namespace vx::lnx
