// The service's end of a socket, played by the test: it writes what the test says and shows what
// the client sent.
#pragma once

#include <string>

#include "tests/wire/SocketEnd.h"

namespace vx {

inline Bytes framed(const Bytes& body) {
  return Bytes{static_cast<uint8_t>(body.size()), static_cast<uint8_t>(body.size() >> 8), 0, 0} +
         body;
}

inline Bytes helloFrame(int64_t version = wire::kProtocolVersion,
                        uint64_t maxFrameBytes = wire::kMaxFrameBytes) {
  Bytes out;
  FrameWriter hello(out, FrameKind::Hello, 2);
  hello.items().integer(version);
  hello.items().encoded(PayloadBuilder().set("max_frame_bytes", maxFrameBytes).build().encoded());
  hello.end();
  return out;
}

template <class Write>
Bytes replyFrame(uint64_t number, const Write& writeValue) {
  Bytes out;
  FrameWriter reply = FrameWriter::reply(out, number);
  writeValue(reply.items());
  reply.end();
  return out;
}
inline Bytes trueReply(uint64_t number) {
  return replyFrame(number, [](CborWriter& w) { w.boolean(true); });
}
inline Bytes errorFrame(std::optional<uint64_t> number, wire::ErrorCode code, const char* text) {
  Bytes out;
  FrameWriter::error(out, number, code, text);
  return out;
}

class FakeService : public SocketEnd {
 public:
  // A pair of ends; returns the client's. The hello is there before the client asks.
  int connect(const Bytes& hello = helloFrame()) {
    UniqueFd client = pair();
    write(hello);
    return client.release();
  }
};

}  // namespace vx
