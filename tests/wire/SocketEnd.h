// One end of a socket, worked by a test: writes bytes, and shows the frames that have come.
// Confined to the test's thread; never blocks unless said.
#pragma once

#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>

#include <cstdint>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

#include "base/UniqueFd.h"
#include "propertylist/CborWriter.h"
#include "propertylist/Payload.h"
#include "wire/FrameReader.h"

namespace vx {

using Bytes = std::vector<uint8_t>;
inline Bytes operator+(Bytes a, const Bytes& b) {
  a.insert(a.end(), b.begin(), b.end());
  return a;
}

inline Bytes framed(const Bytes& body) {
  Bytes length;
  for (std::size_t i = 0; i < wire::kLengthBytes; ++i)
    length.push_back(static_cast<uint8_t>(body.size() >> (8 * i)));
  return length + body;
}

// A frame of booleans, integers, nullptr, texts, and Bytes that are one encoded item.
template <class... Items>
Bytes frame(const Items&... items) {
  Bytes body;
  CborWriter w(body);
  const auto put = [&w](const auto& item) {
    using Item = std::decay_t<decltype(item)>;
    if constexpr (std::is_same_v<Item, bool>)
      w.boolean(item);
    else if constexpr (std::is_integral_v<Item> || std::is_enum_v<Item>)
      w.integer(static_cast<int64_t>(item));
    else if constexpr (std::is_null_pointer_v<Item>)
      w.null();
    else if constexpr (std::is_convertible_v<const Item&, std::string_view>)
      w.string(item);
    else
      w.encoded(item);
  };
  w.array(sizeof...(items));
  (put(items), ...);
  return framed(body);
}

class SocketEnd {
 public:
  SocketEnd() = default;
  explicit SocketEnd(UniqueFd socket) : socket_(std::move(socket)) {}

  // A new pair; returns the other end.
  UniqueFd pair() {
    int ends[2];
    EXPECT_EQ(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends), 0);
    close();
    socket_.reset(ends[0]);
    return UniqueFd(ends[1]);
  }
  void take(UniqueFd socket) {
    close();
    socket_ = std::move(socket);
  }
  void write(const Bytes& bytes) {
    ASSERT_EQ(send(fd(), bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT),
              static_cast<ssize_t>(bytes.size()));
  }
  // At most so many bytes of what has arrived. Returns how many.
  std::size_t readSome(std::size_t most) {
    const std::span<uint8_t> space = reader_.space();
    const ssize_t got =
        recv(socket_.get(), space.data(), std::min(most, space.size()), MSG_DONTWAIT);
    ended_ = ended_ || got == 0 || (got < 0 && errno == ECONNRESET);
    if (got > 0) reader_.received(static_cast<std::size_t>(got));
    return got > 0 ? static_cast<std::size_t>(got) : 0;
  }
  // The frames that have arrived whole and not been given before: "2 5 1" for the reply true to
  // call 5; errors without their sentence.
  std::vector<std::string> texts() {
    std::vector<std::string> all;
    std::span<const uint8_t> body;
    do {
      while (reader_.next(body) == wire::FrameReader::Next::Frame) all.push_back(textOf(body));
    } while (readSome(SIZE_MAX) > 0);
    return all;
  }
  // Waits for bytes, or the end.
  void await() {
    pollfd ready{socket_.get(), POLLIN, 0};
    ASSERT_EQ(poll(&ready, 1, 20000), 1) << "nothing came";
  }
  bool holdsHalfAFrame() const { return reader_.unread() != 0; }
  bool ended() const { return ended_; }  // seen by a read
  int fd() const { return socket_.get(); }
  void close() {
    socket_.reset();
    reader_.clear();
    ended_ = false;
  }

 private:
  static std::string textOf(std::span<const uint8_t> body) {
    const Frame frame = Frame::decode(body).value();
    const std::size_t size = frame.size() - (frame[0].text() == "3" ? 1 : 0);
    std::string text;
    for (std::size_t i = 0; i < size; ++i)
      text += (i == 0 ? "" : " ") + (frame[i].kind() == ValueKind::Null ? "null" : frame[i].text());
    return text;
  }

  UniqueFd socket_;
  wire::ReadBuffers buffers_;
  wire::FrameReader reader_{buffers_};
  bool ended_ = false;
};

}  // namespace vx
