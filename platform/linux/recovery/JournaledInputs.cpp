#include "platform/linux/recovery/JournaledInputs.h"

#include "platform/linux/execution/CauseScope.h"
#include "platform/linux/recovery/Records.h"

namespace vx::lnx {

std::optional<Payload> JournaledInputs::once(std::string_view what,
                                             const Function<std::optional<Payload>()>& source) {
  const Cause cause = Cause::take();
  std::optional<Payload> answer = source();
  if (answer && cause.ticket && journal_ != nullptr) {
    // One that finds no space is missing in a replay, as the calls after it are.
    (void)journal_->note(cause.ticket, kInputNote, writeInput(cause.position.place, what, *answer));
  }
  return answer;
}

}  // namespace vx::lnx
