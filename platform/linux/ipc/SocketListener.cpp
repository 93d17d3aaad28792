#include "platform/linux/ipc/SocketListener.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>

#include "base/LockFile.h"
#include "platform/Log.h"
#include "platform/linux/execution/SteppedWork.h"
#include "platform/linux/ipc/UnixSocket.h"
#include "wire/FrameWriter.h"

namespace vx::lnx {

namespace {

Result<UniqueFd> lockDirectory(const std::string& directory) {
  const std::string path = directory + "/service.lock";
  Result<UniqueFd> lock = openLockFile(path);
  if (!lock.ok()) return lock;
  if (flock(lock->get(), LOCK_EX | LOCK_NB) != 0) {
    char owner[32] = "";
    const ssize_t got = pread(lock->get(), owner, sizeof owner - 1, 0);
    std::string pid(owner, got > 0 ? static_cast<std::size_t>(got) : 0);
    while (!pid.empty() && pid.back() == '\n') pid.pop_back();
    return Status::failure("another vxreportingd" + (pid.empty() ? "" : " (pid " + pid + ")") +
                           " serves " + directory +
                           "; stop it, or set RUNTIME_DIRECTORY to a folder of its own");
  }
  const std::string pid = std::to_string(getpid()) + "\n";
  if (ftruncate(lock->get(), 0) != 0 || pwrite(lock->get(), pid.data(), pid.size(), 0) < 0) {
    // Only a courtesy to whoever finds the lock taken.
  }
  return lock;
}

// Steps of a user's work take turns with what his connections read, and take a connection's place
// among them, although that is over.
class StepsInTurn final : public TurnTaker, public std::enable_shared_from_this<StepsInTurn> {
 public:
  StepsInTurn(ReadTurns& turns, UserAccounts& accounts, std::unique_ptr<SteppedWork> work)
      : turns_(turns),
        accounts_(accounts),
        account_(work->user()),
        user_(accounts.uidOf(account_)),
        work_(std::move(work)) {
    accounts_.stay(account_);
  }
  ~StepsInTurn() override { accounts_.leave(account_); }
  uid_t user() const { return user_; }
  void takeTurn(ReadTurn& turn) override {
    while (work_->runStep()) {
      if (!turn.goOn()) return turns_.add(user_, shared_from_this());
    }
  }
  void turnsEnded() override {
    while (work_->runStep()) {
    }
  }

 private:
  ReadTurns& turns_;
  UserAccounts& accounts_;
  const UserIndex account_;
  const uid_t user_;
  const std::unique_ptr<SteppedWork> work_;
};

// Given up to turn a client away when descriptors have run out.
UniqueFd spareDescriptor() { return UniqueFd(::open("/dev/null", O_RDONLY | O_CLOEXEC)); }

}  // namespace

SocketListener::SocketListener(EventLoop& loop, Executor& executor, Clock& clock,
                               const ListenerOptions& limits)
    : loop_(loop),
      executor_(executor),
      accounts_(executor.accounts()),
      clock_(clock),
      limits_(limits),
      queue_(executor.makeSerial("com.quorvel.sonik.reporting.listener",
                                 QualityOfService::UserInteractive)),
      turns_(executor, clock) {
  loop_.addRound([this] { return turns_.runRound(); });
  loop_.addPassEndHook([this] { runPassEnd(); });
  loop_.addDeadline(
      [this]() -> std::optional<Monotonic> {
        std::optional<Monotonic> earliest;
        for (const SocketConnection* connection : unread_) {
          const std::optional<Monotonic> at = connection->stallDeadline();
          if (at && (!earliest || *at < *earliest)) earliest = at;
        }
        return earliest;
      },
      [this] { cutStalled(); });
}

Status SocketListener::open(const std::string& runtimeDirectory) {
  if (mkdir(runtimeDirectory.c_str(), 0755) != 0 && errno != EEXIST) {
    return Status::lastError("cannot create the runtime directory " + runtimeDirectory)
        .withHint("set RUNTIME_DIRECTORY to a folder that can be written");
  }
  Result<UniqueFd> lock = lockDirectory(runtimeDirectory);
  if (!lock.ok()) return lock.status();
  lock_ = std::move(*lock);
  spare_ = spareDescriptor();
  const int activated = sd_listen_fds(1);
  return activated > 0 ? adoptActivated(activated) : bindAt(runtimeDirectory + "/service.socket");
}

Status SocketListener::adoptActivated(int sockets) {
  if (sockets > 1 || sd_is_socket_unix(SD_LISTEN_FDS_START, SOCK_STREAM, 1, nullptr, 0) <= 0)
    return Status::failure("socket activation must pass exactly one listening Unix stream socket");
  socket_.reset(SD_LISTEN_FDS_START);
  fcntl(socket_.get(), F_SETFL, fcntl(socket_.get(), F_GETFL) | O_NONBLOCK);
  return {};
}

Status SocketListener::bindAt(const std::string& path) {
  // What was left behind by a process that was killed: the lock says that nobody serves it.
  Result<UniqueFd> socket = listenAt(path, 0666);
  if (!socket.ok()) return socket.status();
  socket_ = std::move(*socket);
  path_ = path;
  return {};
}

void SocketListener::onReady(uint32_t) {
  VX_DCHECK(executor_.isInteractiveThread());
  for (int i = 0; i < kAcceptsPerPass && acceptOne(); ++i) {
  }
}

bool SocketListener::acceptOne() {
  UniqueFd peer(accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC));
  if (!peer) {
    if (errno == ECONNABORTED || errno == EINTR) return true;
    if (errno == EAGAIN) return false;
    if ((errno == EMFILE || errno == ENFILE) && turnAwayForLackOfDescriptors()) return true;
    pauseAccepting();
    return false;
  }
  admit(std::move(peer));
  return true;
}

void SocketListener::admit(UniqueFd peer) {
  ucred who{};
  socklen_t length = sizeof who;
  if (getsockopt(peer.get(), SOL_SOCKET, SO_PEERCRED, &who, &length) != 0) return;
  if (connections_.size() >= limits_.maxConnections) {
    return turnAway(
        peer, "the service holds " + std::to_string(connections_.size()) + " connections already");
  }
  const std::optional<UserIndex> account = accounts_.enter(who.uid);
  if (!account) return turnAway(peer, "the service works for too many users already");
  if (const uint32_t ofUser = accounts_.connections(*account);
      ofUser > limits_.maxConnectionsPerUser) {
    accounts_.leave(*account);
    return turnAway(peer, "user " + std::to_string(who.uid) + " holds " +
                              std::to_string(ofUser - 1) + " connections already");
  }
  ++counters_.accepted;
  auto connection =
      std::make_shared<SocketConnection>(*this, std::move(peer), who.pid, who.uid, *account);
  connections_.emplace(connection.get(), connection);
  queue_->async([this, connection] {
    const std::shared_ptr<ServiceListenerDelegate> delegate = delegate_.lock();
    if (delegate == nullptr) return closed(*connection);
    const Cause cause = connection->recordAccepted();
    const CauseScope scope(cause);
    if (!delegate->listener(*this, connection)) closed(*connection);
  });
}

void SocketListener::turnAway(const UniqueFd& peer, const std::string& why) {
  ++counters_.refusedConnections;
  VX_LOG(nullptr, Error, "refused a connection: %s", why.c_str());
  std::vector<uint8_t> frame;
  wire::FrameWriter::error(frame, std::nullopt, wire::ErrorCode::TooManyConnections, why);
  (void)send(peer.get(), frame.data(), frame.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
}

// Whoever cannot be accepted stays in front, and the loop would be told so again at once.
void SocketListener::pauseAccepting() {
  loop_.remove(socket_.get(), *this);
  const NoCause own;
  queue_->asyncAfter(kAcceptPause, [this] {
    if (listening_ && !loop_.add(socket_.get(), EPOLLIN, *this).ok()) pauseAccepting();
  });
}

bool SocketListener::turnAwayForLackOfDescriptors() {
  ++counters_.descriptorExhaustions;
  if (!spare_) spare_ = spareDescriptor();  // somebody else was faster the last time
  if (!spare_) return false;
  spare_.reset();
  bool turnedAway = false;
  {
    const UniqueFd peer(accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC));
    turnedAway = static_cast<bool>(peer);
    if (turnedAway) turnAway(peer, "the service has run out of file descriptors");
  }
  spare_ = spareDescriptor();
  return turnedAway;
}

std::unordered_map<const ExportedObject*, SocketListener::Recorded>
SocketListener::recordedConnections() const {
  std::unordered_map<const ExportedObject*, Recorded> recorded;
  for (const auto& [key, connection] : connections_) {
    const std::shared_ptr<ExportedObject> object = connection->exportedObject();
    if (object == nullptr || connection->recordedAs() == CallRecorder::kUnrecorded) continue;
    recorded.emplace(object.get(), Recorded{connection->recordedAs(),
                                            connection->processIdentifier(), connection->user()});
  }
  return recorded;
}

void SocketListener::waitForReading(const std::shared_ptr<SocketConnection>& connection,
                                    std::size_t frameBytes) {
  VX_DCHECK(executor_.isInteractiveThread());
  waiting_.push_back({connection, connection->account(), frameBytes});
}

bool SocketListener::mayGoOn(const Waiting& waiting) {
  return waiting.connection.expired() ||
         (!readingPaused(waiting.account) &&
          (waiting.frameBytes == 0 ||
           accounts_.mayHold(waiting.account, MemoryKind::Frames, waiting.frameBytes)));
}

void SocketListener::congestionEnded() {
  const NoCause own;
  queue_->async([this] {
    std::vector<Waiting> waiting;
    waiting.swap(waiting_);
    for (const Waiting& who : waiting) {
      if (const auto connection = who.connection.lock()) connection->continueReading();
    }
  });
}

void SocketListener::unreadChanged(SocketConnection& connection, bool unread) {
  VX_DCHECK(executor_.isInteractiveThread());
  if (unread)
    unread_.insert(&connection);
  else
    unread_.erase(&connection);
}

void SocketListener::closed(SocketConnection& connection) {
  VX_DCHECK(executor_.isInteractiveThread());
  const auto found = connections_.find(&connection);
  if (found == connections_.end()) return;
  accounts_.leave(connection.account());
  unread_.erase(&connection);
  // Let go in a turn of its own: the caller may be a method of the connection.
  const NoCause own;
  queue_->async([keep = std::move(found->second)] {});
  connections_.erase(found);
}

void SocketListener::runPassEnd() {
  VX_DCHECK(executor_.isInteractiveThread());
  if (std::ranges::any_of(waiting_, [this](const Waiting& w) { return mayGoOn(w); }))
    congestionEnded();
  for (std::size_t i = 0; i < toFlush_.size(); ++i) toFlush_[i]->flush();
  toFlush_.clear();
}

void SocketListener::cutStalled() {
  VX_DCHECK(executor_.isInteractiveThread());
  const Monotonic now = clock_.monotonic();
  const std::vector<SocketConnection*> unread(unread_.begin(), unread_.end());
  for (SocketConnection* connection : unread) {
    const std::optional<Monotonic> at = connection->stallDeadline();
    if (at && *at <= now) connection->cutStalled();
  }
}

void SocketListener::stopListening() {
  if (!listening_) return;
  listening_ = false;
  loop_.remove(socket_.get(), *this);
  socket_.reset();
  if (!path_.empty()) unlink(path_.c_str());
}

void SocketListener::resume() {
  executor_.adoptInteractiveThread();
  executor_.setStepsTaker([this](std::unique_ptr<SteppedWork> work) {
    const auto steps = std::make_shared<StepsInTurn>(turns_, accounts_, std::move(work));
    turns_.add(steps->user(), steps);
  });
  const Status added = loop_.add(socket_.get(), EPOLLIN, *this);
  listening_ = added.ok();
  if (!listening_) VX_LOG(nullptr, Error, "no client can connect: %s", added.text().c_str());
  if (hooks_.listening) hooks_.listening();
  loop_.run();

  if (hooks_.stopping) hooks_.stopping();
  stopListening();
  executor_.setStepsTaker(nullptr);
  turns_.end();  // the connections read the rest by themselves
  const Monotonic deadline = clock_.monotonic() + kShutdownTime;
  std::vector<std::shared_ptr<SocketConnection>> ending;
  ending.reserve(connections_.size());
  for (const auto& [key, connection] : connections_) ending.push_back(connection);
  for (const auto& connection : ending) connection->shutDown();
  ending.clear();
  while (!connections_.empty() && clock_.monotonic() < deadline) loop_.runOnce(deadline);
  if (!connections_.empty()) {
    VX_LOG(nullptr, Error, "%zu connections did not end in time", connections_.size());
    for (const auto& [key, connection] : connections_) connection->shutDownNow();
  }
  // What the last goodbyes queued on the service queue.
  while (executor_.runInteractive(1024)) {
  }
  runPassEnd();
  VX_LOG(nullptr, Info, "served: %s", counters_.text().c_str());
}

}  // namespace vx::lnx
