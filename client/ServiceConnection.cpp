#include "client/ServiceConnection.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/time.h>
#include <sys/un.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <cstring>
#include <optional>
#include <utility>

namespace vx {

namespace {

using SteadyClock = std::chrono::steady_clock;
using Code = ClientStatus::Code;
using wire::FrameKind;
using wire::FrameReader;
using wire::FrameWriter;

// A buffer larger than this is given back when it is empty.
constexpr std::size_t kKeptBytes = 256 << 10;
// Reads of what a service that takes no more may still have said.
constexpr int kLastReads = 64;
constexpr std::chrono::hours kLongestPatience{24 * 365};

ClientStatus failure(Code code, std::string text) { return {code, std::move(text), "", 0}; }

timeval timeOf(std::chrono::milliseconds time) {
  return {.tv_sec = static_cast<time_t>(time.count() / 1000),
          .tv_usec = static_cast<suseconds_t>(time.count() % 1000 * 1000)};
}

}  // namespace

ServiceConnection::Wait::Wait(Patience wanted)
    : patience(std::clamp<Patience>(wanted, Patience(0), kLongestPatience)),
      deadline(SteadyClock::now() + patience) {}

// ---------------------------------------------------------------------------------------------------------------------
// Connecting and ending

ClientStatus ServiceConnection::open(const std::string& path, Patience patience) {
  const auto self = shared_from_this();
  socketPath_ = path;
  disconnect(failure(Code::Disconnected, "the connection was made anew"));
  if (abandoned_ || isConnected()) return {};  // a callback of the old connection has seen to it
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path)
    return failure(Code::NotConnected,
                   "the socket path " + path + " is too long for a Unix socket");
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  UniqueFd made(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  int error = made ? 0 : errno;
  if (made) {
    // Connecting waits while the service's queue of new connections is full; this bounds it.
    const timeval limit = timeOf(std::max(Wait(patience).patience, Patience(1)));
    setsockopt(made.get(), SOL_SOCKET, SO_SNDTIMEO, &limit, sizeof limit);
    do {
      const int refused =
          ::connect(made.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address);
      error = refused == 0 ? 0 : errno;
    } while (error == EINTR);
  }
  if (error == 0) return begin(std::move(made), patience);
  return failure(Code::NotConnected,
                 "cannot connect to " + path + ": " +
                     (error == EAGAIN ? "it takes no connections" : std::strerror(error)) +
                     " (is vxreportingd running? set VXREPORTING_SOCKET to its socket)");
}

ClientStatus ServiceConnection::adopt(UniqueFd connected, Patience patience) {
  const auto self = shared_from_this();
  disconnect(failure(Code::Disconnected, "the connection was made anew"));
  if (abandoned_ || isConnected()) return {};  // a callback of the old connection has seen to it
  return begin(std::move(connected), patience);
}

ClientStatus ServiceConnection::begin(UniqueFd connected, Patience patience) {
  socket_ = std::move(connected);
  ++generation_;
  reader_.clear();
  reader_.setLimit(wire::kMaxFrameBytes);
  out_.clear();
  outBegin_ = 0;
  writeAt_ = options_.writeAtBytes;
  receiveTimeout_ = Patience(0);
  largestFrame_ = wire::kMaxFrameBytes;
  helloSeen_ = goodbyeSeen_ = false;
  serviceError_.clear();
  FrameWriter::hello(out_).end();
  const uint64_t generation = generation_;
  ClientStatus status = waitUntil([this] { return helloSeen_; }, patience);
  if (status.ok())
    acceptsCalls_ = true;
  else if (generation == generation_)
    disconnect(status);
  return status;
}

ClientStatus ServiceConnection::sayGoodbye(Patience patience) {
  const auto self = shared_from_this();
  if (!isConnected()) return whyNoCalls();
  acceptsCalls_ = false;
  FrameWriter::goodbye(out_);
  const uint64_t generation = generation_;
  ClientStatus status = waitUntil([&] { return generation != generation_; }, patience);
  if (generation == generation_) disconnect(failure(Code::Disconnected, "said goodbye"));
  return status;
}

void ServiceConnection::disconnect(const ClientStatus& why) {
  if (!isConnected()) return;
  const auto self = shared_from_this();
  ended_ = why;
  socket_.reset();
  acceptsCalls_ = false;
  ++generation_;
  for (const CallAnswer& failed : calls_.takeAll()) {
    if (abandoned_) return;
    deliver(failed, why, nullptr);
  }
}

void ServiceConnection::abandon() {
  abandoned_ = true;
  disconnect(failure(Code::Disconnected, "the client was destroyed"));
}

ServiceConnection::Received ServiceConnection::lost(const std::string& what) {
  disconnect(failure(Code::Disconnected, serviceError_.empty() ? what : serviceError_));
  return Received::Ended;
}

ClientStatus ServiceConnection::whyNoCalls() const {
  if (isConnected()) return failure(Code::NotConnected, "goodbye has been said");
  return failure(Code::NotConnected,
                 "not connected to the service" + (ended_.ok() ? "" : " (" + ended_.text + ")"));
}

// ---------------------------------------------------------------------------------------------------------------------
// Writing

FrameWriter ServiceConnection::beginCall(wire::Operation operation, std::size_t arguments) {
  return FrameWriter::call(out_, calls_.nextNumber(), operation, arguments);
}

ClientStatus ServiceConnection::endCall(FrameWriter& call, CallAnswer answer) {
  call.end();
  const std::size_t bytes = wire::kLengthBytes + call.bodyBytes();
  if (call.bodyBytes() > largestFrame_ || bytes > options_.maxBufferedBytes) {
    call.discard();
    return failure(Code::TooLarge, "a call of " + std::to_string(bytes) +
                                       " bytes; the service takes " +
                                       std::to_string(largestFrame_) + ", the buffer " +
                                       std::to_string(options_.maxBufferedBytes));
  }
  const bool tooManyCalls = calls_.size() >= options_.maxPendingCalls;
  if (tooManyCalls || out_.size() - outBegin_ > options_.maxBufferedBytes) {
    const int error = writeUpTo(call.start());
    if (error != 0 || tooManyCalls || out_.size() - outBegin_ > options_.maxBufferedBytes) {
      call.discard();
      if (error != 0) return lostWhileSending(error);
      trimOutput();
      return failure(Code::BufferFull,
                     tooManyCalls
                         ? std::to_string(calls_.size()) + " calls wait for their answers"
                         : "the service is not reading; " +
                               std::to_string(out_.size() - outBegin_) + " bytes wait already");
    }
  }
  calls_.add(std::move(answer));
  if (out_.size() - outBegin_ >= writeAt_) (void)flush();  // a failure is the callbacks' to tell
  return {};
}

int ServiceConnection::writeUpTo(std::size_t end) {
  while (outBegin_ < end) {
    const ssize_t sent =
        send(socket_.get(), out_.data() + outBegin_, end - outBegin_, MSG_DONTWAIT | MSG_NOSIGNAL);
    if (sent >= 0) {
      outBegin_ += static_cast<std::size_t>(sent);
    } else if (errno == EAGAIN || errno == EWOULDBLOCK) {
      break;
    } else if (errno != EINTR) {
      return errno;
    }
  }
  return 0;
}

void ServiceConnection::trimOutput() {
  if (outBegin_ == out_.size()) {
    if (out_.capacity() > kKeptBytes)
      out_ = {};
    else
      out_.clear();
    outBegin_ = 0;
  } else if (outBegin_ > out_.size() / 2) {
    out_.erase(out_.begin(), out_.begin() + static_cast<std::ptrdiff_t>(outBegin_));
    outBegin_ = 0;
  }
  // While the socket is full, a system call per call made would be for nothing.
  writeAt_ = out_.size() - outBegin_ + options_.writeAtBytes;
}

ClientStatus ServiceConnection::flush() {
  if (!isConnected()) return whyNoCalls();
  if (!wantsWrite()) return {};
  if (const int error = writeUpTo(out_.size()); error != 0) return lostWhileSending(error);
  trimOutput();
  return {};
}

// The service takes no more, but what it said before it left is still to be read.
ClientStatus ServiceConnection::lostWhileSending(int error) {
  const auto self = shared_from_this();
  const uint64_t generation = generation_;
  for (int i = 0; i < kLastReads && receive(MSG_DONTWAIT) == Received::Something; ++i) {
    if (generation != generation_) break;
  }
  if (generation == generation_)
    lost(std::string("the service went away: ") + std::strerror(error));
  return ended_;
}

// ---------------------------------------------------------------------------------------------------------------------
// Reading

ClientStatus ServiceConnection::process() {
  if (!isConnected()) return whyNoCalls();
  const auto self = shared_from_this();
  const uint64_t generation = generation_;
  if (ClientStatus status = flush(); !status.ok()) return status;
  if (receive(MSG_DONTWAIT) == Received::Ended) return isConnected() ? ClientStatus() : ended_;
  return generation == generation_ ? flush() : ClientStatus();  // what the callbacks called
}

ServiceConnection::Received ServiceConnection::receive(int flags) {
  const std::span<uint8_t> space = reader_.space();
  const ssize_t got = recv(socket_.get(), space.data(), space.size(), flags);
  if (got < 0 && (errno == EAGAIN || errno == EWOULDBLOCK || errno == EINTR))
    return Received::Nothing;
  if (got < 0) return lost(std::string("the service went away: ") + std::strerror(errno));
  if (got == 0)
    return lost(goodbyeSeen_ ? "the service ended" : "the service closed the connection");
  reader_.received(static_cast<std::size_t>(got));
  return runFrames();
}

// A callback may come here again, for the frames that follow the one it is about.
ServiceConnection::Received ServiceConnection::runFrames() {
  const uint64_t generation = generation_;
  for (;;) {
    std::span<const uint8_t> body;
    switch (reader_.next(body)) {
      case FrameReader::Next::Incomplete:
        return Received::Something;
      case FrameReader::Next::TooLarge:
        return lost("the service sent a frame of " + std::to_string(reader_.nextLength()) +
                    " bytes");
      case FrameReader::Next::Frame:
        if (!runFrame(body)) return lost("the service sent something that is not the protocol");
    }
    if (generation != generation_) return Received::Ended;
  }
}

bool ServiceConnection::runFrame(std::span<const uint8_t> bytes) {
  const std::optional<Frame> frame = Frame::decode(bytes);
  if (!frame || frame->empty()) return false;
  const std::size_t size = frame->size();
  if ((*frame)[0].kind() != ValueKind::Integer) return false;
  const auto is = [kind = (*frame)[0].asInt64()](FrameKind wanted) {
    return kind == static_cast<int64_t>(wanted);
  };
  if (is(FrameKind::Goodbye)) return goodbyeSeen_ = true;
  if (size < 2) return false;
  if (is(FrameKind::Hello)) return runHello(*frame);
  const Value number = (*frame)[1];
  if (is(FrameKind::Reply) && helloSeen_ && size >= 3) {
    const Value value = (*frame)[2];
    answer(number, {}, &value);
    return true;
  }
  if (!is(FrameKind::Error) || size < 4) return false;
  ClientStatus status = failure(Code::Refused, "");
  status.wireCode = (*frame)[2].asInt64();
  status.text = (*frame)[3].asString();
  if (number.kind() == ValueKind::Null)
    serviceError_ = "the service closed the connection: " + status.text;
  else
    answer(number, status, nullptr);
  return true;
}

// [0, version, limits]
bool ServiceConnection::runHello(const Frame& frame) {
  const Value version = frame[1];
  if (helloSeen_ || version.kind() != ValueKind::Integer ||
      version.asInt64() != wire::kProtocolVersion)
    return false;
  helloSeen_ = true;
  if (frame.size() < 3) return true;
  const std::optional<Value> limit = frame[2].asDictionary().find("max_frame_bytes");
  if (limit && limit->kind() == ValueKind::Integer && limit->asInt64() > 0)
    largestFrame_ = std::min<uint64_t>(limit->asUInt64(), wire::kMaxAnnouncedFrameBytes);
  reader_.setLimit(largestFrame_);
  return true;
}

void ServiceConnection::answer(const Value& number, const ClientStatus& status,
                               const Value* value) {
  CallAnswer answered;
  if (number.kind() != ValueKind::Integer || number.asInt64() < 0 ||
      !calls_.take(number.asUInt64(), answered)) {
    ++unknownAnswers_;
    return;
  }
  deliver(answered, status, value);
}

// ---------------------------------------------------------------------------------------------------------------------
// Waiting

void ServiceConnection::setReceiveTimeout(Patience patience) {
  if (patience == receiveTimeout_) return;
  const timeval limit = timeOf(patience);
  if (setsockopt(socket_.get(), SOL_SOCKET, SO_RCVTIMEO, &limit, sizeof limit) == 0)
    receiveTimeout_ = patience;
}

// One write and one read, waiting for the latter. A lone call costs no more than that: the first
// wait is the read itself, bounded by the descriptor's own time-out; only what is left of the
// patience after it, and a socket that takes nothing, need a poll.
ClientStatus ServiceConnection::waitStep(Wait& wait) {
  if (!isConnected()) return ended_.ok() ? whyNoCalls() : ended_;
  if (ClientStatus status = flush(); !status.ok()) return status;
  if (std::exchange(wait.first, false) && !wantsWrite() && wait.patience > Patience(0)) {
    setReceiveTimeout(wait.patience);
    if (receiveTimeout_ == wait.patience) {
      return receive(0) == Received::Ended && !isConnected() ? ended_ : ClientStatus();
    }
  }
  const auto left = std::chrono::ceil<Patience>(wait.deadline - SteadyClock::now()).count();
  if (left <= 0) return failure(Code::TimedOut, "no answer from the service in time");
  pollfd ready{socket_.get(), static_cast<short>(POLLIN | (wantsWrite() ? POLLOUT : 0)), 0};
  const int events = poll(&ready, 1, static_cast<int>(std::min<int64_t>(left, INT_MAX)));
  if (events < 0 && errno != EINTR) {
    lost(std::string("cannot wait for the service: ") + std::strerror(errno));
    return ended_;
  }
  if (events <= 0 || (ready.revents & (POLLIN | POLLHUP | POLLERR | POLLNVAL)) == 0) return {};
  return receive(MSG_DONTWAIT) == Received::Ended && !isConnected() ? ended_ : ClientStatus();
}

}  // namespace vx
