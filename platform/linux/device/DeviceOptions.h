// What the services around the device's hardware may be told.
#pragma once

#include <cstdint>
#include <string>
#include <vector>

namespace vx::lnx {

struct DevicePropertyOptions {
  bool internalBuild = false;     // "InternalBuild"
  int32_t deviceClassNumber = 0;  // "DeviceClassNumber"
};

// A source of driver counters beside the counter tree: a group and subgroup mapped onto something
// the kernel publishes.
struct MappedChannelSource {
  enum class Kind {
    AlsaProc,    // path: /proc/asound or a folder like it; channels from the cards' pcm sub-stream
                 // status files
    Statistics,  // path: a folder with one counter per file, as /sys/class/net/lo/statistics
  };
  std::string group;     // empty: none
  std::string subGroup;  // empty: none
  Kind kind = Kind::Statistics;
  std::string path;
};

struct DriverOptions {
  std::string root = "/run/vxreporting-drivers";  // <root>/<group>[/<subgroup>]/<channel>
  std::vector<MappedChannelSource> mapped;
};

struct OrientationOptions {
  bool deviceSensor = true;        // net.hadess.SensorProxy on the system bus
  std::string interfaceStateFile;  // empty: <runtime>/interface/orientation
};

}  // namespace vx::lnx
