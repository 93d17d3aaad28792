#include "platform/linux/device/ProcProcessInfo.h"

#include <unistd.h>

#include "base/FileReading.h"

namespace vx::lnx {

namespace {

constexpr std::size_t kMaxCommandBytes = 17;  // a name of at most 16 bytes, and a newline

}  // namespace

int32_t ProcProcessInfo::ownProcessIdentifier() { return getpid(); }

std::string ProcProcessInfo::ownProcessName() {
  return shortCommandName(getpid()).value_or("vxreportingd");
}

std::optional<std::string> ProcProcessInfo::shortCommandName(int32_t processIdentifier) {
  if (processIdentifier < 1) return std::nullopt;
  const Result<std::string> text =
      readRegularFile("/proc/" + std::to_string(processIdentifier) + "/comm", kMaxCommandBytes);
  // What does not end in a newline is not what this file holds.
  if (!text.ok() || text->empty() || text->back() != '\n') return std::nullopt;
  return text->substr(0, text->size() - 1);
}

}  // namespace vx::lnx
