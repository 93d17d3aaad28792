// Listening Unix stream sockets.
#pragma once

#include <sys/socket.h>
#include <sys/types.h>

#include <optional>
#include <string>

#include "base/Status.h"
#include "base/UniqueFd.h"

namespace vx::lnx {

// Binds the path, in the place of whatever a process left there that was killed, and listens.
Result<UniqueFd> listenAt(const std::string& path, mode_t mode);

// The group's number, from /etc/group: nothing else is loaded for it. None: there is no such group.
std::optional<gid_t> groupNamed(const std::string& name);
// Whether the peer is in the group, as its own or a supplementary one.
bool peerIsInGroup(int peer, const ucred& who, gid_t group);

}  // namespace vx::lnx
