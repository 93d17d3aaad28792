// What a connection has to say to its peer and the peer has not read yet.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string_view>
#include <vector>

#include "base/Clock.h"
#include "platform/ClientConnection.h"
#include "platform/linux/ipc/ListenerOptions.h"
#include "wire/Protocol.h"

namespace vx::lnx {

// Encodes frames one behind the other and writes them as the socket takes them; remembers since
// when it has taken none.
//
// Owned by SocketConnection, on its queue. Bounds nothing by itself: the connection reads no more
// calls at maxUnreadReplyBytes, and cuts a peer whose stallDeadline() has passed.
class ReplyStream {
 public:
  enum class Fits : uint8_t { No, Yes };
  enum class Peer : uint8_t { There, Gone };

  void hello(std::string_view interfaceName, const ListenerOptions& limits);
  // No, and nothing is said, when the value makes a frame of more than `maxFrameBytes`.
  [[nodiscard]] Fits reply(uint64_t number, const ReplyValue& value, std::size_t maxFrameBytes);
  // Without a number: about the connection.
  void error(std::optional<uint64_t> number, wire::ErrorCode code, std::string_view text);
  void goodbye();

  std::size_t unreadBytes() const { return out_.size() - begin_; }
  bool empty() const { return unreadBytes() == 0; }
  // One write, as far as the socket takes it. A peer that is gone gets nothing more: all is
  // dropped.
  [[nodiscard]] Peer writeTo(int socket, Clock& clock);
  void clear();
  // None unless a write has left something over.
  std::optional<Monotonic> stallDeadline(std::chrono::nanoseconds patience) const;

 private:
  std::vector<uint8_t> out_;  // not yet written, from begin_
  std::size_t begin_ = 0;
  std::optional<Monotonic> lastProgress_;  // of a write that left something over
};

}  // namespace vx::lnx
