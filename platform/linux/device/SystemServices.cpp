#include "platform/linux/device/SystemServices.h"

#include <fcntl.h>
#include <sys/random.h>
#include <sys/sdt.h>
#include <unistd.h>

#include <cstdlib>

namespace vx::lnx {

int32_t ProcProcessInfo::ownProcessIdentifier() { return getpid(); }

std::string ProcProcessInfo::ownProcessName() {
  return shortCommandName(getpid()).value_or("vxreportingd");
}

std::optional<std::string> ProcProcessInfo::shortCommandName(int32_t processIdentifier) {
  if (processIdentifier < 1) return std::nullopt;
  const std::string path = "/proc/" + std::to_string(processIdentifier) + "/comm";
  const int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
  if (fd < 0) return std::nullopt;
  char text[64];
  const ssize_t got = read(fd, text, sizeof text);
  close(fd);
  // A name, at most 16 bytes, and a newline; anything else is not what this file holds.
  if (got < 1 || got > 17 || text[got - 1] != '\n') return std::nullopt;
  return std::string(text, static_cast<std::size_t>(got - 1));
}

void ImmediateProcessControl::exit(int status) { std::_Exit(status); }

uint32_t KernelRandom::below(uint32_t bound) {
  if (bound < 2) return 0;
  const uint32_t limit =
      UINT32_MAX - UINT32_MAX % bound;  // above it the low values would be likelier
  uint32_t value = 0;
  do {
    if (getrandom(&value, sizeof value, 0) != sizeof value) return 0;
  } while (value >= limit);
  return value % bound;
}

void UsdtTracePoint::emit(uint32_t code, uint64_t a, uint64_t b, uint64_t c, uint64_t d) {
  DTRACE_PROBE5(vxreporting, trace, code, a, b, c, d);
}

}  // namespace vx::lnx
