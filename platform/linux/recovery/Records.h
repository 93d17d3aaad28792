// What lies in the records of the journal, written and read.
//
//   kind                | head                                              | dictionary
//   Accepted            | pid 4 | uid 4                                     | none
//   Call and the like   | a call's frame [1, 0, operation, argument...]     | the one among the
//                       | with its dictionary as an empty one               | arguments, if any
//   Ended...            | none                                              | none
//   ServiceBegan        | none                                              | none
//   PreferencesChanged  | the notification's name                           | none
//   DelayedMessage      | place 4 | depth 4 | facts                         | the message
//   ServiceState        | facts                                             | none
//   ClientState         | pid 4 | uid 4 | facts                             | none
//   SessionState        | reporter 8 | facts                                | a piece of
//   information RelayState          | place 4 | depth 4 | connection 8 | reporter 8     | none
//
// Facts are a dictionary in CBOR that only the service understands. The States are parts of a
// snapshot. A DelayedMessage and a RelayState stand for work of an earlier call: their connection
// is that call's number. A session whose information has several pieces has as many SessionStates.
//
// A connection is known by the call number of its Accepted record, whose own connection is 0; all
// other records of a connection bear that number. Notes have one kind:
//
//   kInputNote          | place 4 | length 1 | what was asked | the answer, a dictionary in CBOR |
//
// Numbers are in this host's byte order.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <optional>
#include <span>
#include <string_view>
#include <vector>

#include "base/Status.h"
#include "platform/ClientConnection.h"
#include "platform/linux/execution/CauseScope.h"
#include "platform/linux/journal/JournalReader.h"
#include "platform/linux/journal/JournalTicket.h"
#include "platform/linux/journal/RecordKind.h"

namespace vx::lnx {

inline constexpr uint8_t kInputNote = 1;
inline constexpr std::size_t kAcceptedHeadBytes = 8;

struct RecordedClient {
  pid_t pid = 0;
  uid_t uid = 0;
};
void writeAccepted(const RecordedClient& client, std::span<uint8_t, kAcceptedHeadBytes> head);
std::optional<RecordedClient> readAccepted(std::span<const uint8_t> head);

// Of a checked call. `dictionary`: which of the frame's elements is one.
void writeCall(const Frame& call, std::optional<std::size_t> dictionary,
               std::vector<uint8_t>& head);
struct RecordedCall {
  const OperationDescription* operation = nullptr;
  CallArguments arguments;
};
// A failure when the record is of no operation of this interface, or of another version's.
Result<RecordedCall> readCall(std::span<const uint8_t> head,
                              const std::optional<Payload>& dictionary,
                              const InterfaceDescription& interface);

// An answer that was noted with a call: the place is that of Cause::take() before the question.
struct RecordedInput {
  uint32_t place = 0;
  std::string_view what;  // of the note
  Payload answer;
};
std::vector<uint8_t> writeInput(uint32_t place, std::string_view what, const Payload& answer);
std::optional<RecordedInput> readInput(std::span<const uint8_t> note);

// Each is none when the head is not of its kind.
std::vector<uint8_t> writeDelayed(const CausePosition& position, const Payload& facts);
struct RecordedDelay {
  CausePosition position;
  Payload facts;
};
std::optional<RecordedDelay> readDelayed(std::span<const uint8_t> head);
std::vector<uint8_t> writeClientState(const RecordedClient& client, const Payload& facts);
struct RecordedClientState {
  RecordedClient client;
  Payload facts;
};
std::optional<RecordedClientState> readClientState(std::span<const uint8_t> head);
std::vector<uint8_t> writeSessionState(int64_t reporterID, const Payload& facts);
struct RecordedSessionState {
  int64_t reporterID = 0;
  Payload facts;
};
std::optional<RecordedSessionState> readSessionState(std::span<const uint8_t> head);
struct RecordedRelayState {
  CausePosition position;
  uint64_t connection = 0;
  int64_t reporterID = 0;
};
std::vector<uint8_t> writeRelayState(const RecordedRelayState& state);
std::optional<RecordedRelayState> readRelayState(std::span<const uint8_t> head);

// How the session ended that the work of this call ended; empty when such a call ends none.
std::string_view endWordOf(const JournalTicket& call);

// Of a record that was read; 0 for what is of no connection.
inline uint64_t connectionOf(const JournalContents::Record& record) {
  return record.kind == static_cast<uint8_t>(RecordKind::Accepted) ? record.call
                                                                   : record.connection;
}

}  // namespace vx::lnx
