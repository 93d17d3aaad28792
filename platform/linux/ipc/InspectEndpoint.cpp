#include "platform/linux/ipc/InspectEndpoint.h"

#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/ipc/UnixSocket.h"
#include "wire/FrameWriter.h"

namespace vx::lnx {

namespace {

ListenerOptions smallLimits() {
  ListenerOptions limits;
  limits.maxConnections = InspectEndpoint::kMostConnections;
  limits.maxConnectionsPerUser = InspectEndpoint::kMostOfUser;
  limits.maxSessionsPerConnection = 1;
  limits.maxIdentifiers = 64;
  limits.maxCallsInFlight = 8;
  limits.maxFrameBytes = InspectEndpoint::kMostFrameBytes;
  limits.maxUnreadReplyBytes = 64 << 10;
  limits.killAllowedUsers = {0};
  limits.privilegedHint = "ask root";
  return limits;
}

}  // namespace

InspectEndpoint::InspectEndpoint(EventLoop& loop, Executor& executor, Clock& clock,
                                 InspectOptions options)
    : loop_(loop),
      executor_(executor),
      clock_(clock),
      options_(std::move(options)),
      limits_(smallLimits()),
      queue_(executor.makeSerial("com.quorvel.sonik.reporting.inspect",
                                 QualityOfService::UserInteractive)),
      turns_(executor, clock) {
  loop_.addRound([this] { return turns_.runRound(); });
  loop_.addPassEndHook([this] { flushAll(); });
  loop_.addDeadline([this] { return nextStall(); }, [this] { cutStalled(); });
}

Status InspectEndpoint::open(const std::string& runtimeDirectory) {
  group_ = groupNamed(options_.group);
  const std::string path = runtimeDirectory + "/inspect.socket";
  Result<UniqueFd> socket = listenAt(path, group_ ? 0660 : 0600);
  if (!socket.ok()) return socket.status();
  socket_ = std::move(*socket);
  path_ = path;
  // Of a service that is not root: only into a group that it is in. Where that is its own, the
  // socket has it already, and the call may not even be allowed.
  struct stat made {};
  const bool hasGroup = group_ && stat(path_.c_str(), &made) == 0 && made.st_gid == *group_;
  if (group_ && !hasGroup && chown(path_.c_str(), static_cast<uid_t>(-1), *group_) != 0) {
    VX_LOG(nullptr, Info, "%s: cannot give it to the group %s: only root and user %u can look",
           path_.c_str(), options_.group.c_str(), geteuid());
  }
  return {};
}

void InspectEndpoint::serve(const InterfaceDescription& interface, MakeObject makeObject) {
  interface_ = &interface;
  makeObject_ = std::move(makeObject);
  if (!socket_) return;
  if (const Status added = loop_.add(socket_.get(), EPOLLIN, *this); !added.ok())
    VX_LOG(nullptr, Error, "nobody can look into the service: %s", added.text().c_str());
}

void InspectEndpoint::stop() {
  if (!socket_) return;
  loop_.remove(socket_.get(), *this);
  socket_.reset();
  unlink(path_.c_str());
  turns_.end();
  const auto ending = connections_;
  for (const auto& [key, connection] : ending) connection->shutDownNow();
  flushAll();
}

void InspectEndpoint::onReady(uint32_t) {
  VX_DCHECK(executor_.isInteractiveThread());
  UniqueFd peer(accept4(socket_.get(), nullptr, nullptr, SOCK_CLOEXEC));
  if (peer) return admit(std::move(peer));
  if (errno != EAGAIN && errno != ECONNABORTED && errno != EINTR) pauseAccepting();
}

// As SocketListener does.
void InspectEndpoint::pauseAccepting() {
  loop_.remove(socket_.get(), *this);
  const NoCause own;
  queue_->asyncAfter(kAcceptPause, [this] {
    if (socket_ && !loop_.add(socket_.get(), EPOLLIN, *this).ok()) pauseAccepting();
  });
}

bool InspectEndpoint::mayLook(int peer, const ucred& who) const {
  return who.uid == 0 || who.uid == geteuid() || (group_ && peerIsInGroup(peer, who, *group_));
}

void InspectEndpoint::admit(UniqueFd peer) {
  ucred who{};
  socklen_t length = sizeof who;
  if (getsockopt(peer.get(), SOL_SOCKET, SO_PEERCRED, &who, &length) != 0) return;
  if (!mayLook(peer.get(), who)) {
    ++counters_.notPermitted;
    return turnAway(peer, wire::ErrorCode::NotPermitted,
                    "user " + std::to_string(who.uid) +
                        " may not look into the service; root and members of the group " +
                        options_.group + " may");
  }
  const auto ofUser = std::ranges::count_if(
      connections_, [&](const auto& entry) { return entry.second->user() == who.uid; });
  if (connections_.size() >= kMostConnections || ofUser >= kMostOfUser) {
    ++counters_.refusedConnections;
    return turnAway(peer, wire::ErrorCode::TooManyConnections,
                    std::to_string(connections_.size()) + " look into the service already, " +
                        std::to_string(ofUser) + " of them as user " + std::to_string(who.uid));
  }
  ++counters_.accepted;
  auto connection =
      std::make_shared<SocketConnection>(*this, std::move(peer), who.pid, who.uid, kServiceItself);
  connections_.emplace(connection.get(), connection);
  connection->setExportedInterface(*interface_);
  connection->setExportedObject(makeObject_());
  connection->resume();
}

void InspectEndpoint::turnAway(const UniqueFd& peer, wire::ErrorCode code, const std::string& why) {
  VX_LOG(nullptr, Info, "inspect.socket: turned away: %s", why.c_str());
  std::vector<uint8_t> frame;
  wire::FrameWriter::error(frame, std::nullopt, code, why);
  (void)send(peer.get(), frame.data(), frame.size(), MSG_DONTWAIT | MSG_NOSIGNAL);
}

void InspectEndpoint::unreadChanged(SocketConnection& connection, bool unread) {
  if (unread)
    unread_.insert(&connection);
  else
    unread_.erase(&connection);
}

void InspectEndpoint::closed(SocketConnection& connection) {
  VX_DCHECK(executor_.isInteractiveThread());
  const auto found = connections_.find(&connection);
  if (found == connections_.end()) return;
  unread_.erase(&connection);
  // Let go in a turn of its own: the caller may be a method of the connection.
  const NoCause own;
  queue_->async([keep = std::move(found->second)] {});
  connections_.erase(found);
}

void InspectEndpoint::flushAll() {
  for (std::size_t i = 0; i < toFlush_.size(); ++i) toFlush_[i]->flush();
  toFlush_.clear();
}

std::optional<Monotonic> InspectEndpoint::nextStall() const {
  std::optional<Monotonic> earliest;
  for (const SocketConnection* connection : unread_) {
    const std::optional<Monotonic> at = connection->stallDeadline();
    if (at && (!earliest || *at < *earliest)) earliest = at;
  }
  return earliest;
}

void InspectEndpoint::cutStalled() {
  const Monotonic now = clock_.monotonic();
  const std::vector<SocketConnection*> unread(unread_.begin(), unread_.end());
  for (SocketConnection* connection : unread) {
    const std::optional<Monotonic> at = connection->stallDeadline();
    if (at && *at <= now) connection->cutStalled();
  }
}

}  // namespace vx::lnx
