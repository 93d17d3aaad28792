#include "platform/linux/ipc/ReplyStream.h"

#include <sys/socket.h>

#include <cerrno>

#include "wire/FrameWriter.h"

namespace vx::lnx {

namespace {

using wire::FrameWriter;

// A buffer larger than this is given back when it is empty.
constexpr std::size_t kKeptBufferBytes = 64 << 10;

// One overload per alternative of ReplyValue.
struct ValueWriter {
  CborWriter& items;
  void operator()(std::monostate) const { items.null(); }
  void operator()(bool value) const { items.boolean(value); }
  void operator()(uint16_t value) const { items.unsignedInteger(value); }
  void operator()(const Error& error) const {
    items.dictionary(error.reason.empty() ? 2 : 3);
    items.string("domain");
    items.string(error.domain);
    items.string("code");
    items.integer(error.code);
    if (error.reason.empty()) return;
    items.string("reason");
    items.string(error.reason);
  }
  void operator()(const Payload& dictionary) const { items.encoded(dictionary.encoded()); }
  void operator()(const std::vector<int64_t>& numbers) const {
    items.array(numbers.size());
    for (const int64_t number : numbers) items.integer(number);
  }
};

}  // namespace

void ReplyStream::hello(std::string_view interfaceName, const ListenerOptions& limits) {
  FrameWriter frame = FrameWriter::hello(out_, 1);
  CborWriter& items = frame.items();
  const auto limit = [&items](std::string_view name, uint64_t value) {
    items.string(name);
    items.unsignedInteger(value);
  };
  items.dictionary(6);
  items.string("interface");
  items.string(interfaceName);
  limit("max_frame_bytes", limits.maxFrameBytes);
  limit("max_calls_in_flight", limits.maxCallsInFlight);
  limit("max_unread_reply_bytes", limits.maxUnreadReplyBytes);
  limit("max_sessions", limits.maxSessionsPerConnection);
  limit("max_identifiers", limits.maxIdentifiers);
  frame.end();
}

ReplyStream::Fits ReplyStream::reply(uint64_t number, const ReplyValue& value,
                                     std::size_t maxFrameBytes) {
  FrameWriter frame = FrameWriter::reply(out_, number);
  std::visit(ValueWriter{frame.items()}, value);
  if (frame.bodyBytes() > maxFrameBytes) {
    frame.discard();
    return Fits::No;
  }
  frame.end();
  return Fits::Yes;
}

void ReplyStream::error(std::optional<uint64_t> number, wire::ErrorCode code,
                        std::string_view text) {
  FrameWriter::error(out_, number, code, text);
}

void ReplyStream::goodbye() { FrameWriter::goodbye(out_); }

ReplyStream::Peer ReplyStream::writeTo(int socket, Clock& clock) {
  const ssize_t sent =
      send(socket, out_.data() + begin_, unreadBytes(), MSG_DONTWAIT | MSG_NOSIGNAL);
  if (sent < 0 && errno != EAGAIN && errno != EINTR) {
    clear();
    return Peer::Gone;
  }
  if (sent > 0) begin_ += static_cast<std::size_t>(sent);
  if (empty()) {
    clear();
    return Peer::There;
  }
  if (sent > 0 || !lastProgress_) lastProgress_ = clock.monotonic();
  if (begin_ > kKeptBufferBytes) {
    out_.erase(out_.begin(), out_.begin() + static_cast<std::ptrdiff_t>(begin_));
    begin_ = 0;
  }
  return Peer::There;
}

void ReplyStream::clear() {
  begin_ = 0;
  lastProgress_.reset();
  if (out_.capacity() > kKeptBufferBytes)
    out_ = {};
  else
    out_.clear();
}

std::optional<Monotonic> ReplyStream::stallDeadline(std::chrono::nanoseconds patience) const {
  if (!lastProgress_) return std::nullopt;
  return *lastProgress_ + patience;
}

}  // namespace vx::lnx
