// What the service learns from outside while it serves a call, besides the call.
#pragma once

#include <optional>
#include <string_view>

#include "base/Function.h"
#include "platform/WorkQueue.h"
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
  // A decision that rests on what no later process can know: how it falls `now`. The first time
  // that it is true is recorded with the call, false where that cannot be, and then it is true for
  // the rest of the call. Where that call is run again: how it fell then. Takes no place of the
  // call, so it may be left unasked; on the service queue, about one `what`.
  virtual bool decide(std::string_view /*what*/, bool now) { return now; }
  // Records work that waits for long as a call of its own, so that the one that it goes back to
  // need not be kept for it. The work keeps its name. Again: in the place of the record before.
  virtual void keepDelayed(const Payload& /*facts*/, const Payload& /*content*/,
                           WorkCause& /*cause*/) {}
};

}  // namespace vx
