#include "platform/linux/ipc/SocketListener.h"

#include <fcntl.h>
#include <sys/file.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/Log.h"
#include "propertylist/CborWriter.h"

namespace vx::lnx {

namespace {

constexpr std::size_t kReadBufferBytes = 128 << 10;

std::string because(const std::string& what) { return what + ": " + std::strerror(errno); }

// Takes <runtime>/service.lock for as long as this process lives.
int lockDirectory(const std::string& directory, std::string& problem) {
  const std::string path = directory + "/service.lock";
  const int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW, 0644);
  if (fd < 0) {
    problem = because("cannot open " + path);
    return -1;
  }
  if (flock(fd, LOCK_EX | LOCK_NB) != 0) {
    char owner[32] = "";
    const ssize_t got = pread(fd, owner, sizeof owner - 1, 0);
    std::string pid(owner, got > 0 ? static_cast<std::size_t>(got) : 0);
    while (!pid.empty() && pid.back() == '\n') pid.pop_back();
    problem = "another vxreportingd" + (pid.empty() ? "" : " (pid " + pid + ")") + " serves " +
              directory + "; stop it, or set RUNTIME_DIRECTORY to a folder of its own";
    ::close(fd);
    return -1;
  }
  const std::string pid = std::to_string(getpid()) + "\n";
  if (ftruncate(fd, 0) != 0 || pwrite(fd, pid.data(), pid.size(), 0) < 0) {
    // Only a courtesy to whoever finds the lock taken.
  }
  return fd;
}

}  // namespace

SocketListener::SocketListener(EventLoop& loop, Executor& executor, Clock& clock,
                               const ListenerOptions& limits)
    : loop_(loop),
      executor_(executor),
      clock_(clock),
      limits_(limits),
      queue_(executor.makeSerial("com.quorvel.sonik.reporting.listener",
                                 QualityOfService::UserInteractive)),
      readBuffer_(kReadBufferBytes) {
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

SocketListener::~SocketListener() {
  if (fd_ >= 0) ::close(fd_);
  if (spareFd_ >= 0) ::close(spareFd_);
  if (lockFd_ >= 0) ::close(lockFd_);
}

bool SocketListener::open(const std::string& runtimeDirectory, std::string& problem) {
  if (mkdir(runtimeDirectory.c_str(), 0755) != 0 && errno != EEXIST) {
    problem = because("cannot create the runtime directory " + runtimeDirectory) +
              " (set RUNTIME_DIRECTORY to a folder that can be written)";
    return false;
  }
  lockFd_ = lockDirectory(runtimeDirectory, problem);
  if (lockFd_ < 0) return false;
  spareFd_ = ::open("/dev/null", O_RDONLY | O_CLOEXEC);

  const int activated = sd_listen_fds(1);
  if (activated > 0) {
    if (activated > 1 || sd_is_socket_unix(SD_LISTEN_FDS_START, SOCK_STREAM, 1, nullptr, 0) <= 0) {
      problem = "socket activation must pass exactly one listening Unix stream socket";
      return false;
    }
    fd_ = SD_LISTEN_FDS_START;
    fcntl(fd_, F_SETFL, fcntl(fd_, F_GETFL) | O_NONBLOCK);
    return true;
  }

  path_ = runtimeDirectory + "/service.socket";
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path_.size() >= sizeof address.sun_path) {
    problem = "the socket path " + path_ + " is longer than the " +
              std::to_string(sizeof address.sun_path - 1) + " bytes a Unix socket allows";
    path_.clear();
    return false;
  }
  std::memcpy(address.sun_path, path_.c_str(), path_.size() + 1);
  fd_ = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0);
  unlink(path_.c_str());  // left behind by a process that was killed: the lock says that nobody
                          // serves it
  if (fd_ < 0 || bind(fd_, reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
      chmod(path_.c_str(), 0666) != 0 || listen(fd_, SOMAXCONN) != 0) {
    problem = because("cannot listen on " + path_);
    return false;
  }
  return true;
}

void SocketListener::onReady(uint32_t) {
  for (int i = 0; i < kAcceptsPerPass && acceptOne(); ++i) {
  }
}

bool SocketListener::acceptOne() {
  const int fd = accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
  if (fd < 0) {
    if (errno == EMFILE || errno == ENFILE) return turnAwayForLackOfDescriptors();
    return errno == ECONNABORTED || errno == EINTR;
  }
  ucred peer{};
  socklen_t length = sizeof peer;
  if (getsockopt(fd, SOL_SOCKET, SO_PEERCRED, &peer, &length) != 0) {
    ::close(fd);
    return true;
  }
  if (connections_.size() >= limits_.maxConnections) {
    turnAway(fd,
             "the service holds " + std::to_string(connections_.size()) + " connections already");
    return true;
  }
  uint32_t& ofUser = connectionsOfUser_[peer.uid];
  if (ofUser >= limits_.maxConnectionsPerUser) {
    turnAway(fd, "user " + std::to_string(peer.uid) + " holds " + std::to_string(ofUser) +
                     " connections already");
    return true;
  }
  ++ofUser;
  ++counters_.accepted;
  auto connection = std::make_shared<SocketConnection>(*this, fd, peer.pid, peer.uid);
  connections_.emplace(connection.get(), connection);
  queue_->async([this, connection] {
    const std::shared_ptr<ServiceListenerDelegate> delegate = delegate_.lock();
    if (delegate == nullptr || !delegate->listener(*this, connection)) closed(*connection);
  });
  return true;
}

void SocketListener::turnAway(int fd, const std::string& why) {
  ++counters_.refusedConnections;
  VX_LOG(nullptr, Error, "refused a connection: %s", why.c_str());
  std::vector<uint8_t> frame(4);
  CborWriter writer(frame);
  writer.array(4);
  writer.integer(static_cast<int64_t>(FrameKind::Error));
  writer.null();
  writer.integer(static_cast<int64_t>(WireError::TooManyConnections));
  writer.string(why);
  frame[0] = static_cast<uint8_t>(frame.size() - 4);
  frame[1] = static_cast<uint8_t>((frame.size() - 4) >> 8);
  (void)send(fd, frame.data(), frame.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
  ::close(fd);
}

bool SocketListener::turnAwayForLackOfDescriptors() {
  ++counters_.descriptorExhaustions;
  if (spareFd_ < 0) return false;
  ::close(spareFd_);
  const int fd = accept4(fd_, nullptr, nullptr, SOCK_CLOEXEC);
  if (fd >= 0) turnAway(fd, "the service has run out of file descriptors");
  spareFd_ = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
  return fd >= 0;
}

void SocketListener::waitForReading(const std::shared_ptr<SocketConnection>& connection) {
  waiting_.push_back(connection);
}

void SocketListener::congestionEnded() {
  queue_->async([this] {
    std::vector<std::weak_ptr<SocketConnection>> waiting = std::move(waiting_);
    waiting_.clear();
    for (const auto& weak : waiting) {
      if (const auto connection = weak.lock()) connection->continueReading();
    }
  });
}

void SocketListener::unreadChanged(SocketConnection& connection, bool unread) {
  if (unread)
    unread_.insert(&connection);
  else
    unread_.erase(&connection);
}

void SocketListener::closed(SocketConnection& connection) {
  const auto found = connections_.find(&connection);
  if (found == connections_.end()) return;
  const auto user = connectionsOfUser_.find(connection.user());
  if (--user->second == 0) connectionsOfUser_.erase(user);
  unread_.erase(&connection);
  // Let go in a turn of its own: the caller may be a method of the connection.
  queue_->async([keep = std::move(found->second)] {});
  connections_.erase(found);
}

void SocketListener::runPassEnd() {
  if (!waiting_.empty() && !readingPaused()) congestionEnded();
  for (std::size_t i = 0; i < toFlush_.size(); ++i) toFlush_[i]->flush();
  toFlush_.clear();
}

void SocketListener::cutStalled() {
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
  loop_.remove(fd_, *this);
  ::close(fd_);
  fd_ = -1;
  if (!path_.empty()) unlink(path_.c_str());
}

void SocketListener::resume() {
  executor_.adoptInteractiveThread();
  listening_ = loop_.add(fd_, EPOLLIN, *this);
  if (hooks_.listening) hooks_.listening();
  loop_.run();

  if (hooks_.stopping) hooks_.stopping();
  stopListening();
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
