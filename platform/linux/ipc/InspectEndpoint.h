// The endpoint for those who look into the service: <runtime>/inspect.socket.
#pragma once

#include <sys/socket.h>
#include <sys/types.h>

#include <chrono>
#include <cstddef>
#include <memory>
#include <optional>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "base/Function.h"
#include "base/Status.h"
#include "base/UniqueFd.h"
#include "platform/linux/execution/EventLoop.h"
#include "platform/linux/ipc/ConnectionHost.h"
#include "platform/linux/ipc/InspectOptions.h"
#include "platform/linux/ipc/SocketConnection.h"

namespace vx::lnx {

// For root, the service's own user and the members of a group; nobody else is let in. Its
// connections are those of the service, with smaller bounds: kMostConnections, kMostOfUser of one
// user, frames of kMostFrameBytes either way. They are on nobody's account and are read also while
// the clients are not, so that a busy service can be looked at.
//
// Owned by LinuxPlatform; lives on the interactive thread. Sleeps while nobody asks.
class InspectEndpoint final : public ConnectionHost, private EventLoop::Source {
 public:
  static constexpr uint32_t kMostConnections = 16;
  static constexpr uint32_t kMostOfUser = 8;
  static constexpr uint32_t kMostFrameBytes = 256 << 10;
  using MakeObject = Function<std::shared_ptr<ExportedObject>()>;

  InspectEndpoint(EventLoop& loop, Executor& executor, Clock& clock, InspectOptions options);

  // Once the runtime directory is locked.
  Status open(const std::string& runtimeDirectory);
  // Each connection gets an object of its own. Lets in from here on.
  void serve(const InterfaceDescription& interface, MakeObject makeObject);
  // Lets nobody in any more, and says goodbye to those who are there.
  void stop();
  std::size_t connections() const { return connections_.size(); }

  // ConnectionHost
  EventLoop& loop() override { return loop_; }
  Executor& executor() override { return executor_; }
  Clock& clock() override { return clock_; }
  const ListenerOptions& limits() const override { return limits_; }
  ListenerCounters& counters() override { return counters_; }
  CallRecorder& recorder() override { return nothingRecorded_; }
  wire::ReadBuffers& readBuffers() override { return readBuffers_; }
  bool readingPaused(UserIndex) override { return false; }
  UserAccounts& accounts() override { return executor_.accounts(); }
  void waitForReading(const std::shared_ptr<SocketConnection>&, std::size_t) override {}
  void readInTurn(uid_t user, std::shared_ptr<TurnTaker> connection) override {
    turns_.add(user, std::move(connection));
  }
  void flushAtPassEnd(const std::shared_ptr<SocketConnection>& connection) override {
    toFlush_.push_back(connection);
  }
  void unreadChanged(SocketConnection& connection, bool unread) override;
  void closed(SocketConnection& connection) override;

 private:
  static constexpr std::chrono::milliseconds kAcceptPause{100};

  void onReady(uint32_t events) override;
  void pauseAccepting();
  void admit(UniqueFd peer);
  bool mayLook(int peer, const ucred& who) const;
  void turnAway(const UniqueFd& peer, wire::ErrorCode code, const std::string& why);
  void flushAll();
  std::optional<Monotonic> nextStall() const;
  void cutStalled();

  EventLoop& loop_;
  Executor& executor_;
  Clock& clock_;
  const InspectOptions options_;
  const ListenerOptions limits_;
  CallRecorder nothingRecorded_;
  ListenerCounters counters_;
  const std::shared_ptr<WorkQueue> queue_;
  std::optional<gid_t> group_;
  UniqueFd socket_;
  std::string path_;
  const InterfaceDescription* interface_ = nullptr;
  MakeObject makeObject_;
  ReadTurns turns_;
  wire::ReadBuffers readBuffers_;
  std::unordered_map<SocketConnection*, std::shared_ptr<SocketConnection>> connections_;
  std::vector<std::shared_ptr<SocketConnection>> toFlush_;
  std::unordered_set<SocketConnection*> unread_;
};

}  // namespace vx::lnx
