#include "wire/FrameWriter.h"

namespace vx::wire {

FrameWriter FrameWriter::hello(std::vector<uint8_t>& out, std::size_t more) {
  FrameWriter frame(out, FrameKind::Hello, 1 + more);
  frame.items().integer(kProtocolVersion);
  return frame;
}

FrameWriter FrameWriter::call(std::vector<uint8_t>& out, uint64_t number, Operation operation,
                              std::size_t arguments) {
  FrameWriter frame(out, FrameKind::Call, 2 + arguments);
  frame.items().unsignedInteger(number);
  frame.items().integer(static_cast<int64_t>(operation));
  return frame;
}

FrameWriter FrameWriter::reply(std::vector<uint8_t>& out, uint64_t number) {
  FrameWriter frame(out, FrameKind::Reply, 2);
  frame.items().unsignedInteger(number);
  return frame;
}

void FrameWriter::error(std::vector<uint8_t>& out, std::optional<uint64_t> number, ErrorCode code,
                        std::string_view text) {
  FrameWriter frame(out, FrameKind::Error, 3);
  if (number)
    frame.items().unsignedInteger(*number);
  else
    frame.items().null();
  frame.items().integer(static_cast<int64_t>(code));
  frame.items().string(text);
  frame.end();
}

void FrameWriter::goodbye(std::vector<uint8_t>& out) {
  FrameWriter(out, FrameKind::Goodbye, 0).end();
}

}  // namespace vx::wire
