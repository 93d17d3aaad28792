// What the service learns from outside while it serves a call, besides the call.
#pragma once

#include <optional>
#include <string_view>

#include "base/Function.h"
#include "propertylist/Payload.h"

namespace vx {

// A call that is run again after a crash must find what it found the first time: a process name, a
// counter, a random number. Thread-safe.
class RecordedInputs {
 public:
  virtual ~RecordedInputs() = default;
  // Asks the source, before it returns, and records the answer with the call that the caller works
  // for. Where that call is run again: the answer from then, none where there was none, and the
  // source is never asked. `what` is a literal that names the question.
  virtual std::optional<Payload> once(std::string_view what,
                                      const Function<std::optional<Payload>()>& source) = 0;
};

}  // namespace vx
