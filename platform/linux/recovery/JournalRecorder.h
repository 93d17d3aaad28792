// Records in the journal what reaches the service, in the order in which it does.
#pragma once

#include <cstdint>
#include <optional>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "base/Clock.h"
#include "base/Function.h"
#include "platform/linux/ipc/CallRecorder.h"
#include "platform/linux/journal/Journal.h"
#include "platform/linux/journal/RecordKind.h"
#include "platform/linux/recovery/JournalShares.h"

namespace vx::lnx {

// Owned by the platform; used on the interactive thread. Connections are not read while the journal
// has no capacity. What cannot be recorded even so (the file system takes no more) runs unrecorded,
// which is counted. A connection that could not be recorded stays so, with its calls: without it
// they could not be run again.
class JournalRecorder final : public CallRecorder {
 public:
  struct Counters {
    uint64_t recorded = 0;
    uint64_t unrecorded = 0;  // calls, connections and their ends
  };

  JournalRecorder(Journal& journal, Clock& clock) : journal_(journal), clock_(clock) {}
  // Told about each that is not recorded, and why.
  void setUnrecordedHandler(Function<void(const Status& why)> handler) {
    unrecorded_ = std::move(handler);
  }

  Accepted accepted(pid_t pid, uid_t uid) override;
  Called called(uint64_t connection, const Frame& call,
                std::optional<std::size_t> dictionary) override;
  JournalTicket ended(uint64_t connection, End how) override;
  // Calls of one pass of the event loop bear one time: to ask for it costs as much as to copy a
  // message.
  void endPass() { time_.reset(); }
  // Before the notification is queued.
  JournalTicket preferencesChanged(std::string_view notification);

  const Counters& counters() const { return counters_; }
  JournalShares& shares() { return shares_; }
  const JournalShares& shares() const { return shares_; }

 private:
  // Half of what calls may fill.
  static constexpr std::size_t kMostShared = std::size_t{24} << 20;
  // Calls wait in their sockets while there is no capacity; what else happens cannot.
  enum class Must : uint8_t { WithinShare, Always };
  JournalAppended append(RecordKind kind, uint64_t connection, std::span<const uint8_t> head,
                         const std::optional<Payload::Validated>& dictionary = {},
                         Must must = Must::WithinShare, uint32_t user = kNoUser);
  uint32_t userOf(uint64_t connection) const;
  void countUnrecorded(const Status& why);

  Journal& journal_;
  Clock& clock_;
  Function<void(const Status&)> unrecorded_;
  Counters counters_;
  JournalShares shares_{kMostShared};
  std::unordered_map<uint64_t, uint32_t> users_;  // of the connections that are recorded
  std::optional<double> time_;                    // of this pass
  std::vector<uint8_t> head_;                     // of the call that is being recorded
};

}  // namespace vx::lnx
