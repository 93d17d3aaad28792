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
#include <vector>

#include "platform/ClientConnection.h"
#include "platform/WorkQueue.h"
#include "platform/linux/execution/EventLoop.h"
#include "platform/linux/ipc/ListenerOptions.h"
#include "wire/Protocol.h"

namespace vx::lnx {

using WireError = wire::ErrorCode;
using wire::FrameKind;

// What was refused or cut, for the log. Interactive thread only.
struct ListenerCounters {
  uint64_t accepted = 0;
  uint64_t refusedConnections = 0;
  uint64_t descriptorExhaustions = 0;
  uint64_t malformedFrames = 0;
  uint64_t oversizedFrames = 0;
  uint64_t unknownOperations = 0;
  uint64_t wrongArguments = 0;
  uint64_t tooManySessions = 0;
  uint64_t unsupportedVersions = 0;
  uint64_t secondReplies = 0;
  uint64_t abandonedCalls = 0;
  uint64_t oversizedReplies = 0;
  uint64_t slowClientsCut = 0;
  uint64_t readingPauses = 0;
  uint64_t calls = 0;
  std::string text() const;
};

class SocketConnection;

// What a connection needs of the listener that owns it.
class ConnectionHost {
 public:
  virtual ~ConnectionHost() = default;
  virtual EventLoop& loop() = 0;
  virtual Executor& executor() = 0;
  virtual Clock& clock() = 0;
  virtual const ListenerOptions& limits() const = 0;
  virtual ListenerCounters& counters() = 0;
  // 64 KiB to read into behind as much room for what was left of the read before; shared by all
  // connections.
  virtual std::span<uint8_t> readBuffer() = 0;
  // A buffer that a connection with nothing left over lends to the next one that has.
  virtual std::vector<uint8_t>& spareBuffer() = 0;
  // True while what has been accepted must drain first. The connection then waits for
  // continueReading().
  virtual bool readingPaused() = 0;
  virtual void waitForReading(const std::shared_ptr<SocketConnection>& connection) = 0;
  virtual void flushAtPassEnd(const std::shared_ptr<SocketConnection>& connection) = 0;
  // Replies wait because the peer does not read (or no longer do): see stallDeadline().
  virtual void unreadChanged(SocketConnection& connection, bool unread) = 0;
  virtual void closed(SocketConnection& connection) = 0;
};

// Owned by SocketListener until it is closed. Everything but reply() and release() belongs to the
// interactive thread; handlers and front halves run on its own serial queue there. Stops reading
// while maxCallsInFlight calls are unanswered, while maxUnreadReplyBytes of replies are unread, and
// while the service is congested; is cut when unread replies make no progress for
// stalledClientTimeout.
class SocketConnection final : public ClientConnection,
                               public ReplyTarget,
                               public EventLoop::Source,
                               public std::enable_shared_from_this<SocketConnection> {
 public:
  // Takes the descriptor.
  SocketConnection(ConnectionHost& host, int fd, pid_t pid, uid_t uid);
  ~SocketConnection() override;

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

  uid_t user() const { return uid_; }
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
  enum class End : uint8_t { Orderly, Interrupted };
  struct Slot {
    uint64_t number = 0;
    uint32_t generation = 0;
    bool used = false;
    bool answered = false;
    bool counted = false;  // counts as a call in flight
  };

  void scheduleRead();
  void readPass();
  // Runs complete frames at the front of `bytes`; returns how many bytes they were.
  std::size_t runFrames(std::span<const uint8_t> bytes);
  bool mustPause() const;
  bool hasCompleteFrame() const;
  void keepRest(std::span<const uint8_t> rest);
  void pauseReading();
  void runFrame(std::span<const uint8_t> frame);
  void runHello(const Frame& frame);
  void runCall(const Frame& frame);
  static std::optional<int64_t> readInteger(const Value& value);  // none for other kinds
  bool readArguments(const OperationDescription& operation, const Frame& frame,
                     CallArguments& arguments, std::string& problem) const;
  bool admitResource(const OperationDescription& operation, const CallArguments& arguments);
  uint64_t openSlot(uint64_t number, bool counted);
  Slot* slotFor(uint64_t token);
  void settle(Slot& slot);

  void sendReply(uint64_t number, const ReplyValue& value);
  void sendError(std::optional<uint64_t> number, WireError code, std::string_view text);
  void sendGoodbye();
  // Frames are appended to out_: beginFrame leaves room for the length, endFrame fills it in.
  std::size_t beginFrame();
  void endFrame(std::size_t start);
  void wantFlush();

  void fail(WireError code,
            std::string_view text);  // a broken peer: error frame, interruption, invalidation
  void finishReading(End end);
  void closeNow();
  void updateInterest();

  ConnectionHost& host_;
  int fd_;
  const pid_t pid_;
  const uid_t uid_;
  State state_ = State::Accepted;
  bool helloSeen_ = false;
  bool readScheduled_ = false;
  bool waitingForHost_ = false;
  bool flushQueued_ = false;
  bool goodbyeSent_ = false;
  uint32_t interest_ = 0;
  uint32_t callsInFlight_ = 0;
  const InterfaceDescription* interface_ = nullptr;
  std::shared_ptr<ExportedObject> object_;
  Function<void()> interruption_;
  Function<void()> invalidation_;
  std::shared_ptr<WorkQueue> queue_;
  std::vector<uint8_t> in_;  // what is left of the last read, from inOffset_
  std::size_t inOffset_ = 0;
  int turnBudget_ = 0;  // frames that may still run before the replies they cause get their turn
  std::vector<uint8_t> out_;  // not yet written, from outOffset_
  std::size_t outOffset_ = 0;
  Monotonic lastProgress_{};
  std::vector<Slot> slots_;
  std::vector<uint32_t> freeSlots_;
  std::unordered_set<int64_t> resources_;  // at most maxSessionsPerConnection
};

}  // namespace vx::lnx
