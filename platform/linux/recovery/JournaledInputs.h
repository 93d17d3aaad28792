// The recorded inputs of a process that serves: answers go to the journal.
#pragma once

#include "platform/RecordedInputs.h"
#include "platform/linux/journal/Journal.h"

namespace vx::lnx {

// Thread-safe. Owned by the platform. A question takes a place of its call (Cause::take), answered
// or not, by which a replay finds the answer again, whichever of the call's work asks first.
// Outside of a recorded call, and without a journal, it only asks.
class JournaledInputs final : public RecordedInputs {
 public:
  explicit JournaledInputs(Journal* journal) : journal_(journal) {}
  std::optional<Payload> once(std::string_view what,
                              const Function<std::optional<Payload>()>& source) override;
  bool decide(std::string_view what, bool now) override;
  void keepDelayed(const Payload& facts, const Payload& content, WorkCause& cause) override;

 private:
  Journal* const journal_;
  uint64_t decided_ = 0;  // the last call of which something was
};

}  // namespace vx::lnx
