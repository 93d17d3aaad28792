// Writes frames: the service, the client library, the benchmarks and the tests all use this.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>
#include <vector>

#include "propertylist/CborWriter.h"
#include "wire/Operations.h"
#include "wire/Protocol.h"

namespace vx::wire {

// One frame, appended to a buffer that may hold others:
//
//   | what the buffer held | length 4 bytes | array head, kind, elements ... |
//                          ^ start()        ^ bodyBytes() from here
//
// The length is left open until end(). Lives on its user's stack, no longer than the buffer;
// nothing else may be appended meanwhile. The caller writes as many items as it has announced.
class FrameWriter {
 public:
  FrameWriter(std::vector<uint8_t>& out, FrameKind kind, std::size_t elementsBehindKind)
      : out_(out), start_(out.size()), items_(out) {
    out_.resize(start_ + kLengthBytes);
    items_.array(1 + elementsBehindKind);
    items_.integer(static_cast<int64_t>(kind));
  }
  // [0, version], and that many elements more.
  static FrameWriter hello(std::vector<uint8_t>& out, std::size_t more = 0);
  // [1, number, operation], and the arguments.
  static FrameWriter call(std::vector<uint8_t>& out, uint64_t number, Operation operation,
                          std::size_t arguments);
  // [2, number], and the value.
  static FrameWriter reply(std::vector<uint8_t>& out, uint64_t number);
  // Whole frames. An error without a number is about the connection.
  static void error(std::vector<uint8_t>& out, std::optional<uint64_t> number, ErrorCode code,
                    std::string_view text);
  static void goodbye(std::vector<uint8_t>& out);

  CborWriter& items() { return items_; }
  std::size_t start() const { return start_; }
  // What the limits are about: without the length.
  std::size_t bodyBytes() const { return out_.size() - start_ - kLengthBytes; }

  void end() {
    const std::size_t length = bodyBytes();
    for (std::size_t i = 0; i < kLengthBytes; ++i)
      out_[start_ + i] = static_cast<uint8_t>(length >> (8 * i));
  }
  // The buffer is as it was before.
  void discard() { out_.resize(start_); }

 private:
  std::vector<uint8_t>& out_;
  const std::size_t start_;
  CborWriter items_;
};

}  // namespace vx::wire
