// What the service endpoint may be told.
#pragma once

#include <sys/types.h>
#include <unistd.h>

#include <chrono>
#include <cstdint>
#include <vector>

#include "wire/Protocol.h"

namespace vx::lnx {

struct ListenerOptions {
  // The most that maxFrameBytes may be.
  static constexpr uint32_t kLargestFrameBytes = wire::kMaxFrameBytes;

  uint32_t maxConnections = 1024;
  uint32_t maxConnectionsPerUser = 256;
  uint32_t maxSessionsPerConnection = 1024;
  uint32_t maxIdentifiers = 4096;  // in one call
  uint32_t maxCallsInFlight = 1024;
  uint32_t maxFrameBytes = kLargestFrameBytes;
  uint32_t maxUnreadReplyBytes = 256u << 10;
  std::chrono::milliseconds stalledClientTimeout{10000};
  // Who may call privileged operations.
  std::vector<uid_t> killAllowedUsers{0, geteuid()};
  // What the others are told.
  const char* privilegedHint = "[listener] kill_allowed_users in platform.toml says for whom it is";
};

}  // namespace vx::lnx
