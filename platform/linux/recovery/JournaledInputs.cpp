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

// One note for a call, however many sessions it reaches.
bool JournaledInputs::decide(std::string_view what, bool now) {
  const JournalTicket* const call = CauseScope::current();
  if (call == nullptr || journal_ == nullptr) return now;
  if (call->call() == decided_) return true;
  if (!now) return false;
  const std::vector<uint8_t> note = writeInput(CauseScope::nextPlace(), what, Payload());
  if (!journal_->note(*call, kInputNote, note).ok()) return false;
  decided_ = call->call();
  return true;
}

// Where there is no space the call waits with its work.
void JournaledInputs::keepDelayed(const Payload& facts, const Payload& content, WorkCause& cause) {
  auto& held = static_cast<HeldCause&>(cause);
  const JournalTicket& ticket = held.cause().ticket;
  if (journal_ == nullptr || !ticket) return;
  const std::vector<uint8_t> head = writeDelayed(held.cause().position, facts);
  Result<JournalAppended> appended =
      journal_->appendEnd({.kind = static_cast<uint8_t>(RecordKind::DelayedMessage),
                           .time = ticket.time(),
                           .connection = ticket.namedCall(),
                           .head = head,
                           .dictionary = content.validated(),
                           .forEarlier = true,
                           .user = ticket.user()});
  if (appended.ok()) held.moveTo(std::move(appended->ticket));
}

}  // namespace vx::lnx
