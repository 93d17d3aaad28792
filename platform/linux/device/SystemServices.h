// The small services of this machine: process names, process end, random numbers, trace points,
// device properties.
#pragma once

#include <atomic>
#include <optional>
#include <string>

#include "platform/DevicePropertyQuery.h"
#include "platform/ProcessInfoQuery.h"
#include "platform/TracePoint.h"
#include "platform/linux/device/DeviceOptions.h"

namespace vx::lnx {

// Reads /proc/PID/comm (proc(5): at most 15 bytes and a newline). Stateless.
class ProcProcessInfo final : public ProcessInfoQuery {
 public:
  int32_t ownProcessIdentifier() override;
  std::string ownProcessName() override;
  std::optional<std::string> shortCommandName(int32_t processIdentifier) override;
};

class ImmediateProcessControl final : public ProcessControl {
 public:
  void exit(int status) override;
};

// Uniform, seeded from the kernel. Thread-safe.
class KernelRandom final : public RandomSource {
 public:
  uint32_t below(uint32_t bound) override;
};

// The USDT probe vxreporting:trace(code, a, b, c, d): a no-op instruction while nobody looks.
class UsdtTracePoint final : public TracePoint {
 public:
  void emit(uint32_t code, uint64_t a, uint64_t b, uint64_t c, uint64_t d) override;
};

// Answers "InternalBuild" and "DeviceClassNumber" from the configuration. Immutable.
class ConfiguredDeviceProperties final : public DevicePropertyQuery {
 public:
  explicit ConfiguredDeviceProperties(const DevicePropertyOptions& device) : device_(device) {}
  bool boolean(std::string_view name) override {
    return name == "InternalBuild" && device_.internalBuild;
  }
  int32_t integer(std::string_view name, int32_t defaultValue) override {
    return name == "DeviceClassNumber" ? device_.deviceClassNumber : defaultValue;
  }

 private:
  const DevicePropertyOptions device_;
};

}  // namespace vx::lnx
