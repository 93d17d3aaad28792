#include "platform/linux/ipc/SocketConnection.h"

#include <sys/socket.h>

#include <algorithm>
#include <cerrno>
#include <new>
#include <stdexcept>

#include "platform/Log.h"
#include "platform/linux/ipc/ArgumentReading.h"

namespace vx::lnx {

namespace {

using wire::FrameKind;
using wire::FrameReader;
using WireError = wire::ErrorCode;

// Frames that run before what they have queued does: by so many calls a turn may be overrun, and
// replies their limit.
constexpr int kFramesPerStep = 16;

// None for other kinds.
std::optional<int64_t> readInteger(const Value& value) {
  if (value.kind() != ValueKind::Integer) return std::nullopt;
  return value.asInt64();
}

}  // namespace

SocketConnection::SocketConnection(ConnectionHost& host, UniqueFd socket, pid_t pid, uid_t uid,
                                   UserIndex account)
    : host_(host),
      socket_(std::move(socket)),
      pid_(pid),
      uid_(uid),
      account_(account),
      queue_(host.executor().makeSerial("com.quorvel.sonik.reporting.connection",
                                        QualityOfService::UserInteractive)),
      reader_(host.readBuffers()) {
  reader_.setLimit(host.limits().maxFrameBytes);
}

std::string SocketConnection::description() const {
  return "<ClientConnection fd " + std::to_string(socket_.get()) + " pid " + std::to_string(pid_) +
         " uid " + std::to_string(uid_) + ">";
}

void SocketConnection::resume() {
  assertInteractive();
  VX_DCHECK(interface_ != nullptr && object_ != nullptr);
  if (state_ != State::Accepted) return;
  state_ = State::Open;
  interest_ = EPOLLIN;
  if (const Status added = host_.loop().add(socket_.get(), interest_, *this); !added.ok()) {
    VX_LOG(nullptr, Error, "a client is turned away: %s", added.text().c_str());
    interest_ = 0;
    async([self = shared_from_this()] { self->finishReading(End::Interrupted); });
  }
}

Cause SocketConnection::recordAccepted() {
  assertInteractive();
  CallRecorder::Accepted accepted = host_.recorder().accepted(pid_, uid_);
  recordedAs_ = accepted.connection;
  return {std::move(accepted.ticket), {}, account_};
}

void SocketConnection::async(Work work) {
  const NoCause own;
  queue_->async(std::move(work));
}

// ---------------------------------------------------------------------------------------------------------------------
// Reading

void SocketConnection::onReady(uint32_t events) {
  assertInteractive();
  if (events & (EPOLLOUT | EPOLLERR)) flush();
  if (events & (EPOLLIN | EPOLLHUP | EPOLLERR)) scheduleRead();
}

void SocketConnection::scheduleRead() {
  if (readScheduled_ || state_ != State::Open) return;
  readScheduled_ = true;
  host_.readInTurn(uid_, shared_from_this());
}

void SocketConnection::takeTurn(ReadTurn& turn) {
  assertInteractive();
  readScheduled_ = false;
  const Lane::Current onQueue(queue_.get());
  try {
    readPass(&turn);
  } catch (const std::bad_alloc& failure) {
    onNoMemory(failure.what());
    fail(WireError::TooMuchMemory, "the service has no memory for this call; try later");
  }
}

// One who has read everything may always ask.
bool SocketConnection::mustPause() const {
  const ListenerOptions& limits = host_.limits();
  return calls_.inFlight() >= limits.maxCallsInFlight ||
         replies_.unreadBytes() >= limits.maxUnreadReplyBytes ||
         (unreadCounted_ > 0 && !host_.accounts().mayHold(account_, MemoryKind::Unread, 0));
}

void SocketConnection::pauseReading() {
  ++host_.counters().readingPauses;
  updateInterest();
}

void SocketConnection::continueReading() {
  assertInteractive();
  waitingForHost_ = false;
  updateInterest();
  scheduleRead();
}

void SocketConnection::readPass(ReadTurn* turn) {
  queue_->assertIsCurrent();
  if (state_ != State::Open || waitingForHost_) return;
  // Complete frames left over from the read before come first; only when they are through is more
  // read.
  if (!reader_.hasNext() && !(mayGatherFrame() && readSocket())) return;
  runFrames(turn);
  if (state_ != State::Open) return;
  reader_.keepRest();
  countFrames();
  if (waitingForHost_ || mustPause()) return pauseReading();
  // More bytes in the socket than one read takes are left to the next pass, so that this one's
  // replies leave first.
  if (reader_.hasNext()) scheduleRead();
}

// A large frame is gathered in memory of its own, which is the user's before it is touched: where
// he holds too much of it the frame waits for others of his, of which one at least can always end.
bool SocketConnection::mayGatherFrame() {
  if (reader_.unread() < wire::kLengthBytes) return true;
  const std::size_t length = reader_.nextLength();
  if (length <= wire::ReadBuffers::kReadBytes || length <= framesCounted_) return true;
  const std::size_t more = length - framesCounted_;
  if (!host_.accounts().mayHold(account_, MemoryKind::Frames, more)) {
    waitingForHost_ = true;
    host_.waitForReading(shared_from_this(), more);
    pauseReading();
    return false;
  }
  count(MemoryKind::Frames, framesCounted_, length);
  return true;
}

void SocketConnection::countFrames() {
  const bool gathers = reader_.unread() >= wire::kLengthBytes && !reader_.hasNext() &&
                       reader_.nextLength() == framesCounted_;
  if (!gathers) count(MemoryKind::Frames, framesCounted_, reader_.unread());
}

void SocketConnection::count(MemoryKind kind, std::size_t& counted, std::size_t bytes) {
  if (bytes > counted)
    host_.accounts().add(account_, kind, bytes - counted);
  else if (bytes < counted)
    host_.accounts().remove(account_, kind, counted - bytes);
  counted = bytes;
}

bool SocketConnection::readSocket() {
  const std::span<uint8_t> space = reader_.space();
  const ssize_t got = recv(socket_.get(), space.data(), space.size(), MSG_DONTWAIT);
  if (got < 0 && (errno == EAGAIN || errno == EINTR)) return false;
  if (got <= 0) {
    finishReading(End::Interrupted);
    return false;
  }
  reader_.received(static_cast<std::size_t>(got));
  return true;
}

void SocketConnection::runFrames(ReadTurn* turn) {
  stepBudget_ = kFramesPerStep;
  while (state_ == State::Open && reader_.unread() >= wire::kLengthBytes) {
    if (stepBudget_-- <= 0) {
      if (turn == nullptr || !turn->goOn()) return;
      stepBudget_ = kFramesPerStep;
      continue;
    }
    if (mustPause()) return;
    if (host_.readingPaused(account_)) {
      waitingForHost_ = true;
      host_.waitForReading(shared_from_this(), 0);
      return;
    }
    std::span<const uint8_t> body;
    switch (reader_.next(body)) {
      case FrameReader::Next::Incomplete:
        return;
      case FrameReader::Next::TooLarge:
        ++host_.counters().oversizedFrames;
        return fail(WireError::FrameTooLarge, "a frame of " + std::to_string(reader_.nextLength()) +
                                                  " bytes; the limit is " +
                                                  std::to_string(host_.limits().maxFrameBytes));
      case FrameReader::Next::Frame:
        runFrame(body);
    }
  }
}

void SocketConnection::onNoMemory(const char* why) {
  ++host_.counters().callsGivenUp;
  VX_LOG(nullptr, Error, "a call of user %u was given up: %s", uid_, why);
}

void SocketConnection::runFrame(std::span<const uint8_t> body) {
  DecodeError error;
  const std::optional<Frame> frame = Frame::decode(body, &error);
  if (!frame) return failMalformed(error.text + " at byte " + std::to_string(error.offset));
  const std::optional<int64_t> kind = frame->empty() ? std::nullopt : readInteger((*frame)[0]);
  if (!kind) return failMalformed("the first element of a frame must be its kind, an integer");
  if (*kind == static_cast<int64_t>(FrameKind::Hello)) return runHello(*frame);
  if (!helloSeen_) return failMalformed("the first frame must be a hello: [0, 1]");
  if (*kind == static_cast<int64_t>(FrameKind::Call)) return runCall(*frame);
  if (*kind == static_cast<int64_t>(FrameKind::Goodbye)) return finishReading(End::Orderly);
  failMalformed("unknown kind of frame " + std::to_string(*kind));
}

void SocketConnection::runHello(const Frame& frame) {
  if (helloSeen_) return;  // whatever it says
  const std::optional<int64_t> version = frame.size() < 2 ? std::nullopt : readInteger(frame[1]);
  if (version != wire::kProtocolVersion) {
    ++host_.counters().unsupportedVersions;
    return fail(WireError::UnsupportedVersion, "this service speaks version " +
                                                   std::to_string(wire::kProtocolVersion) +
                                                   " of the protocol");
  }
  helloSeen_ = true;
  replies_.hello(interface_->name, host_.limits());
  wantFlush();
}

// ---------------------------------------------------------------------------------------------------------------------
// Calls

void SocketConnection::runCall(const Frame& frame) {
  ++host_.counters().calls;
  std::optional<int64_t> number;
  std::optional<int64_t> operationNumber;
  if (frame.size() >= wire::kCallHead) {
    number = readInteger(frame[1]);
    operationNumber = readInteger(frame[2]);
    // A number as good as any other, and none of an operation.
    if (frame[2].kind() == ValueKind::Unsigned) operationNumber = INT64_MAX;
  }
  if (!number || *number < 0 || !operationNumber)
    return failMalformed("a call is [1, number, operation, argument...]");
  const auto callNumber = static_cast<uint64_t>(*number);
  if (*operationNumber < 1 ||
      static_cast<uint64_t>(*operationNumber) > interface_->operations.size()) {
    ++host_.counters().unknownOperations;
    return sendError(callNumber, WireError::UnknownOperation,
                     "there is no operation " + frame[2].text());
  }
  const OperationDescription& operation =
      interface_->operations[static_cast<std::size_t>(*operationNumber - 1)];
  if (operation.privileged && !isPrivileged()) {
    ++host_.counters().notPermitted;
    return sendError(callNumber, WireError::NotPermitted,
                     std::string(operation.name) + " is not for user " + std::to_string(uid_) +
                         "; " + host_.limits().privilegedHint);
  }
  const uint32_t mostIdentifiers = host_.limits().maxIdentifiers;
  if (const std::size_t named = longestArray(operation, frame); named > mostIdentifiers) {
    ++host_.counters().tooManyIdentifiers;
    return sendError(callNumber, WireError::TooManyIdentifiers,
                     "the call names " + std::to_string(named) + " identifiers; the limit is " +
                         std::to_string(mostIdentifiers) + ", use several calls");
  }
  CallArguments arguments;
  if (const Status read = readArguments(operation, frame, arguments); !read.ok()) {
    ++host_.counters().wrongArguments;
    return sendError(callNumber, WireError::WrongArguments, read.text());
  }
  if (operation.holds && host_.accounts().isFull(account_)) {
    ++host_.counters().tooMuchMemory;
    return sendError(callNumber, WireError::TooMuchMemory,
                     "the service holds too much for user " + std::to_string(uid_) +
                         " already; stop or destroy some sessions first");
  }
  if (!admitResource(operation, arguments)) {
    ++host_.counters().tooManySessions;
    return sendError(callNumber, WireError::TooManySessions,
                     "this connection holds " + std::to_string(resources_.size()) +
                         " sessions already; destroy some first");
  }
  if (operation.isHeavy != nullptr && operation.isHeavy(arguments)) stepBudget_ = 0;
  const uint64_t token =
      calls_.open(callNumber, operation.replyMayBeHeld ? CallTable::Answer::MayBeHeld
                                                       : CallTable::Answer::Soon);
  Reply reply(weak_from_this(), token);
  try {
    const Cause cause = recordCall(operation, frame, arguments);
    const CauseScope scope(cause);
    operation.invoke(*object_, arguments, std::move(reply));
  } catch (const std::bad_alloc& failure) {
    onNoMemory(failure.what());  // the peer is told that it was let go of
  } catch (const std::length_error& failure) {
    onNoMemory(failure.what());
  }
}

// The dictionary that the operation gets lies where it was recorded, or else on the heap.
Cause SocketConnection::recordCall(const OperationDescription& operation, const Frame& frame,
                                   CallArguments& arguments) {
  const std::optional<std::size_t> element = dictionaryElement(operation, frame);
  CallRecorder::Called called;
  if (operation.recorded && recordedAs_ != CallRecorder::kUnrecorded)
    called = host_.recorder().called(recordedAs_, frame, element);
  if (element) {
    if (!called.dictionary) called.dictionary = frame.payload(*element);
    arguments.set(*element - wire::kCallHead, std::move(called.dictionary));
  }
  return {std::move(called.ticket), {}, account_};
}

bool SocketConnection::admitResource(const OperationDescription& operation,
                                     const CallArguments& arguments) {
  if (operation.resource == ResourceEffect::Release) resources_.erase(arguments.int64(0));
  if (operation.resource != ResourceEffect::Acquire) return true;
  if (resources_.size() >= host_.limits().maxSessionsPerConnection &&
      !resources_.contains(arguments.int64(0))) {
    return false;
  }
  resources_.insert(arguments.int64(0));
  return true;
}

bool SocketConnection::isPrivileged() const {
  const std::vector<uid_t>& users = host_.limits().killAllowedUsers;
  return std::ranges::find(users, uid_) != users.end();
}

void SocketConnection::settle(CallTable::Call& call) {
  const std::size_t before = calls_.inFlight();
  calls_.settle(call);
  if (calls_.inFlight() == before) return;
  if (before >= host_.limits().maxCallsInFlight && state_ == State::Open) {
    updateInterest();
    scheduleRead();
  }
  if (state_ == State::Draining && calls_.inFlight() == 0) wantFlush();
}

void SocketConnection::reply(uint64_t token, ReplyValue value) {
  if (!host_.executor().isInteractiveThread()) {
    async([self = shared_from_this(), token, value = std::move(value)]() mutable {
      self->reply(token, std::move(value));
    });
    return;
  }
  CallTable::Call* const call = calls_.find(token);
  if (call == nullptr || state_ == State::Closed) return;
  if (call->settled) {
    ++host_.counters().secondReplies;
    return;
  }
  if (replies_.reply(call->number, value, host_.limits().maxFrameBytes) == ReplyStream::Fits::Yes) {
    wantFlush();
  } else {
    ++host_.counters().oversizedReplies;
    sendError(call->number, WireError::FrameTooLarge, "the answer does not fit into one frame");
  }
  settle(*call);
}

void SocketConnection::release(uint64_t token) {
  if (!host_.executor().isInteractiveThread()) {
    async([self = shared_from_this(), token] { self->release(token); });
    return;
  }
  CallTable::Call* const call = calls_.find(token);
  if (call == nullptr) return;
  if (!call->settled) {
    if (state_ == State::Open) {
      ++host_.counters().abandonedCalls;
      sendError(call->number, WireError::Abandoned,
                "the service let go of this call without an answer");
    }
    settle(*call);
  }
  calls_.close(token);
}

// ---------------------------------------------------------------------------------------------------------------------
// Writing

void SocketConnection::wantFlush() {
  assertInteractive();
  if (flushQueued_ || state_ == State::Closed) return;
  flushQueued_ = true;
  host_.flushAtPassEnd(shared_from_this());
}

void SocketConnection::sendError(std::optional<uint64_t> number, WireError code,
                                 std::string_view text) {
  replies_.error(number, code, text);
  wantFlush();
}

void SocketConnection::sendGoodbye() {
  if (goodbyeSent_) return;
  goodbyeSent_ = true;
  replies_.goodbye();
  wantFlush();
}

void SocketConnection::flush() {
  assertInteractive();
  flushQueued_ = false;
  if (state_ == State::Closed) return;
  if (!replies_.empty()) {
    const bool wasFull = mustPause();
    const ReplyStream::Peer peer = replies_.writeTo(socket_.get(), host_.clock());
    if (peer == ReplyStream::Peer::Gone && state_ == State::Draining) return closeNow();
    countUnread();
    // Also of a peer that is gone: what it sent before still runs, and its end is read behind that.
    if (wasFull && !mustPause()) scheduleRead();
  }
  if (state_ == State::Draining && calls_.inFlight() == 0 && replies_.empty()) return closeNow();
  updateInterest();
}

void SocketConnection::countUnread() {
  count(MemoryKind::Unread, unreadCounted_, replies_.unreadBytes());
}

void SocketConnection::updateInterest() {
  assertInteractive();
  countUnread();
  if (state_ == State::Closed || state_ == State::Accepted) return;
  uint32_t wanted = 0;
  if (state_ == State::Open && !waitingForHost_ && !mustPause()) wanted |= EPOLLIN;
  if (!replies_.empty() && !flushQueued_) wanted |= EPOLLOUT;
  if (wanted == interest_) return;
  if ((wanted ^ interest_) & EPOLLOUT) host_.unreadChanged(*this, (wanted & EPOLLOUT) != 0);
  // Without any interest the descriptor leaves the set: epoll would go on reporting a hang-up.
  if (wanted == 0)
    host_.loop().remove(socket_.get(), *this);
  else if (interest_ == 0)
    (void)host_.loop().add(socket_.get(), wanted, *this);
  else
    host_.loop().modify(socket_.get(), wanted, *this);
  interest_ = wanted;
}

std::optional<Monotonic> SocketConnection::stallDeadline() const {
  return replies_.stallDeadline(host_.limits().stalledClientTimeout);
}

// Without a word: the socket is full, and in the middle of a frame.
void SocketConnection::cutStalled() {
  assertInteractive();
  ++host_.counters().slowClientsCut;
  replies_.clear();
  finishReading(End::Interrupted);
  closeNow();
}

// ---------------------------------------------------------------------------------------------------------------------
// The end

void SocketConnection::fail(WireError code, std::string_view text) {
  sendError(std::nullopt, code, text);
  finishReading(End::Interrupted);
}

void SocketConnection::failMalformed(std::string_view text) {
  ++host_.counters().malformedFrames;
  fail(WireError::MalformedFrame, text);
}

void SocketConnection::finishReading(End end) {
  assertInteractive();
  if (state_ != State::Open) return;
  state_ = State::Draining;
  reader_.clear();
  countFrames();
  updateInterest();
  // In their own turns on this connection's queue: the caller may be inside a front half.
  async([self = shared_from_this(), end] {
    {
      Cause cause{.user = self->account_};
      if (self->recordedAs_ != CallRecorder::kUnrecorded)
        cause.ticket = self->host_.recorder().ended(self->recordedAs_, end);
      const CauseScope scope(cause);
      if (end == End::Interrupted && self->interruption_) self->interruption_();
      if (self->invalidation_) self->invalidation_();
    }
    self->interruption_ = nullptr;
    self->invalidation_ = nullptr;
    self->object_ = nullptr;  // calls under way hold it as long as they need it
    self->wantFlush();
  });
}

void SocketConnection::shutDown() {
  assertInteractive();
  if (state_ == State::Accepted) state_ = State::Open;
  if (state_ != State::Open) return wantFlush();
  // What the peer sent before now has been accepted: everything complete runs before the goodbye.
  async([self = shared_from_this()] {
    if (self->state_ != State::Open) return;
    if (self->waitingForHost_ || self->mustPause()) {  // the listener's own deadline bounds this
      self->queue_->asyncAfter(std::chrono::milliseconds(5), [self] { self->shutDown(); });
      return;
    }
    const std::size_t before = self->reader_.unread();
    const uint64_t calls = self->host_.counters().calls;
    self->readPass(nullptr);
    if (self->state_ != State::Open) return;
    const bool moved = self->reader_.unread() != before || self->host_.counters().calls != calls;
    if (moved) return self->shutDown();
    self->sendGoodbye();
    self->finishReading(End::ServiceStopped);
  });
}

void SocketConnection::shutDownNow() {
  assertInteractive();
  if (state_ == State::Accepted) state_ = State::Open;
  sendGoodbye();
  finishReading(End::ServiceStopped);
  wantFlush();
}

void SocketConnection::closeNow() {
  assertInteractive();
  if (state_ == State::Closed) return;
  if (interest_ & EPOLLOUT) host_.unreadChanged(*this, false);
  if (interest_ != 0) host_.loop().remove(socket_.get(), *this);
  interest_ = 0;
  state_ = State::Closed;
  replies_.clear();
  countUnread();
  socket_.reset();
  host_.closed(*this);
}

}  // namespace vx::lnx
