#include "platform/linux/recovery/ReplayInputs.h"

#include "platform/linux/execution/CauseScope.h"
#include "platform/linux/recovery/Records.h"

namespace vx::lnx {

ReplayInputs::ReplayInputs(const JournalContents& contents) {
  for (const JournalContents::Record& record : contents.records)
    if (!record.notes.empty()) noted_.emplace(record.call, &record);
}

std::optional<Payload> ReplayInputs::once(std::string_view what,
                                          const Function<std::optional<Payload>()>&) {
  const Cause cause = Cause::take();
  return find(cause.ticket.call(), cause.position.place, what);
}

bool ReplayInputs::decide(std::string_view what, bool) {
  const JournalTicket* const call = CauseScope::current();
  if (call == nullptr) return false;
  if (call->call() != decided_) {
    if (!find(call->call(), CauseScope::nextPlace(), what)) return false;
    decided_ = call->call();
  }
  return true;
}

std::optional<Payload> ReplayInputs::find(uint64_t call, uint32_t place,
                                          std::string_view what) const {
  const auto found = noted_.find(call);
  if (found == noted_.end()) return std::nullopt;
  for (const JournalContents::Note& note : found->second->notes) {
    if (note.kind != kInputNote) continue;
    std::optional<RecordedInput> input = readInput(note.bytes);
    if (input && input->place == place && input->what == what) return std::move(input->answer);
  }
  return std::nullopt;
}

}  // namespace vx::lnx
