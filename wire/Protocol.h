// The socket protocol's constants: what a frame may be, and the numbers in it. docs/protocol.md is
// the same for authors of clients.
#pragma once

#include <cstddef>
#include <cstdint>

namespace vx::wire {

inline constexpr int64_t kProtocolVersion = 1;

// A frame: its length as 32 bits, little-endian, and that many bytes of CBOR.
inline constexpr std::size_t kLengthBytes = 4;
// The most that a service may be configured to take, what it takes by default, and what either side
// goes by until the service's hello has said otherwise.
inline constexpr uint32_t kMaxFrameBytes = 1u << 20;
// What a client believes of a service that announces more than that.
inline constexpr uint32_t kMaxAnnouncedFrameBytes = 64u << 20;

enum class FrameKind : uint8_t { Hello = 0, Call = 1, Reply = 2, Error = 3, Goodbye = 4 };

// Elements of a call before its arguments: kind, number, operation.
inline constexpr std::size_t kCallHead = 3;

// Codes of error frames.
enum class ErrorCode : uint8_t {
  MalformedFrame = 1,
  FrameTooLarge = 2,
  UnknownOperation = 3,
  WrongArguments = 4,
  TooManySessions = 5,
  TooManyConnections = 6,
  UnsupportedVersion = 7,
  Abandoned = 8,
  TooMuchMemory = 9,
  NotPermitted = 10,
  TooManyIdentifiers = 11,
};

}  // namespace vx::wire
