#include "platform/linux/recovery/JournalRecorder.h"

#include <array>
#include <chrono>

#include "platform/linux/recovery/Records.h"
#include "wire/Operations.h"
#include "wire/Protocol.h"

namespace vx::lnx {

namespace {

constexpr std::size_t kMostHeadKept = 4096;

RecordKind kindOf(const Frame& call) {
  switch (static_cast<wire::Operation>(call[wire::kCallHead - 1].asInt64())) {
    case wire::Operation::StopReportingSessionForID:
      return RecordKind::StopCall;
    case wire::Operation::DestroyReportingSession:
      return RecordKind::DestroyCall;
    default:
      return RecordKind::Call;
  }
}

RecordKind kindOf(CallRecorder::End how) {
  switch (how) {
    case CallRecorder::End::Interrupted:
      return RecordKind::EndedInterrupted;
    case CallRecorder::End::Orderly:
      return RecordKind::EndedOrderly;
    case CallRecorder::End::ServiceStopped:
      break;
  }
  return RecordKind::EndedServiceStopped;
}

}  // namespace

CallRecorder::Accepted JournalRecorder::accepted(pid_t pid, uid_t uid) {
  std::array<uint8_t, kAcceptedHeadBytes> head;
  writeAccepted({pid, uid}, head);
  JournalAppended appended = append(RecordKind::Accepted, kUnrecorded, head, {}, Must::Always, uid);
  if (appended.ticket) users_[appended.call] = uid;
  return {appended.call, std::move(appended.ticket)};
}

CallRecorder::Called JournalRecorder::called(uint64_t connection, const Frame& call,
                                             std::optional<std::size_t> dictionary) {
  writeCall(call, dictionary, head_);
  std::optional<Payload::Validated> bytes;
  if (dictionary) bytes = call.validated(*dictionary);
  const RecordKind kind = kindOf(call);
  // A session that is found open would end a second time.
  const Must must = kind == RecordKind::Call ? Must::WithinShare : Must::Always;
  JournalAppended appended = append(kind, connection, head_, bytes, must);
  if (head_.capacity() > kMostHeadKept) [[unlikely]]
    head_ = {};
  Called called{std::move(appended.ticket), std::nullopt};
  if (called.ticket && dictionary) called.dictionary = std::move(appended.dictionary);
  return called;
}

JournalTicket JournalRecorder::ended(uint64_t connection, End how) {
  JournalTicket ticket = append(kindOf(how), connection, {}, {}, Must::Always).ticket;
  users_.erase(connection);
  return ticket;
}

JournalTicket JournalRecorder::preferencesChanged(std::string_view notification) {
  const auto* const bytes = reinterpret_cast<const uint8_t*>(notification.data());
  return append(RecordKind::PreferencesChanged, kUnrecorded, {bytes, notification.size()}, {},
                Must::Always)
      .ticket;
}

JournalAppended JournalRecorder::append(RecordKind kind, uint64_t connection,
                                        std::span<const uint8_t> head,
                                        const std::optional<Payload::Validated>& dictionary,
                                        Must must, uint32_t user) {
  if (!time_) time_ = std::chrono::duration<double>(clock_.now().time_since_epoch()).count();
  const JournalRecord record{.kind = static_cast<uint8_t>(kind),
                             .time = *time_,
                             .connection = connection,
                             .head = head,
                             .dictionary = dictionary,
                             .user = user != kNoUser ? user : userOf(connection)};
  Result<JournalAppended> appended =
      must == Must::Always ? journal_.appendEnd(record) : journal_.append(record);
  if (!appended.ok()) [[unlikely]] {
    countUnrecorded(appended.status());
    return {};
  }
  ++counters_.recorded;
  if (record.user != kNoUser)
    shares_.add(record.user, bodyOffset(head.size()) + (dictionary ? dictionary->bytes.size() : 0));
  return std::move(appended).value();
}

uint32_t JournalRecorder::userOf(uint64_t connection) const {
  const auto found = users_.find(connection);
  return found == users_.end() ? kNoUser : found->second;
}

void JournalRecorder::countUnrecorded(const Status& why) {
  ++counters_.unrecorded;
  if (unrecorded_) unrecorded_(why);
}

}  // namespace vx::lnx
