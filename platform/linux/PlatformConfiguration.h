// What `platform.toml` and the service manager's environment say. Every field has a default that
// works with no file.
#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <string>
#include <string_view>
#include <vector>

namespace vx::lnx {

// The service manager's directories, without a trailing slash.
struct Directories {
  std::string runtime;        // RUNTIME_DIRECTORY, or /run/vxreporting
  std::string state;          // STATE_DIRECTORY, or /var/lib/vxreporting
  std::string configuration;  // CONFIGURATION_DIRECTORY, or /etc/vxreporting
  std::string logs;           // LOGS_DIRECTORY, or /var/log/vxreporting
  static Directories fromEnvironment();
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

struct PlatformConfiguration {
  struct Device {
    bool internalBuild = false;     // "InternalBuild"
    int32_t deviceClassNumber = 0;  // "DeviceClassNumber"
  } device;
  struct Log {
    enum class Destination { Auto, Journal, Stderr };
    enum class Level {
      Debug,
      Info,
      Default,
      Error
    };  // lines below it are not written (verbose ones always are)
    Destination destination = Destination::Auto;
    Level level = Level::Default;
    uint32_t burst = 100;         // lines of one log statement at once; 0: no limit
    double refillPerSecond = 10;  // and how fast its allowance comes back
  } log;
  struct Relay {
    std::vector<std::string> backends{"store"};
  } relay;
  struct Store {
    uint64_t maxBytes = 256u << 20;   // of the database file
    uint32_t maxAgeDays = 30;         // 0: no limit
    uint64_t queueBytes = 32u << 20;  // not yet committed; reading from clients pauses above it
    std::chrono::milliseconds commitInterval{200};
  } store;
  struct Listener {
    uint32_t maxConnections = 1024;
    uint32_t maxConnectionsPerUser = 256;
    uint32_t maxSessionsPerConnection = 1024;
    uint32_t maxCallsInFlight = 1024;
    uint32_t maxFrameBytes = 1u << 20;
    uint32_t maxUnreadReplyBytes = 256u << 10;
    std::chrono::milliseconds stalledClientTimeout{10000};
  } listener;
  struct Drivers {
    std::string root = "/run/vxreporting-drivers";  // <root>/<group>[/<subgroup>]/<channel>
    std::vector<MappedChannelSource> mapped;
  } drivers;
  struct Orientation {
    bool deviceSensor = true;        // net.hadess.SensorProxy on the system bus
    std::string interfaceStateFile;  // empty: <runtime>/interface-orientation
  } orientation;
  struct Preferences {
    std::chrono::milliseconds settle{100};  // quiet time after a change before it is announced
    std::chrono::milliseconds pollInterval{3000};  // only while inotify is unavailable
  } preferences;

  // Reads <configuration>/platform.toml. A missing file gives the defaults. Every unknown key,
  // wrong type or value out of range keeps the default and adds one line "file:line: key: what is
  // wrong" to `complaints`; a file that does not parse adds one line with file, line and column and
  // gives the defaults.
  static PlatformConfiguration load(const Directories& directories,
                                    std::vector<std::string>& complaints);
};

}  // namespace vx::lnx
