#include "client/ServiceConnection.h"

#include <fcntl.h>
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
// Between attempts to connect again; doubles from one to the other.
constexpr std::chrono::milliseconds kFirstDelay{50};
constexpr std::chrono::milliseconds kLastDelay{5000};

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
  if (path.size() >= sizeof sockaddr_un::sun_path)
    return failure(Code::NotConnected,
                   "the socket path " + path + " is too long for a Unix socket");
  keeping_ = acceptsCalls_ = options_.keepSessions;
  greetedBefore_ = false;
  delay_ = Patience(0);
  UniqueFd made;
  ClientStatus status = dial(Waits::Yes, patience, made);
  if (status.ok()) return begin(std::move(made), patience);
  ended_ = status;
  retryLater();
  return status;
}

ClientStatus ServiceConnection::dial(Waits waits, Patience patience, UniqueFd& made) const {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::memcpy(address.sun_path, socketPath_.c_str(), socketPath_.size() + 1);
  made.reset(
      socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | (waits == Waits::No ? SOCK_NONBLOCK : 0), 0));
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
    if (waits == Waits::No) fcntl(made.get(), F_SETFL, 0);
  }
  if (error == 0) return {};
  return failure(Code::NotConnected,
                 "cannot connect to " + socketPath_ + ": " +
                     (error == EAGAIN ? "it takes no connections" : std::strerror(error)) +
                     " (is vxreportingd running? set VXREPORTING_SOCKET to its socket)");
}

ClientStatus ServiceConnection::adopt(UniqueFd connected, Patience patience) {
  const auto self = shared_from_this();
  disconnect(failure(Code::Disconnected, "the connection was made anew"));
  if (abandoned_ || isConnected()) return {};  // a callback of the old connection has seen to it
  return begin(std::move(connected), patience);
}

void ServiceConnection::attach(UniqueFd connected) {
  socket_ = std::move(connected);
  ++generation_;
  reader_.clear();
  reader_.setLimit(wire::kMaxFrameBytes);
  writeAt_ = options_.writeAtBytes;
  receiveTimeout_ = Patience(0);
  largestFrame_ = wire::kMaxFrameBytes;
  goodbyeSeen_ = false;
  serviceError_.clear();
  // A new socket has space for it. A service that does not want to hear it has said why.
  std::vector<uint8_t> hello;
  FrameWriter::hello(hello).end();
  (void)send(socket_.get(), hello.data(), hello.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
}

ClientStatus ServiceConnection::begin(UniqueFd connected, Patience patience) {
  attach(std::move(connected));
  const uint64_t generation = generation_;
  ClientStatus status = waitUntil([this] { return helloSeen_; }, patience);
  if (status.ok())
    acceptsCalls_ = true;
  else if (generation == generation_ && !keeping_)
    disconnect(status);
  return status;
}

ClientStatus ServiceConnection::sayGoodbye(Patience patience) {
  const auto self = shared_from_this();
  if (!isConnected() && !keeping_) return whyNoCalls();
  const Wait wait(patience);
  ClientStatus status = waitUntil([this] { return helloSeen_ || !keeping_; }, patience);
  if (!helloSeen_) {
    disconnect(failure(Code::Disconnected, "said goodbye without a connection"));
    return status;
  }
  acceptsCalls_ = keeping_ = false;
  FrameWriter::goodbye(out_);
  const uint64_t generation = generation_;
  status = waitUntil([&] { return generation != generation_; },
                     std::chrono::ceil<Patience>(wait.deadline - SteadyClock::now()));
  if (generation == generation_) disconnect(failure(Code::Disconnected, "said goodbye"));
  return status;
}

void ServiceConnection::disconnect(const ClientStatus& why) {
  if (!isConnected() && !keeping_) return;
  const auto self = shared_from_this();
  ended_ = why;
  socket_.reset();
  acceptsCalls_ = helloSeen_ = keeping_ = false;
  ++generation_;
  const uint64_t unwritten = firstUnwritten();
  kept_.clear();
  out_.clear();
  outBegin_ = frameBegin_ = restorationEnd_ = 0;
  counters_.dropped += calls_.nextNumber() - unwritten;
  fail(calls_.takeBefore(calls_.nextNumber()), why);
}

void ServiceConnection::fail(const std::vector<CallAnswer>& calls, const ClientStatus& why) {
  for (const CallAnswer& call : calls) {
    if (abandoned_) return;
    deliver(call, why, nullptr);
  }
}

void ServiceConnection::abandon() {
  abandoned_ = true;
  disconnect(failure(Code::Disconnected, "the client was destroyed"));
}

// ---------------------------------------------------------------------------------------------------------------------
// Sessions that outlive the connection

void ServiceConnection::interrupted(const ClientStatus& why) {
  const auto self = shared_from_this();
  ended_ = why;
  socket_.reset();
  helloSeen_ = false;
  ++generation_;
  retryLater();
  const uint64_t unwritten = firstUnwritten();
  const std::set<uint64_t> held = kept_.heldStarts();
  const std::size_t gone = std::max(frameBegin_, restorationEnd_);
  out_.erase(out_.begin(), out_.begin() + static_cast<std::ptrdiff_t>(gone));
  outBegin_ = frameBegin_ = restorationEnd_ = 0;
  const std::vector<CallAnswer> failed = calls_.takeBefore(unwritten, held);
  counters_.unanswered += failed.size();
  fail(failed, why);
}

std::optional<ServiceConnection::Patience> ServiceConnection::retryIn() const {
  if (!keeping_ || isConnected()) return {};
  return std::max(Patience(0), std::chrono::ceil<Patience>(retryAt_ - SteadyClock::now()));
}

void ServiceConnection::retryLater() {
  retryAt_ = SteadyClock::now() + delay_;
  delay_ = std::clamp(2 * delay_, kFirstDelay, kLastDelay);
}

void ServiceConnection::maybeReconnect() {
  if (retryIn() != Patience(0)) return;
  UniqueFd made;
  ended_ = dial(Waits::No, Patience(0), made);
  if (ended_.ok())
    attach(std::move(made));
  else
    retryLater();
}

// The service has greeted: before anything that waits, it gets the sessions.
void ServiceConnection::restoreSessions() {
  counters_.reconnections += greetedBefore_ ? 1 : 0;
  greetedBefore_ = true;
  std::vector<uint8_t> again;
  counters_.sessionsNotRestored += kept_.restore(again, largestFrame_);
  restorationEnd_ = again.size();
  again.insert(again.end(), out_.begin(), out_.end());
  out_ = std::move(again);
}

// What has begun to be written is as good as written: part of it may be what ended the connection.
void ServiceConnection::noteWritten() {
  while (frameBegin_ < outBegin_) {
    const std::span<const uint8_t> body = frameAt(frameBegin_);
    if (frameBegin_ >= restorationEnd_) kept_.written(body);
    frameBegin_ += wire::kLengthBytes + body.size();
  }
}

uint64_t ServiceConnection::firstUnwritten() const {
  const std::size_t at = std::max(frameBegin_, restorationEnd_);
  if (!options_.keepSessions || at == out_.size()) return calls_.nextNumber();
  const std::span<const uint8_t> body = frameAt(at);
  return body.size() > wire::kCallHead ? KeptSessions::numberOf(body)
                                       : calls_.nextNumber();  // a goodbye
}

std::span<const uint8_t> ServiceConnection::frameAt(std::size_t at) const {
  std::size_t length = 0;
  for (std::size_t i = wire::kLengthBytes; i-- > 0;) length = length << 8 | out_[at + i];
  return {out_.data() + at + wire::kLengthBytes, length};
}

ServiceConnection::Received ServiceConnection::lost(const std::string& what) {
  const ClientStatus why =
      failure(Code::Disconnected, serviceError_.empty() ? what : serviceError_);
  if (keeping_)
    interrupted(why);
  else
    disconnect(why);
  return Received::Ended;
}

ClientStatus ServiceConnection::whyNoCalls() const {
  if (isConnected())
    return failure(Code::NotConnected,
                   keeping_ ? "the service has not greeted yet" : "goodbye has been said");
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
    const int error = mayWrite() ? writeUpTo(call.start()) : 0;
    if (error != 0 || tooManyCalls || out_.size() - outBegin_ > options_.maxBufferedBytes) {
      call.discard();
      if (error != 0) {
        ClientStatus status = lostWhileSending(error);
        if (!keeping_) return status;
      }
      trimOutput();
      counters_.dropped += options_.keepSessions ? 1 : 0;
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
      if (options_.keepSessions) noteWritten();
    } else if (errno == EAGAIN || errno == EWOULDBLOCK) {
      break;
    } else if (errno != EINTR) {
      return errno;
    }
  }
  return 0;
}

void ServiceConnection::trimOutput() {
  const std::size_t written = outBegin_;
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
  if (outBegin_ == 0) {  // it has left the buffer
    frameBegin_ -= std::min(frameBegin_, written);
    restorationEnd_ -= std::min(restorationEnd_, written);
  }
  // While the socket is full, a system call per call made would be for nothing.
  writeAt_ = out_.size() - outBegin_ + options_.writeAtBytes;
}

ClientStatus ServiceConnection::flush() {
  if (!isConnected()) return keeping_ ? ClientStatus() : whyNoCalls();
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
  return keeping_ ? ClientStatus() : ended_;
}

// ---------------------------------------------------------------------------------------------------------------------
// Reading

ClientStatus ServiceConnection::process() {
  maybeReconnect();
  if (!isConnected()) return keeping_ ? ClientStatus() : whyNoCalls();
  const auto self = shared_from_this();
  const uint64_t generation = generation_;
  if (!keeping_) {  // otherwise what a service that leaves has said comes first
    if (ClientStatus status = flush(); !status.ok()) return status;
  }
  if (receive(MSG_DONTWAIT) == Received::Ended)
    return isConnected() || keeping_ ? ClientStatus() : ended_;
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
  std::optional<Value> limit;
  if (frame.size() > 2) limit = frame[2].asDictionary().find("max_frame_bytes");
  if (limit && limit->kind() == ValueKind::Integer && limit->asInt64() > 0)
    largestFrame_ = std::min<uint64_t>(limit->asUInt64(), wire::kMaxAnnouncedFrameBytes);
  reader_.setLimit(largestFrame_);
  if (keeping_) restoreSessions();
  return true;
}

void ServiceConnection::answer(const Value& number, const ClientStatus& status,
                               const Value* value) {
  if (keeping_ && number.asUInt64() >= KeptSessions::kFirstNumber) {
    counters_.sessionsNotRestored +=
        !status.ok() && KeptSessions::isCreation(number.asUInt64()) ? 1 : 0;
    return;
  }
  CallAnswer answered;
  if (number.kind() != ValueKind::Integer || number.asInt64() < 0 ||
      !calls_.take(number.asUInt64(), answered)) {
    ++unknownAnswers_;
    return;
  }
  delay_ = Patience(0);  // the service works
  if (keeping_ && std::holds_alternative<ReportingClient::Callback<bool>>(answered))
    kept_.answered(number.asUInt64(), !status.ok());
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
  maybeReconnect();
  if (!isConnected() && !keeping_) return ended_.ok() ? whyNoCalls() : ended_;
  if (ClientStatus status = flush(); !status.ok()) return status;
  const auto receiving = [this](int flags) {
    return receive(flags) == Received::Ended && !isConnected() && !keeping_ ? ended_
                                                                            : ClientStatus();
  };
  if (isConnected() && std::exchange(wait.first, false) && !wantsWrite() &&
      wait.patience > Patience(0)) {
    setReceiveTimeout(wait.patience);
    if (receiveTimeout_ == wait.patience) return receiving(0);
  }
  const auto left = std::chrono::ceil<Patience>(wait.deadline - SteadyClock::now()).count();
  if (left <= 0)
    return failure(Code::TimedOut, "no answer from the service in time" +
                                       (isConnected() ? "" : " (" + ended_.text + ")"));
  if (const std::optional<Patience> retry = retryIn()) {
    poll(nullptr, 0, static_cast<int>(std::min<int64_t>(left, retry->count())));
    return {};
  }
  pollfd ready{socket_.get(), static_cast<short>(POLLIN | (wantsWrite() ? POLLOUT : 0)), 0};
  const int events = poll(&ready, 1, static_cast<int>(std::min<int64_t>(left, INT_MAX)));
  if (events < 0 && errno != EINTR) {
    lost(std::string("cannot wait for the service: ") + std::strerror(errno));
    return ended_;
  }
  if (events <= 0 || (ready.revents & (POLLIN | POLLHUP | POLLERR | POLLNVAL)) == 0) return {};
  return receiving(MSG_DONTWAIT);
}

}  // namespace vx
