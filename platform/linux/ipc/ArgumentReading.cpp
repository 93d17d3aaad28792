#include "platform/linux/ipc/ArgumentReading.h"

#include <algorithm>
#include <optional>
#include <string>
#include <utility>
#include <vector>

#include "wire/Protocol.h"

namespace vx::lnx {

namespace {

using wire::kCallHead;

// What a value should have been; null when it is that.
using Wanted = const char*;

Wanted readUnsigned(const Value& value, int64_t most, Wanted otherwise, CallArguments& arguments,
                    std::size_t i) {
  const int64_t number = value.asInt64();
  if (value.kind() != ValueKind::Integer || number < 0 || number > most) return otherwise;
  arguments.set(i, static_cast<uint64_t>(number));
  return nullptr;
}

Wanted readNumbers(const Value& value, CallArguments& arguments, std::size_t i) {
  std::vector<int64_t> numbers;
  for (const Value element : value.asArray()) {
    if (element.kind() != ValueKind::Integer) return "an array of signed 64-bit integers";
    numbers.push_back(element.asInt64());
  }
  arguments.set(i, std::optional<std::vector<int64_t>>(std::move(numbers)));
  return nullptr;
}

Wanted readArgument(ArgumentKind wanted, const Frame& frame, CallArguments& arguments,
                    std::size_t i) {
  const Value value = frame[kCallHead + i];
  const ValueKind kind = value.kind();
  switch (wanted) {
    case ArgumentKind::Int64:
      if (kind != ValueKind::Integer) return "a signed 64-bit integer";
      arguments.set(i, value.asInt64());
      return nullptr;
    case ArgumentKind::UInt16:
      return readUnsigned(value, UINT16_MAX, "an unsigned 16-bit integer", arguments, i);
    case ArgumentKind::UInt32:
      return readUnsigned(value, UINT32_MAX, "an unsigned 32-bit integer", arguments, i);
    case ArgumentKind::OptionalDictionary:
    case ArgumentKind::Dictionary: {
      const bool optional = wanted == ArgumentKind::OptionalDictionary;
      if (kind == ValueKind::Dictionary) return nullptr;
      if (!optional || kind != ValueKind::Null)
        return optional ? "a dictionary or null" : "a dictionary";
      arguments.set(i, std::optional<Payload>());
      return nullptr;
    }
    case ArgumentKind::OptionalInt64Array:
      if (kind == ValueKind::Array) return readNumbers(value, arguments, i);
      if (kind != ValueKind::Null) return "an array of signed 64-bit integers or null";
      arguments.set(i, std::optional<std::vector<int64_t>>());
      return nullptr;
  }
  return nullptr;
}

}  // namespace

Status readArguments(const OperationDescription& operation, const Frame& frame,
                     CallArguments& arguments) {
  static_assert(kCallHead + CallArguments::kMaxArguments <= Frame::kMaxElements);
  const std::size_t count = frame.size() - kCallHead;
  if (count != operation.arguments.size()) {
    return Status::failure(std::string(operation.name) + " takes " +
                           std::to_string(operation.arguments.size()) + " arguments, not " +
                           std::to_string(count));
  }
  for (std::size_t i = 0; i < count; ++i) {
    if (const Wanted wanted = readArgument(operation.arguments[i], frame, arguments, i)) {
      return Status::failure("argument " + std::to_string(i + 1) + " of " +
                             std::string(operation.name) + " must be " + wanted);
    }
  }
  return {};
}

std::size_t longestArray(const OperationDescription& operation, const Frame& frame) {
  std::size_t longest = 0;
  for (std::size_t i = 0; i < operation.arguments.size() && kCallHead + i < frame.size(); ++i) {
    const Value value = frame[kCallHead + i];
    if (operation.arguments[i] == ArgumentKind::OptionalInt64Array &&
        value.kind() == ValueKind::Array)
      longest = std::max(longest, value.asArray().size());
  }
  return longest;
}

std::optional<std::size_t> dictionaryElement(const OperationDescription& operation,
                                             const Frame& frame) {
  for (std::size_t i = 0; i < operation.arguments.size(); ++i) {
    const ArgumentKind kind = operation.arguments[i];
    if (kind != ArgumentKind::Dictionary && kind != ArgumentKind::OptionalDictionary) continue;
    if (frame[kCallHead + i].kind() == ValueKind::Dictionary) return kCallHead + i;
  }
  return std::nullopt;
}

}  // namespace vx::lnx
