// What a connection needs of the listener that owns it.
#pragma once

#include <memory>

#include "base/Clock.h"
#include "platform/linux/execution/EventLoop.h"
#include "platform/linux/execution/UserAccounts.h"
#include "platform/linux/ipc/CallRecorder.h"
#include "platform/linux/ipc/ListenerCounters.h"
#include "platform/linux/ipc/ListenerOptions.h"
#include "platform/linux/ipc/ReadTurns.h"
#include "wire/FrameReader.h"

namespace vx::lnx {

class SocketConnection;

// Outlives its connections. Everything is called on the interactive thread.
class ConnectionHost {
 public:
  virtual ~ConnectionHost() = default;
  virtual EventLoop& loop() = 0;
  virtual Executor& executor() = 0;
  virtual Clock& clock() = 0;
  virtual const ListenerOptions& limits() const = 0;
  virtual ListenerCounters& counters() = 0;
  virtual CallRecorder& recorder() = 0;
  virtual wire::ReadBuffers& readBuffers() = 0;
  // True while what has been accepted, of that user or in all, must drain first. The connection
  // then waits for continueReading().
  virtual bool readingPaused(UserIndex user) = 0;
  virtual UserAccounts& accounts() = 0;
  // `frameBytes`: what the user must be allowed to hold, besides.
  virtual void waitForReading(const std::shared_ptr<SocketConnection>& connection,
                              std::size_t frameBytes) = 0;
  // Something has come that the connection will read in its turn.
  virtual void readInTurn(uid_t user, std::shared_ptr<TurnTaker> connection) = 0;
  virtual void flushAtPassEnd(const std::shared_ptr<SocketConnection>& connection) = 0;
  // Replies wait because the peer does not read (or no longer do): see stallDeadline().
  virtual void unreadChanged(SocketConnection& connection, bool unread) = 0;
  virtual void closed(SocketConnection& connection) = 0;
};

}  // namespace vx::lnx
