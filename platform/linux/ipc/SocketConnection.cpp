#include "platform/linux/ipc/SocketConnection.h"

#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "propertylist/CborWriter.h"

namespace vx::lnx {

namespace {

using wire::kLengthBytes;
using wire::kProtocolVersion;
constexpr std::size_t kReadBytes = 64 << 10;
// Frames run before the replies they cause get their turn, which bounds how far replies overshoot
// their limit.
constexpr int kFramesPerTurn = 512;
// A buffer larger than this is given back when it is empty.
constexpr std::size_t kKeptBufferBytes = 64 << 10;

uint32_t readLength(const uint8_t* at) {
  return uint32_t{at[0]} | uint32_t{at[1]} << 8 | uint32_t{at[2]} << 16 | uint32_t{at[3]} << 24;
}

void writeLength(uint8_t* at, std::size_t length) {
  for (int i = 0; i < 4; ++i) at[i] = static_cast<uint8_t>(length >> (8 * i));
}

}  // namespace

std::string ListenerCounters::text() const {
  std::string out;
  auto add = [&out](const char* name, uint64_t value) {
    out += out.empty() ? "" : " ";
    out += name;
    out += "=" + std::to_string(value);
  };
  add("accepted", accepted);
  add("calls", calls);
  add("refused_connections", refusedConnections);
  add("descriptor_exhaustions", descriptorExhaustions);
  add("malformed_frames", malformedFrames);
  add("oversized_frames", oversizedFrames);
  add("unknown_operations", unknownOperations);
  add("wrong_arguments", wrongArguments);
  add("too_many_sessions", tooManySessions);
  add("unsupported_versions", unsupportedVersions);
  add("second_replies", secondReplies);
  add("abandoned_calls", abandonedCalls);
  add("oversized_replies", oversizedReplies);
  add("slow_clients_cut", slowClientsCut);
  add("reading_pauses", readingPauses);
  return out;
}

SocketConnection::SocketConnection(ConnectionHost& host, int fd, pid_t pid, uid_t uid)
    : host_(host),
      fd_(fd),
      pid_(pid),
      uid_(uid),
      queue_(host.executor().makeSerial("com.quorvel.sonik.reporting.connection",
                                        QualityOfService::UserInteractive)) {}

SocketConnection::~SocketConnection() {
  if (fd_ >= 0) ::close(fd_);
}

std::string SocketConnection::description() const {
  return "<ClientConnection fd " + std::to_string(fd_) + " pid " + std::to_string(pid_) + " uid " +
         std::to_string(uid_) + ">";
}

void SocketConnection::resume() {
  if (state_ != State::Accepted) return;
  state_ = State::Open;
  interest_ = EPOLLIN;
  if (!host_.loop().add(fd_, interest_, *this)) {
    interest_ = 0;
    queue_->async([self = shared_from_this()] { self->finishReading(End::Interrupted); });
  }
}

// ---------------------------------------------------------------------------------------------------------------------
// Reading

void SocketConnection::onReady(uint32_t events) {
  if (events & (EPOLLOUT | EPOLLERR)) flush();
  if (events & (EPOLLIN | EPOLLHUP | EPOLLERR)) scheduleRead();
}

void SocketConnection::scheduleRead() {
  if (readScheduled_ || state_ != State::Open) return;
  readScheduled_ = true;
  queue_->async([self = shared_from_this()] {
    self->readScheduled_ = false;
    self->readPass();
  });
}

bool SocketConnection::mustPause() const {
  const auto& limits = host_.limits();
  return callsInFlight_ >= limits.maxCallsInFlight ||
         out_.size() - outOffset_ >= limits.maxUnreadReplyBytes;
}

void SocketConnection::pauseReading() {
  ++host_.counters().readingPauses;
  updateInterest();
}

void SocketConnection::continueReading() {
  waitingForHost_ = false;
  updateInterest();
  scheduleRead();
}

void SocketConnection::readPass() {
  if (state_ != State::Open || waitingForHost_) return;
  // Complete frames left over from the read before come first; only when they are through is more
  // read.
  if (hasCompleteFrame()) {
    inOffset_ += runFrames(std::span<const uint8_t>(in_).subspan(inOffset_));
  } else {
    std::span<uint8_t> buffer = host_.readBuffer();
    const std::size_t had = in_.size() - inOffset_;
    const bool inPlace = had <= buffer.size() - kReadBytes;
    ssize_t got = 0;
    if (inPlace) {
      if (had != 0) std::memcpy(buffer.data(), in_.data() + inOffset_, had);
      got = recv(fd_, buffer.data() + had, kReadBytes, MSG_DONTWAIT);
    } else {  // inside a large frame
      in_.resize(in_.size() + kReadBytes);
      got = recv(fd_, in_.data() + inOffset_ + had, kReadBytes, MSG_DONTWAIT);
      in_.resize(inOffset_ + had + static_cast<std::size_t>(got > 0 ? got : 0));
    }
    if (got < 0 && (errno == EAGAIN || errno == EINTR)) return;
    if (got <= 0) return finishReading(End::Interrupted);
    if (inPlace) {
      const std::span<const uint8_t> bytes(buffer.data(), had + static_cast<std::size_t>(got));
      const std::size_t used = runFrames(bytes);
      if (state_ != State::Open) return;
      keepRest(bytes.subspan(used));
    } else {
      inOffset_ += runFrames(std::span<const uint8_t>(in_).subspan(inOffset_));
    }
  }
  if (state_ != State::Open) return;
  if (inOffset_ == in_.size()) keepRest({});
  if (waitingForHost_ || mustPause()) return pauseReading();
  // More bytes in the socket than one read takes are left to the next pass, so that this one's
  // replies leave first.
  if (hasCompleteFrame()) scheduleRead();
}

// Whether in_ starts with a whole frame, or with a length that will be refused.
bool SocketConnection::hasCompleteFrame() const {
  const std::size_t had = in_.size() - inOffset_;
  if (had < kLengthBytes) return false;
  const std::size_t length = readLength(in_.data() + inOffset_);
  return had - kLengthBytes >= length || length > host_.limits().maxFrameBytes;
}

void SocketConnection::keepRest(std::span<const uint8_t> rest) {
  inOffset_ = 0;
  std::vector<uint8_t>& spare = host_.spareBuffer();
  if (!rest.empty()) {
    if (in_.capacity() == 0) in_.swap(spare);
    in_.assign(rest.begin(), rest.end());
    return;
  }
  // Most connections are idle most of the time: they keep no buffer.
  in_.clear();
  if (spare.capacity() < in_.capacity() && in_.capacity() <= 2 * kReadBytes) spare.swap(in_);
  if (in_.capacity() != 0) in_ = std::vector<uint8_t>();
}

std::size_t SocketConnection::runFrames(std::span<const uint8_t> bytes) {
  std::size_t used = 0;
  turnBudget_ = kFramesPerTurn;
  while (turnBudget_-- > 0 && bytes.size() - used >= kLengthBytes) {
    if (mustPause()) break;
    if (host_.readingPaused()) {
      waitingForHost_ = true;
      host_.waitForReading(shared_from_this());
      break;
    }
    const std::size_t length = readLength(bytes.data() + used);
    if (length > host_.limits().maxFrameBytes) {
      ++host_.counters().oversizedFrames;
      fail(WireError::FrameTooLarge, "a frame of " + std::to_string(length) +
                                         " bytes; the limit is " +
                                         std::to_string(host_.limits().maxFrameBytes));
      return used;
    }
    if (bytes.size() - used - kLengthBytes < length) break;
    runFrame(bytes.subspan(used + kLengthBytes, length));
    if (state_ != State::Open) return used;
    used += kLengthBytes + length;
  }
  return used;
}

void SocketConnection::runFrame(std::span<const uint8_t> frame) {
  DecodeError error;
  const std::optional<Frame> items = Frame::decode(frame, &error);
  std::optional<int64_t> kind;
  if (items && !items->empty()) kind = readInteger((*items)[0]);
  if (!items || !kind) {
    ++host_.counters().malformedFrames;
    return fail(WireError::MalformedFrame,
                !items ? error.text + " at byte " + std::to_string(error.offset)
                       : "the first element of a frame must be its kind, an integer");
  }
  if (*kind == static_cast<int64_t>(FrameKind::Hello)) return runHello(*items);
  if (!helloSeen_) {
    ++host_.counters().malformedFrames;
    return fail(WireError::MalformedFrame, "the first frame must be a hello: [0, 1]");
  }
  if (*kind == static_cast<int64_t>(FrameKind::Call)) return runCall(*items);
  if (*kind == static_cast<int64_t>(FrameKind::Goodbye)) return finishReading(End::Orderly);
  ++host_.counters().malformedFrames;
  fail(WireError::MalformedFrame, "unknown kind of frame " + std::to_string(*kind));
}

void SocketConnection::runHello(const Frame& frame) {
  std::optional<int64_t> version;
  if (frame.size() >= 2) version = readInteger(frame[1]);
  if (version != kProtocolVersion) {
    ++host_.counters().unsupportedVersions;
    return fail(
        WireError::UnsupportedVersion,
        "this service speaks version " + std::to_string(kProtocolVersion) + " of the protocol");
  }
  if (helloSeen_) return;
  helloSeen_ = true;
  const auto& limits = host_.limits();
  const std::size_t start = beginFrame();
  CborWriter writer(out_);
  writer.array(3);
  writer.integer(static_cast<int64_t>(FrameKind::Hello));
  writer.integer(kProtocolVersion);
  writer.dictionary(5);
  writer.string("interface");
  writer.string(interface_ != nullptr ? interface_->name : "");
  auto limit = [&writer](std::string_view name, uint64_t value) {
    writer.string(name);
    writer.unsignedInteger(value);
  };
  limit("max_frame_bytes", limits.maxFrameBytes);
  limit("max_calls_in_flight", limits.maxCallsInFlight);
  limit("max_unread_reply_bytes", limits.maxUnreadReplyBytes);
  limit("max_sessions", limits.maxSessionsPerConnection);
  endFrame(start);
}

// ---------------------------------------------------------------------------------------------------------------------
// Writing

std::size_t SocketConnection::beginFrame() {
  const std::size_t start = out_.size();
  out_.resize(start + kLengthBytes);
  return start;
}

void SocketConnection::endFrame(std::size_t start) {
  writeLength(out_.data() + start, out_.size() - start - kLengthBytes);
  wantFlush();
}

void SocketConnection::wantFlush() {
  if (flushQueued_ || state_ == State::Closed) return;
  flushQueued_ = true;
  host_.flushAtPassEnd(shared_from_this());
}

void SocketConnection::sendReply(uint64_t number, const ReplyValue& value) {
  const std::size_t start = beginFrame();
  CborWriter writer(out_);
  writer.array(3);
  writer.integer(static_cast<int64_t>(FrameKind::Reply));
  writer.unsignedInteger(number);
  if (const bool* boolean = std::get_if<bool>(&value)) {
    writer.boolean(*boolean);
  } else if (const uint16_t* code = std::get_if<uint16_t>(&value)) {
    writer.unsignedInteger(*code);
  } else if (const Error* error = std::get_if<Error>(&value)) {
    writer.dictionary(error->reason.empty() ? 2 : 3);
    writer.string("domain");
    writer.string(error->domain);
    writer.string("code");
    writer.integer(error->code);
    if (!error->reason.empty()) {
      writer.string("reason");
      writer.string(error->reason);
    }
  } else if (const Payload* dictionary = std::get_if<Payload>(&value)) {
    writer.encoded(dictionary->encoded());
  } else if (const auto* numbers = std::get_if<std::vector<int64_t>>(&value)) {
    writer.array(numbers->size());
    for (const int64_t element : *numbers) writer.integer(element);
  } else {
    writer.null();
  }
  if (out_.size() - start - kLengthBytes > host_.limits().maxFrameBytes) {
    ++host_.counters().oversizedReplies;
    out_.resize(start);
    return sendError(number, WireError::FrameTooLarge, "the answer does not fit into one frame");
  }
  endFrame(start);
}

void SocketConnection::sendError(std::optional<uint64_t> number, WireError code,
                                 std::string_view text) {
  const std::size_t start = beginFrame();
  CborWriter writer(out_);
  writer.array(4);
  writer.integer(static_cast<int64_t>(FrameKind::Error));
  if (number)
    writer.unsignedInteger(*number);
  else
    writer.null();
  writer.integer(static_cast<int64_t>(code));
  writer.string(text);
  endFrame(start);
}

void SocketConnection::sendGoodbye() {
  if (goodbyeSent_) return;
  goodbyeSent_ = true;
  const std::size_t start = beginFrame();
  CborWriter writer(out_);
  writer.array(1);
  writer.integer(static_cast<int64_t>(FrameKind::Goodbye));
  endFrame(start);
}

void SocketConnection::flush() {
  flushQueued_ = false;
  if (state_ == State::Closed) return;
  if (outOffset_ < out_.size()) {
    const bool wasFull = mustPause();
    const ssize_t sent =
        send(fd_, out_.data() + outOffset_, out_.size() - outOffset_, MSG_DONTWAIT | MSG_NOSIGNAL);
    if (sent < 0 && errno != EAGAIN && errno != EINTR) {
      // The peer is gone. Whoever reads from it finds out; when nobody reads any more, this was the
      // end.
      out_.clear();
      outOffset_ = 0;
      if (state_ == State::Draining) return closeNow();
      return;
    }
    if (sent > 0) outOffset_ += static_cast<std::size_t>(sent);
    if (outOffset_ != out_.size() && (sent > 0 || lastProgress_ == Monotonic{})) {
      lastProgress_ = host_.clock().monotonic();
    }
    if (outOffset_ == out_.size()) {
      outOffset_ = 0;
      lastProgress_ = Monotonic{};
      if (out_.capacity() > kKeptBufferBytes)
        out_ = {};
      else
        out_.clear();
    } else if (outOffset_ > kKeptBufferBytes) {
      out_.erase(out_.begin(), out_.begin() + static_cast<std::ptrdiff_t>(outOffset_));
      outOffset_ = 0;
    }
    if (wasFull && !mustPause()) scheduleRead();
  }
  if (state_ == State::Draining && callsInFlight_ == 0 && out_.empty()) return closeNow();
  updateInterest();
}

void SocketConnection::updateInterest() {
  if (state_ == State::Closed || state_ == State::Accepted) return;
  uint32_t wanted = 0;
  if (state_ == State::Open && !waitingForHost_ && !mustPause()) wanted |= EPOLLIN;
  if (outOffset_ < out_.size() && !flushQueued_) wanted |= EPOLLOUT;
  if (wanted == interest_) return;
  if ((wanted ^ interest_) & EPOLLOUT) host_.unreadChanged(*this, (wanted & EPOLLOUT) != 0);
  // Without any interest the descriptor leaves the set: epoll would go on reporting a hang-up.
  if (wanted == 0)
    host_.loop().remove(fd_, *this);
  else if (interest_ == 0)
    (void)host_.loop().add(fd_, wanted, *this);
  else
    host_.loop().modify(fd_, wanted, *this);
  interest_ = wanted;
}

std::optional<Monotonic> SocketConnection::stallDeadline() const {
  if (outOffset_ == out_.size() || lastProgress_ == Monotonic{}) return std::nullopt;
  return lastProgress_ + host_.limits().stalledClientTimeout;
}

void SocketConnection::cutStalled() {
  ++host_.counters().slowClientsCut;
  out_.clear();
  outOffset_ = 0;
  const bool open = state_ == State::Open;
  if (open)
    sendError(std::nullopt, WireError::ReadsTooSlowly, "replies were not read for too long");
  if (open) finishReading(End::Interrupted);
  closeNow();
}

// ---------------------------------------------------------------------------------------------------------------------
// The end

void SocketConnection::fail(WireError code, std::string_view text) {
  sendError(std::nullopt, code, text);
  finishReading(End::Interrupted);
}

void SocketConnection::finishReading(End end) {
  if (state_ != State::Open) return;
  state_ = State::Draining;
  in_ = {};
  updateInterest();
  // In their own turns on this connection's queue: the caller may be inside a front half.
  queue_->async([self = shared_from_this(), end] {
    if (end == End::Interrupted && self->interruption_) self->interruption_();
    if (self->invalidation_) self->invalidation_();
    self->interruption_ = nullptr;
    self->invalidation_ = nullptr;
    self->object_ = nullptr;  // calls under way hold it as long as they need it
    self->wantFlush();
  });
}

void SocketConnection::shutDown() {
  if (state_ == State::Accepted) state_ = State::Open;
  if (state_ != State::Open) return wantFlush();
  // What the peer sent before now has been accepted: everything complete runs before the goodbye.
  queue_->async([self = shared_from_this()] {
    if (self->state_ != State::Open) return;
    if (self->waitingForHost_ || self->mustPause()) {  // the listener's own deadline bounds this
      self->queue_->asyncAfter(std::chrono::milliseconds(5), [self] { self->shutDown(); });
      return;
    }
    const std::size_t before = self->in_.size() - self->inOffset_;
    const uint64_t calls = self->host_.counters().calls;
    self->readPass();
    if (self->state_ != State::Open) return;
    const bool moved =
        self->in_.size() - self->inOffset_ != before || self->host_.counters().calls != calls;
    if (moved) return self->shutDown();
    self->sendGoodbye();
    self->finishReading(End::Orderly);
  });
}

void SocketConnection::shutDownNow() {
  if (state_ == State::Accepted) state_ = State::Open;
  sendGoodbye();
  finishReading(End::Orderly);
  wantFlush();
}

void SocketConnection::closeNow() {
  if (state_ == State::Closed) return;
  if (interest_ & EPOLLOUT) host_.unreadChanged(*this, false);
  if (interest_ != 0) host_.loop().remove(fd_, *this);
  interest_ = 0;
  state_ = State::Closed;
  ::close(fd_);
  fd_ = -1;
  host_.closed(*this);
}

}  // namespace vx::lnx
