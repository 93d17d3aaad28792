// Names of processes, from /proc.
#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "platform/ProcessInfoQuery.h"

namespace vx::lnx {

// Reads /proc/PID/comm (proc(5): at most 15 bytes and a newline). Stateless, so thread-safe.
class ProcProcessInfo final : public ProcessInfoQuery {
 public:
  int32_t ownProcessIdentifier() override;
  std::string ownProcessName() override;
  std::optional<std::string> shortCommandName(int32_t processIdentifier) override;
};

}  // namespace vx::lnx
