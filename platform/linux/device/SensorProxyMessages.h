// What messages of the sensor's service, and of the bus about it, say.
#pragma once

#include <cstddef>
#include <optional>
#include <string>

struct sd_bus_message;

namespace vx::lnx {

inline constexpr const char* kSensorName = "net.hadess.SensorProxy";
inline constexpr const char* kProperty = "AccelerometerOrientation";
inline constexpr std::size_t kMaxSensorWordBytes = 64;  // more is cut off

// Each takes a message of any sender, with contents of any types.

// The property's word in the answer to Get; empty when there is none.
std::string propertyIn(sd_bus_message* answer);
// Likewise in PropertiesChanged; the last one where there are several.
std::string changedPropertyIn(sd_bus_message* signal);
// Of NameOwnerChanged: whether the service has an owner now. None: it is not about that.
std::optional<bool> ownerIn(sd_bus_message* signal);

}  // namespace vx::lnx
