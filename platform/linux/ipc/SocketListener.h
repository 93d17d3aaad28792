// The service endpoint: a Unix stream socket, the connections made to it, and the loop that serves
// them.
#pragma once

#include <sys/types.h>

#include <cstdint>
#include <memory>
#include <string>
#include <unordered_map>
#include <unordered_set>
#include <vector>

#include "base/Status.h"
#include "base/UniqueFd.h"
#include "platform/ServiceListener.h"
#include "platform/linux/execution/EventLoop.h"
#include "platform/linux/ipc/ListenerOptions.h"
#include "platform/linux/ipc/SocketConnection.h"

namespace vx::lnx {

// Owned by LinuxPlatform; lives on the interactive thread. Holds at most maxConnections
// connections, and maxConnectionsPerUser of one user; those above are answered with an error and
// closed.
class SocketListener final : public ServiceListener,
                             public ConnectionHost,
                             private EventLoop::Source {
 public:
  // What lies behind the service: whether it is congested, and how to wait for what it has
  // accepted.
  struct Hooks {
    Function<bool(uid_t)> congested;  // for that user; cheap; asked before every frame
    Function<void()> listening;       // the endpoint accepts clients now
    Function<void()> stopping;        // it no longer does
  };

  SocketListener(EventLoop& loop, Executor& executor, Clock& clock, const ListenerOptions& limits);

  // Takes the activated socket, or locks the runtime directory and binds <runtime>/service.socket.
  // A failure says what to do about it.
  Status open(const std::string& runtimeDirectory);
  void setHooks(Hooks hooks) { hooks_ = std::move(hooks); }
  // Before resume(); outlives this. Without one nothing is recorded.
  void setRecorder(CallRecorder& recorder) { recorder_ = &recorder; }

  // ServiceListener
  void setDelegate(std::weak_ptr<ServiceListenerDelegate> delegate) override {
    delegate_ = std::move(delegate);
  }
  // Serves until the loop is stopped, then ends every connection in order, within kShutdownTime.
  void resume() override;

  // The recorded connections, by the objects that they export.
  struct Recorded {
    uint64_t connection = 0;
    pid_t pid = 0;
    uid_t uid = 0;
  };
  std::unordered_map<const ExportedObject*, Recorded> recordedConnections() const;
  std::shared_ptr<ServiceListenerDelegate> delegate() const { return delegate_.lock(); }
  std::size_t connectionCount() const { return connections_.size(); }
  // Every connection, for whoever looks into the service.
  void forEachConnection(const Function<void(const SocketConnection&)>& each) const {
    for (const auto& [key, connection] : connections_) each(*connection);
  }

  // From any thread: what was congested no longer is.
  void congestionEnded();

  // ConnectionHost
  EventLoop& loop() override { return loop_; }
  Executor& executor() override { return executor_; }
  Clock& clock() override { return clock_; }
  const ListenerOptions& limits() const override { return limits_; }
  ListenerCounters& counters() override { return counters_; }
  CallRecorder& recorder() override { return *recorder_; }
  wire::ReadBuffers& readBuffers() override { return readBuffers_; }
  bool readingPaused(UserIndex user) override {
    return accounts_.isPaused(user) || hooks_.congested(accounts_.uidOf(user));
  }
  UserAccounts& accounts() override { return accounts_; }
  void waitForReading(const std::shared_ptr<SocketConnection>& connection,
                      std::size_t frameBytes) override;
  void readInTurn(uid_t user, std::shared_ptr<TurnTaker> connection) override {
    turns_.add(user, std::move(connection));
  }
  void flushAtPassEnd(const std::shared_ptr<SocketConnection>& connection) override {
    toFlush_.push_back(connection);
  }
  void unreadChanged(SocketConnection& connection, bool unread) override;
  void closed(SocketConnection& connection) override;

 private:
  static constexpr std::chrono::seconds kShutdownTime{2};
  static constexpr int kAcceptsPerPass = 16;
  static constexpr std::chrono::milliseconds kAcceptPause{100};

  void onReady(uint32_t events) override;
  Status adoptActivated(int sockets);
  Status bindAt(const std::string& path);
  bool acceptOne();  // false when there are none, or not now
  void pauseAccepting();
  void admit(UniqueFd peer);
  // Accepts and turns away one connection with the descriptor kept for that. False when there is
  // none to spare.
  bool turnAwayForLackOfDescriptors();
  void turnAway(const UniqueFd& peer, const std::string& why);
  void runPassEnd();
  void cutStalled();
  void stopListening();

  EventLoop& loop_;
  Executor& executor_;
  UserAccounts& accounts_;
  Clock& clock_;
  const ListenerOptions limits_;
  Hooks hooks_;
  CallRecorder nothingRecorded_;
  CallRecorder* recorder_ = &nothingRecorded_;
  ListenerCounters counters_;
  std::weak_ptr<ServiceListenerDelegate> delegate_;
  std::shared_ptr<WorkQueue> queue_;
  UniqueFd socket_;
  UniqueFd lock_;   // <runtime>/service.lock, taken as long as this process lives
  UniqueFd spare_;  // given up for a moment to turn a client away when descriptors have run out
  bool listening_ = false;
  std::string path_;  // bound here, to be removed at the end; empty for an activated socket
  ReadTurns turns_;
  wire::ReadBuffers readBuffers_;
  std::unordered_map<SocketConnection*, std::shared_ptr<SocketConnection>> connections_;
  std::vector<std::shared_ptr<SocketConnection>> toFlush_;
  struct Waiting {
    std::weak_ptr<SocketConnection> connection;
    UserIndex account;
    std::size_t frameBytes;
  };
  bool mayGoOn(const Waiting& waiting);
  std::vector<Waiting> waiting_;
  std::unordered_set<SocketConnection*> unread_;
};

}  // namespace vx::lnx
