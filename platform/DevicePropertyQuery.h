// Properties of the device the service runs on.
#pragma once

#include <cstdint>
#include <string_view>

namespace vx {

class DevicePropertyQuery {
 public:
  virtual ~DevicePropertyQuery() = default;
  virtual bool boolean(std::string_view name) = 0;  // false when there is no answer
  virtual int32_t integer(std::string_view name, int32_t defaultValue) = 0;
};

}  // namespace vx
