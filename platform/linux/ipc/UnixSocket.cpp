#include "platform/linux/ipc/UnixSocket.h"

#include <grp.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <memory>
#include <vector>

namespace vx::lnx {

Result<UniqueFd> listenAt(const std::string& path, mode_t mode) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) {
    return Status::failure("the socket path " + path + " is longer than the " +
                           std::to_string(sizeof address.sun_path - 1) +
                           " bytes a Unix socket allows");
  }
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC | SOCK_NONBLOCK, 0));
  unlink(path.c_str());
  if (!socket ||
      bind(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0 ||
      chmod(path.c_str(), mode) != 0 || listen(socket.get(), SOMAXCONN) != 0) {
    return Status::lastError("cannot listen on " + path);
  }
  return socket;
}

std::optional<gid_t> groupNamed(const std::string& name) {
  struct Closer {
    void operator()(std::FILE* file) const { std::fclose(file); }
  };
  const std::unique_ptr<std::FILE, Closer> groups(std::fopen("/etc/group", "re"));
  if (groups == nullptr) return std::nullopt;
  std::vector<char> text(16 << 10);
  group entry{};
  group* found = nullptr;
  for (;;) {
    const int code = fgetgrent_r(groups.get(), &entry, text.data(), text.size(), &found);
    if (code == ERANGE && text.size() < (1 << 20))
      text.resize(text.size() * 2);  // a line of many members, which is read again
    else if (code != 0)
      return std::nullopt;
    else if (name == entry.gr_name)
      return entry.gr_gid;
  }
}

bool peerIsInGroup(int peer, const ucred& who, gid_t group) {
  if (who.gid == group) return true;
  std::vector<gid_t> groups(32);
  for (int tries = 0; tries < 2; ++tries) {
    auto length = static_cast<socklen_t>(groups.size() * sizeof(gid_t));
    const int got = getsockopt(peer, SOL_SOCKET, SO_PEERGROUPS, groups.data(), &length);
    if (got != 0 && errno != ERANGE) return false;
    groups.resize(length / sizeof(gid_t));
    if (got == 0) return std::ranges::find(groups, group) != groups.end();
  }
  return false;
}

}  // namespace vx::lnx
