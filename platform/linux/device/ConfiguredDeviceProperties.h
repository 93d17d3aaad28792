// Device properties from the configuration.
#pragma once

#include "platform/DevicePropertyQuery.h"
#include "platform/linux/device/DeviceOptions.h"

namespace vx::lnx {

// Answers "InternalBuild" and "DeviceClassNumber". Immutable.
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
