// One client connection: who is at the other end, which object it may call, and what happens when
// it ends.
//
// The connection knows nothing of the service. It is given a description of the exported interface:
// the operations in declaration order, the kinds of their arguments and replies, and a function
// that invokes each on the exported object.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "base/Error.h"
#include "base/Function.h"
#include "propertylist/Payload.h"

namespace vx {

enum class ArgumentKind : uint8_t {
  Int64,
  UInt16,
  UInt32,
  Dictionary,
  OptionalDictionary,
  OptionalInt64Array,
};

enum class ReplyKind : uint8_t {
  Boolean,
  UInt16,
  OptionalError,
  Dictionary,
  Int64Array,
};

// monostate: success of an OptionalError reply.
using ReplyValue =
    std::variant<std::monostate, bool, uint16_t, Error, Payload, std::vector<int64_t>>;

// Where replies go. Implemented by the connection.
class ReplyTarget {
 public:
  virtual ~ReplyTarget() = default;
  virtual void reply(uint64_t token, ReplyValue value) = 0;
  // The call's Reply was destroyed. Ends the call's book-keeping; answers nothing a reply was sent
  // for already.
  virtual void release(uint64_t token) = 0;
};

// The right to answer one call. Movable; may be invoked from any thread, at any later time, also
// after the peer left. A second invocation is tolerated and dropped by the connection.
class Reply {
 public:
  Reply() = default;
  Reply(std::weak_ptr<ReplyTarget> target, uint64_t token)
      : target_(std::move(target)), token_(token) {}
  Reply(Reply&& other) noexcept = default;
  Reply& operator=(Reply&& other) noexcept {
    Reply old(std::move(*this));
    target_ = std::move(other.target_);
    token_ = other.token_;
    return *this;
  }
  Reply(const Reply&) = delete;
  Reply& operator=(const Reply&) = delete;
  ~Reply() {
    if (auto target = target_.lock()) target->release(token_);
  }
  void operator()(ReplyValue value) const {
    if (auto target = target_.lock()) target->reply(token_, std::move(value));
  }

 private:
  std::weak_ptr<ReplyTarget> target_;
  uint64_t token_ = 0;
};

// The arguments of one call, checked against the operation's description: reading argument i as its
// declared kind always succeeds.
using Argument =
    std::variant<int64_t, uint64_t, std::optional<Payload>, std::optional<std::vector<int64_t>>>;
class CallArguments {
 public:
  static constexpr std::size_t kMaxArguments = 4;
  int64_t int64(std::size_t i) const { return std::get<int64_t>(items_[i]); }
  uint16_t uint16(std::size_t i) const {
    return static_cast<uint16_t>(std::get<uint64_t>(items_[i]));
  }
  uint32_t uint32(std::size_t i) const {
    return static_cast<uint32_t>(std::get<uint64_t>(items_[i]));
  }
  Payload dictionary(std::size_t i) {
    return std::move(*std::get<std::optional<Payload>>(items_[i]));
  }
  std::optional<Payload> optionalDictionary(std::size_t i) {
    return std::move(std::get<std::optional<Payload>>(items_[i]));
  }
  std::optional<std::vector<int64_t>> optionalInt64Array(std::size_t i) {
    return std::move(std::get<std::optional<std::vector<int64_t>>>(items_[i]));
  }
  // None where there is no array.
  std::optional<std::size_t> numbersIn(std::size_t i) const {
    const auto& numbers = std::get<std::optional<std::vector<int64_t>>>(items_[i]);
    if (!numbers) return std::nullopt;
    return numbers->size();
  }
  void set(std::size_t i, Argument value) { items_[i] = std::move(value); }

 private:
  Argument items_[kMaxArguments];
};

// The object whose operations a connection's peer may call. Kept alive by the connection while that
// exists.
class ExportedObject {
 public:
  virtual ~ExportedObject() = default;
};

// What a successful admission of the call means for the peer's account of resources, keyed by the
// first argument. Lets the connection bound what one peer can make the service hold without knowing
// what that is.
enum class ResourceEffect : uint8_t { None, Acquire, Release };

struct OperationDescription {
  std::string_view name;
  std::span<const ArgumentKind> arguments;
  ReplyKind reply;
  // The reply may be held for as long as the peer likes, so the call does not count as unanswered.
  bool replyMayBeHeld = false;
  ResourceEffect resource = ResourceEffect::None;
  // What it does survives the process: a call is recorded before it runs, and run again after a
  // crash. False for questions.
  bool recorded = true;
  // Runs on the connection's own queue. May invoke `reply` before it returns, later, twice or
  // never.
  void (*invoke)(ExportedObject& object, CallArguments& arguments, Reply reply);
  // Whether its work may be long: then it runs before the peer's next call is looked at. Null:
  // never.
  bool (*isHeavy)(const CallArguments& arguments) = nullptr;
  // For the users whom the connection's configuration names; others get an error.
  bool privileged = false;
  // Makes the service hold more for the caller's user until he takes it back: refused beyond his
  // bound.
  bool holds = false;
};

// Operations are numbered from 1 in declaration order on the wire. Each has one dictionary at most
// among its arguments. Lives as long as the process.
struct InterfaceDescription {
  std::string_view name;
  std::span<const OperationDescription> operations;
};

class ClientConnection {
 public:
  virtual ~ClientConnection() = default;
  virtual int32_t processIdentifier() const = 0;
  virtual std::string description() const = 0;
  virtual void setExportedInterface(const InterfaceDescription& interface) = 0;
  virtual void setExportedObject(std::shared_ptr<ExportedObject> object) = 0;
  virtual std::shared_ptr<ExportedObject> exportedObject() const = 0;
  // Both run on the connection's own queue. Interruption: the stream ended without a goodbye; an
  // invalidation follows. Invalidation: the connection is over, for whatever reason; runs exactly
  // once, last.
  virtual void setInterruptionHandler(Function<void()> handler) = 0;
  virtual void setInvalidationHandler(Function<void()> handler) = 0;
  // No call is read before this.
  virtual void resume() = 0;
};

}  // namespace vx
