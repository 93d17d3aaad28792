// The service's end of a socket, played by the test: it writes what the test says and shows what
// the client sent. Confined to the test's thread.
#pragma once

#include <gtest/gtest.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cstdint>
#include <cstring>
#include <string>
#include <vector>

#include "propertylist/CborWriter.h"
#include "propertylist/Payload.h"

namespace vx {

using Bytes = std::vector<uint8_t>;

inline Bytes framed(const Bytes& body) {
  Bytes frame(4);
  for (int i = 0; i < 4; ++i) frame[i] = static_cast<uint8_t>(body.size() >> (8 * i));
  frame.insert(frame.end(), body.begin(), body.end());
  return frame;
}

template <class Write>
Bytes frameOf(std::size_t items, const Write& write) {
  Bytes body;
  CborWriter writer(body);
  writer.array(items);
  write(writer);
  return framed(body);
}

inline Bytes helloFrame(int64_t version = 1, uint64_t maxFrameBytes = 1 << 20) {
  return frameOf(3, [&](CborWriter& w) {
    w.integer(0);
    w.integer(version);
    w.encoded(PayloadBuilder().set("max_frame_bytes", maxFrameBytes).build().encoded());
  });
}

template <class Write>
Bytes replyFrame(int64_t number, const Write& writeValue) {
  return frameOf(3, [&](CborWriter& w) {
    w.integer(2);
    w.integer(number);
    writeValue(w);
  });
}
inline Bytes trueReply(int64_t number) {
  return replyFrame(number, [](CborWriter& w) { w.boolean(true); });
}
inline Bytes nullReply(int64_t number) {
  return replyFrame(number, [](CborWriter& w) { w.null(); });
}
// number < 0: about the connection
inline Bytes errorFrame(int64_t number, int64_t code, const char* text) {
  return frameOf(4, [&](CborWriter& w) {
    w.integer(3);
    if (number < 0)
      w.null();
    else
      w.integer(number);
    w.integer(code);
    w.string(text);
  });
}

class FakeService {
 public:
  FakeService() = default;
  explicit FakeService(int fd) : fd_(fd) {}
  FakeService(const FakeService&) = delete;
  FakeService& operator=(const FakeService&) = delete;
  ~FakeService() { close(); }

  // A pair of ends; returns the client's. The hello is there before the client asks.
  int pair(const Bytes& hello = helloFrame()) {
    close();
    int ends[2];
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    fd_ = ends[0];
    write(hello);
    return ends[1];
  }
  void write(const Bytes& bytes) {
    ASSERT_EQ(send(fd_, bytes.data(), bytes.size(), MSG_NOSIGNAL),
              static_cast<ssize_t>(bytes.size()));
  }
  // Everything that has arrived, as whole frames' bodies; fails on half a frame.
  std::vector<Bytes> read() {
    uint8_t chunk[65536];
    for (ssize_t got; (got = recv(fd_, chunk, sizeof chunk, MSG_DONTWAIT)) > 0;)
      in_.insert(in_.end(), chunk, chunk + got);
    std::vector<Bytes> frames;
    std::size_t at = 0;
    while (in_.size() - at >= 4) {
      uint32_t length = 0;
      std::memcpy(&length, in_.data() + at, 4);
      if (in_.size() - at - 4 < length) break;
      frames.emplace_back(in_.begin() + static_cast<std::ptrdiff_t>(at) + 4,
                          in_.begin() + static_cast<std::ptrdiff_t>(at + 4 + length));
      at += 4 + length;
    }
    in_.erase(in_.begin(), in_.begin() + static_cast<std::ptrdiff_t>(at));
    return frames;
  }
  bool holdsHalfAFrame() const { return !in_.empty(); }
  void close() {
    if (fd_ >= 0) ::close(fd_);
    fd_ = -1;
    in_.clear();
  }

 private:
  int fd_ = -1;
  Bytes in_;
};

// A listening socket in a folder of its own.
class TemporaryListener {
 public:
  TemporaryListener();
  ~TemporaryListener();
  const std::string& path() const { return path_; }
  int accept() const { return ::accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC); }

 private:
  std::string folder_;
  std::string path_;
  int fd_ = -1;
};

}  // namespace vx
