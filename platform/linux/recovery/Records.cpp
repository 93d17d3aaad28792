#include "platform/linux/recovery/Records.h"

#include <algorithm>
#include <cstring>
#include <string>

#include "platform/linux/ipc/ArgumentReading.h"
#include "wire/Protocol.h"

namespace vx::lnx {

namespace {

constexpr uint8_t kArrayHead = 0x80;  // of fewer than 24 elements
constexpr uint8_t kNoNumber = 0;      // the peer's, which only a reply would need
constexpr uint8_t kEmptyDictionary = 0xA0;
constexpr std::size_t kWhat = sizeof(uint32_t) + 1;  // where it begins, in a note
static_assert(Frame::kMaxElements < 24);

template <class T>
T numberAt(std::span<const uint8_t> bytes, std::size_t offset) {
  T value;
  std::memcpy(&value, bytes.data() + offset, sizeof value);
  return value;
}

template <class T>
void put(std::vector<uint8_t>& head, T number) {
  const std::size_t size = head.size();
  head.resize(size + sizeof number);
  std::memcpy(head.data() + size, &number, sizeof number);
}

void put(std::vector<uint8_t>& head, const Payload& facts) {
  const std::span<const uint8_t> bytes = facts.encoded();
  head.insert(head.end(), bytes.begin(), bytes.end());
}

// Of what a process wrote that is gone: believes nothing.
class HeadReader {
 public:
  explicit HeadReader(std::span<const uint8_t> head) : left_(head) {}
  template <class T>
  T number() {
    if (left_.size() < sizeof(T)) understood_ = false;
    if (!understood_) return T();
    const T value = numberAt<T>(left_, 0);
    left_ = left_.subspan(sizeof(T));
    return value;
  }
  CausePosition position() {
    CausePosition position;
    position.place = number<uint32_t>();
    const auto depth = number<uint32_t>();
    if (depth > kDeepestCause) understood_ = false;
    position.depth = static_cast<uint8_t>(depth);
    return position;
  }
  // The rest.
  Payload dictionary() {
    std::optional<Payload> read = Payload::decode(left_);
    left_ = {};
    if (!read) understood_ = false;
    return std::move(read).value_or(Payload());
  }
  bool understood() const { return understood_ && left_.empty(); }

 private:
  std::span<const uint8_t> left_;
  bool understood_ = true;
};

}  // namespace

void writeAccepted(const RecordedClient& client, std::span<uint8_t, kAcceptedHeadBytes> head) {
  static_assert(sizeof client.pid + sizeof client.uid == kAcceptedHeadBytes);
  std::memcpy(head.data(), &client.pid, sizeof client.pid);
  std::memcpy(head.data() + sizeof client.pid, &client.uid, sizeof client.uid);
}

std::optional<RecordedClient> readAccepted(std::span<const uint8_t> head) {
  if (head.size() != kAcceptedHeadBytes) return std::nullopt;
  return RecordedClient{numberAt<pid_t>(head, 0), numberAt<uid_t>(head, sizeof(pid_t))};
}

void writeCall(const Frame& call, std::optional<std::size_t> dictionary,
               std::vector<uint8_t>& head) {
  // The elements lie one behind the other: two pieces, with the dictionary between them.
  const uint8_t* const begin = call[wire::kCallHead - 1].encoded().data();
  const std::span<const uint8_t> last = call[call.size() - 1].encoded();
  const uint8_t* const end = last.data() + last.size();
  const std::span<const uint8_t> left =
      dictionary ? call[*dictionary].encoded() : std::span(end, end);
  const auto before = static_cast<std::size_t>(left.data() - begin);
  const auto after = static_cast<std::size_t>(end - (left.data() + left.size()));
  head.resize(wire::kCallHead + before + (dictionary ? 1 : 0) + after);
  uint8_t* at = head.data();
  *at++ = static_cast<uint8_t>(kArrayHead | call.size());
  *at++ = static_cast<uint8_t>(wire::FrameKind::Call);
  *at++ = kNoNumber;
  at = std::copy_n(begin, before, at);
  if (dictionary) *at++ = kEmptyDictionary;
  std::copy_n(end - after, after, at);
}

Result<RecordedCall> readCall(std::span<const uint8_t> head,
                              const std::optional<Payload>& dictionary,
                              const InterfaceDescription& interface) {
  DecodeError error;
  const std::optional<Frame> frame = Frame::decode(head, &error);
  if (!frame) return Status::failure("a recorded call is no frame: " + error.text);
  if (frame->size() < wire::kCallHead || frame->size() > Frame::kMaxElements)
    return Status::failure("a recorded call has no operation");
  const int64_t number = (*frame)[wire::kCallHead - 1].asInt64();
  if (number < 1 || static_cast<uint64_t>(number) > interface.operations.size())
    return Status::failure("there is no operation " + std::to_string(number));
  RecordedCall call;
  call.operation = &interface.operations[static_cast<std::size_t>(number - 1)];
  if (Status read = readArguments(*call.operation, *frame, call.arguments); !read.ok()) return read;
  if (const auto element = dictionaryElement(*call.operation, *frame))
    call.arguments.set(*element - wire::kCallHead,
                       std::optional<Payload>(dictionary.value_or(Payload())));
  return call;
}

// ---------------------------------------------------------------------------------------------------------------------
// States

std::vector<uint8_t> writeDelayed(const CausePosition& position, const Payload& facts) {
  std::vector<uint8_t> head;
  put(head, position.place);
  put(head, uint32_t{position.depth});
  put(head, facts);
  return head;
}

std::optional<RecordedDelay> readDelayed(std::span<const uint8_t> head) {
  RecordedDelay delay;
  HeadReader reader(head);
  delay.position = reader.position();
  delay.facts = reader.dictionary();
  return reader.understood() ? std::optional(std::move(delay)) : std::nullopt;
}

std::vector<uint8_t> writeClientState(const RecordedClient& client, const Payload& facts) {
  std::vector<uint8_t> head;
  put(head, client.pid);
  put(head, client.uid);
  put(head, facts);
  return head;
}

std::optional<RecordedClientState> readClientState(std::span<const uint8_t> head) {
  RecordedClientState state;
  HeadReader reader(head);
  state.client.pid = reader.number<pid_t>();
  state.client.uid = reader.number<uid_t>();
  state.facts = reader.dictionary();
  return reader.understood() ? std::optional(std::move(state)) : std::nullopt;
}

std::vector<uint8_t> writeSessionState(int64_t reporterID, const Payload& facts) {
  std::vector<uint8_t> head;
  put(head, reporterID);
  put(head, facts);
  return head;
}

std::optional<RecordedSessionState> readSessionState(std::span<const uint8_t> head) {
  RecordedSessionState state;
  HeadReader reader(head);
  state.reporterID = reader.number<int64_t>();
  state.facts = reader.dictionary();
  return reader.understood() ? std::optional(std::move(state)) : std::nullopt;
}

std::vector<uint8_t> writeRelayState(const RecordedRelayState& state) {
  std::vector<uint8_t> head;
  put(head, state.position.place);
  put(head, uint32_t{state.position.depth});
  put(head, state.connection);
  put(head, state.reporterID);
  return head;
}

std::optional<RecordedRelayState> readRelayState(std::span<const uint8_t> head) {
  RecordedRelayState state;
  HeadReader reader(head);
  state.position = reader.position();
  state.connection = reader.number<uint64_t>();
  state.reporterID = reader.number<int64_t>();
  return reader.understood() ? std::optional(state) : std::nullopt;
}

std::string_view endWordOf(const JournalTicket& call) {
  switch (static_cast<RecordKind>(call.kind())) {
    case RecordKind::StopCall:
      return "stopped";
    case RecordKind::DestroyCall:
      return "destroyed";
    case RecordKind::EndedInterrupted:
    case RecordKind::EndedOrderly:
      return "disconnected";
    case RecordKind::EndedServiceStopped:
      return "service_stopped";
    case RecordKind::EndedCrashed:
      return "crashed";
    default:
      return "";
  }
}

std::vector<uint8_t> writeInput(uint32_t place, std::string_view what, const Payload& answer) {
  const std::span<const uint8_t> bytes = answer.encoded();
  std::vector<uint8_t> note(kWhat + what.size() + bytes.size());
  std::memcpy(note.data(), &place, sizeof place);
  note[kWhat - 1] = static_cast<uint8_t>(what.size());
  std::copy(what.begin(), what.end(), note.begin() + kWhat);
  std::ranges::copy(bytes, note.end() - static_cast<std::ptrdiff_t>(bytes.size()));
  return note;
}

std::optional<RecordedInput> readInput(std::span<const uint8_t> note) {
  if (note.size() < kWhat || note.size() - kWhat < note[kWhat - 1]) return std::nullopt;
  const std::size_t length = note[kWhat - 1];
  std::optional<Payload> answer = Payload::decode(note.subspan(kWhat + length));
  if (!answer) return std::nullopt;
  return RecordedInput{numberAt<uint32_t>(note, 0),
                       {reinterpret_cast<const char*>(note.data()) + kWhat, length},
                       std::move(*answer)};
}

}  // namespace vx::lnx
