// One client's end of the service socket.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <unordered_set>

#include "base/UniqueFd.h"
#include "platform/ClientConnection.h"
#include "platform/WorkQueue.h"
#include "platform/linux/ipc/CallTable.h"
#include "platform/linux/ipc/ConnectionHost.h"
#include "platform/linux/ipc/ReadTurns.h"
#include "platform/linux/ipc/ReplyStream.h"
#include "wire/FrameReader.h"

namespace vx::lnx {

// The state machine of one connection: what may be read and when, what each frame starts, and how
// it ends.
//
//   Accepted --resume()--> Open --goodbye, end of stream, broken frame, shutDown()--> Draining
//   Draining --all calls settled, all replies written or the peer gone--> Closed
//
// Owned by SocketListener until it is closed. Everything but reply() and release() belongs to the
// interactive thread; handlers and front halves run on its own serial queue there, or as if they
// did: it reads when the listener gives it a turn. Stops reading
// while maxCallsInFlight calls are unanswered, while maxUnreadReplyBytes of replies are unread, and
// while too much of its user waits in the service; is cut when unread replies make no progress for
// stalledClientTimeout. Holds at most maxSessionsPerConnection resources for its peer.
class SocketConnection final : public ClientConnection,
                               public ReplyTarget,
                               public EventLoop::Source,
                               public TurnTaker,
                               public std::enable_shared_from_this<SocketConnection> {
 public:
  // `account`: the user's, as long as this is not closed.
  SocketConnection(ConnectionHost& host, UniqueFd socket, pid_t pid, uid_t uid, UserIndex account);

  // ClientConnection
  int32_t processIdentifier() const override { return pid_; }
  std::string description() const override;
  void setExportedInterface(const InterfaceDescription& interface) override {
    interface_ = &interface;
  }
  void setExportedObject(std::shared_ptr<ExportedObject> object) override {
    object_ = std::move(object);
  }
  std::shared_ptr<ExportedObject> exportedObject() const override { return object_; }
  void setInterruptionHandler(Function<void()> handler) override {
    interruption_ = std::move(handler);
  }
  void setInvalidationHandler(Function<void()> handler) override {
    invalidation_ = std::move(handler);
  }
  void resume() override;

  // ReplyTarget; any thread.
  void reply(uint64_t token, ReplyValue value) override;
  void release(uint64_t token) override;

  void onReady(uint32_t events) override;
  void takeTurn(ReadTurn& turn) override;

  uid_t user() const { return uid_; }
  UserIndex account() const { return account_; }
  uint64_t recordedAs() const { return recordedAs_; }
  std::size_t callsInFlight() const { return calls_.inFlight(); }
  std::size_t unreadReplyBytes() const { return replies_.unreadBytes(); }
  bool isReadingPaused() const { return waitingForHost_ || mustPause(); }
  // What the service does next belongs to this connection's being accepted.
  Cause recordAccepted();
  // The listener says that reading may go on.
  void continueReading();
  // Writes what is waiting; closes when that was all that was left to do.
  void flush();
  // When this connection is cut for not reading; none while nothing is unread.
  std::optional<Monotonic> stallDeadline() const;
  void cutStalled();
  // The service ends: runs the complete frames that have arrived, says goodbye and invalidates.
  void shutDown();
  // As shutDown(), but at once: time has run out.
  void shutDownNow();

 private:
  enum class State : uint8_t {
    Accepted,  // not resumed yet
    Open,
    Draining,  // no more reading; what was called before is answered, then it closes
    Closed,
  };
  using End = CallRecorder::End;

  void assertInteractive() const { VX_DCHECK(host_.executor().isInteractiveThread()); }

  // Later, in a turn of its own, and for no call's sake.
  void async(Work work);
  void scheduleRead();
  // Without a turn a few frames run, and what they queue afterwards.
  void readPass(ReadTurn* turn);
  bool readSocket();  // false when there is nothing to run
  void runFrames(ReadTurn* turn);
  bool mustPause() const;
  void pauseReading();
  void runFrame(std::span<const uint8_t> body);
  void onNoMemory(const char* why);
  void runHello(const Frame& frame);
  void runCall(const Frame& frame);
  Cause recordCall(const OperationDescription& operation, const Frame& frame,
                   CallArguments& arguments);
  bool isPrivileged() const;
  bool admitResource(const OperationDescription& operation, const CallArguments& arguments);
  void settle(CallTable::Call& call);
  bool mayGatherFrame();
  void countFrames();
  void countUnread();
  void count(MemoryKind kind, std::size_t& counted, std::size_t bytes);

  void sendError(std::optional<uint64_t> number, wire::ErrorCode code, std::string_view text);
  void sendGoodbye();
  void wantFlush();

  // A broken peer: error frame, interruption, invalidation.
  void fail(wire::ErrorCode code, std::string_view text);
  void failMalformed(std::string_view text);
  void finishReading(End end);
  void closeNow();
  void updateInterest();

  ConnectionHost& host_;
  UniqueFd socket_;
  const pid_t pid_;
  const uid_t uid_;
  const UserIndex account_;
  uint64_t recordedAs_ = CallRecorder::kUnrecorded;
  const std::shared_ptr<WorkQueue> queue_;
  State state_ = State::Accepted;
  bool helloSeen_ = false;
  bool readScheduled_ = false;
  bool waitingForHost_ = false;
  bool flushQueued_ = false;
  bool goodbyeSent_ = false;
  uint32_t interest_ = 0;  // what the loop watches for; 0: it does not know the socket
  int stepBudget_ = 0;     // of frames that may still run before what they have queued
  const InterfaceDescription* interface_ = nullptr;
  std::shared_ptr<ExportedObject> object_;
  Function<void()> interruption_;
  Function<void()> invalidation_;
  wire::FrameReader reader_;
  CallTable calls_;
  ReplyStream replies_;
  // Bytes on the user's account: of replies, and of what was read or is to be and has not run.
  std::size_t unreadCounted_ = 0;
  std::size_t framesCounted_ = 0;
  std::unordered_set<int64_t> resources_;
};

}  // namespace vx::lnx
