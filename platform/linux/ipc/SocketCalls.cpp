// A connection's calls: their arguments, their slots, their replies.
#include <climits>

#include "platform/linux/ipc/SocketConnection.h"

namespace vx::lnx {

namespace {

constexpr std::size_t kCallHead = 3;  // kind, number and operation, before the arguments
// An operation whose answer may be as large as a frame uses up this much of a turn.
constexpr int kLargeReplyCost = 64;

}  // namespace

std::optional<int64_t> SocketConnection::readInteger(const Value& value) {
  if (value.kind() != ValueKind::Integer) return std::nullopt;
  return value.asInt64();
}

void SocketConnection::runCall(const Frame& frame) {
  ++host_.counters().calls;
  std::optional<int64_t> number;
  std::optional<int64_t> operationNumber;
  if (frame.size() >= kCallHead) {
    number = readInteger(frame[1]);
    operationNumber = readInteger(frame[2]);
  }
  if (!number || *number < 0 || !operationNumber) {
    ++host_.counters().malformedFrames;
    return fail(WireError::MalformedFrame, "a call is [1, number, operation, argument...]");
  }
  const auto callNumber = static_cast<uint64_t>(*number);
  if (interface_ == nullptr || *operationNumber < 1 ||
      static_cast<uint64_t>(*operationNumber) > interface_->operations.size()) {
    ++host_.counters().unknownOperations;
    return sendError(callNumber, WireError::UnknownOperation,
                     "there is no operation " + std::to_string(*operationNumber));
  }
  const OperationDescription& operation =
      interface_->operations[static_cast<std::size_t>(*operationNumber - 1)];
  CallArguments arguments;
  std::string problem;
  if (!readArguments(operation, frame, arguments, problem)) {
    ++host_.counters().wrongArguments;
    return sendError(callNumber, WireError::WrongArguments, problem);
  }
  if (!admitResource(operation, arguments)) {
    ++host_.counters().tooManySessions;
    return sendError(callNumber, WireError::TooManySessions,
                     "this connection holds " + std::to_string(resources_.size()) +
                         " sessions already; destroy some first");
  }
  if (operation.reply == ReplyKind::Int64Array) turnBudget_ -= kLargeReplyCost;
  const uint64_t token = openSlot(callNumber, !operation.replyMayBeHeld);
  operation.invoke(*object_, arguments, Reply(weak_from_this(), token));
}

bool SocketConnection::readArguments(const OperationDescription& operation, const Frame& frame,
                                     CallArguments& arguments, std::string& problem) const {
  static_assert(kCallHead + CallArguments::kMaxArguments <= Frame::kMaxElements);
  const std::size_t count = frame.size() - kCallHead;
  if (count != operation.arguments.size()) {
    problem = std::string(operation.name) + " takes " + std::to_string(operation.arguments.size()) +
              " arguments, not " + std::to_string(count);
    return false;
  }
  const char* wanted = nullptr;
  for (std::size_t i = 0; i < count && wanted == nullptr; ++i) {
    const Value value = frame[kCallHead + i];
    const ValueKind kind = value.kind();
    switch (operation.arguments[i]) {
      case ArgumentKind::Int64:
        if (kind == ValueKind::Integer)
          arguments.set(i, value.asInt64());
        else
          wanted = "a signed 64-bit integer";
        break;
      case ArgumentKind::UInt16:
      case ArgumentKind::UInt32: {
        const bool narrow = operation.arguments[i] == ArgumentKind::UInt16;
        const int64_t most = narrow ? UINT16_MAX : int64_t{UINT32_MAX};
        if (kind == ValueKind::Integer && value.asInt64() >= 0 && value.asInt64() <= most) {
          arguments.set(i, static_cast<uint64_t>(value.asInt64()));
        } else {
          wanted = narrow ? "an unsigned 16-bit integer" : "an unsigned 32-bit integer";
        }
        break;
      }
      case ArgumentKind::Dictionary:
      case ArgumentKind::OptionalDictionary:
        if (kind == ValueKind::Dictionary) {
          arguments.set(i, std::optional<Payload>(frame.payload(kCallHead + i)));
        } else if (kind == ValueKind::Null &&
                   operation.arguments[i] == ArgumentKind::OptionalDictionary) {
          arguments.set(i, std::optional<Payload>());
        } else {
          wanted = operation.arguments[i] == ArgumentKind::Dictionary ? "a dictionary"
                                                                      : "a dictionary or null";
        }
        break;
      case ArgumentKind::OptionalInt64Array:
        if (kind == ValueKind::Null) {
          arguments.set(i, std::optional<std::vector<int64_t>>());
        } else if (kind == ValueKind::Array) {
          std::vector<int64_t> numbers;
          for (const Value element : value.asArray()) {
            if (element.kind() != ValueKind::Integer) wanted = "an array of signed 64-bit integers";
            numbers.push_back(element.asInt64());
          }
          arguments.set(i, std::optional<std::vector<int64_t>>(std::move(numbers)));
        } else {
          wanted = "an array of signed 64-bit integers or null";
        }
        break;
    }
    if (wanted != nullptr) {
      problem = "argument " + std::to_string(i + 1) + " of " + std::string(operation.name) +
                " must be " + wanted;
    }
  }
  return wanted == nullptr;
}

bool SocketConnection::admitResource(const OperationDescription& operation,
                                     const CallArguments& arguments) {
  if (operation.resource == ResourceEffect::Release) resources_.erase(arguments.int64(0));
  if (operation.resource != ResourceEffect::Acquire) return true;
  if (resources_.size() >= host_.limits().maxSessionsPerConnection &&
      !resources_.contains(arguments.int64(0))) {
    return false;
  }
  resources_.insert(arguments.int64(0));
  return true;
}

uint64_t SocketConnection::openSlot(uint64_t number, bool counted) {
  uint32_t index = 0;
  if (freeSlots_.empty()) {
    index = static_cast<uint32_t>(slots_.size());
    slots_.emplace_back();
  } else {
    index = freeSlots_.back();
    freeSlots_.pop_back();
  }
  Slot& slot = slots_[index];
  slot.number = number;
  slot.used = true;
  slot.answered = false;
  slot.counted = counted;
  if (counted) ++callsInFlight_;
  return uint64_t{slot.generation} << 32 | index;
}

SocketConnection::Slot* SocketConnection::slotFor(uint64_t token) {
  const auto index = static_cast<uint32_t>(token);
  if (index >= slots_.size()) return nullptr;
  Slot& slot = slots_[index];
  return slot.used && slot.generation == token >> 32 ? &slot : nullptr;
}

// The call has its answer, or will never have one.
void SocketConnection::settle(Slot& slot) {
  slot.answered = true;
  if (!slot.counted) return;
  slot.counted = false;
  const bool wasFull = callsInFlight_-- >= host_.limits().maxCallsInFlight;
  if (wasFull && state_ == State::Open) {
    updateInterest();
    scheduleRead();
  }
  if (state_ == State::Draining && callsInFlight_ == 0) wantFlush();
}

void SocketConnection::reply(uint64_t token, ReplyValue value) {
  if (!host_.executor().isInteractiveThread()) {
    queue_->async([self = shared_from_this(), token, value = std::move(value)]() mutable {
      self->reply(token, std::move(value));
    });
    return;
  }
  Slot* slot = slotFor(token);
  if (slot == nullptr || state_ == State::Closed) return;
  if (slot->answered) {
    ++host_.counters().secondReplies;
    return;
  }
  sendReply(slot->number, value);
  settle(*slot);
}

void SocketConnection::release(uint64_t token) {
  if (!host_.executor().isInteractiveThread()) {
    queue_->async([self = shared_from_this(), token] { self->release(token); });
    return;
  }
  Slot* slot = slotFor(token);
  if (slot == nullptr) return;
  if (!slot->answered) {
    if (state_ == State::Open) {
      ++host_.counters().abandonedCalls;
      sendError(slot->number, WireError::Abandoned,
                "the service let go of this call without an answer");
    }
    settle(*slot);
  }
  ++slot->generation;
  slot->used = false;
  freeSlots_.push_back(static_cast<uint32_t>(token));
}

}  // namespace vx::lnx
