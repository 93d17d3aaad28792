// What `platform.toml` and the service manager's environment say. Every field has a default that
// works with no file.
#pragma once

#include <string>
#include <vector>

#include "platform/linux/device/DeviceOptions.h"
#include "platform/linux/diagnostics/LogOptions.h"
#include "platform/linux/execution/MemoryLimits.h"
#include "platform/linux/ipc/InspectOptions.h"
#include "platform/linux/ipc/ListenerOptions.h"
#include "platform/linux/settings/PreferencesOptions.h"
#include "platform/linux/store/StoreOptions.h"

namespace vx::lnx {

// The service manager's directories, without a trailing slash.
struct Directories {
  std::string runtime;        // RUNTIME_DIRECTORY, or /run/vxreporting
  std::string state;          // STATE_DIRECTORY, or /var/lib/vxreporting
  std::string configuration;  // CONFIGURATION_DIRECTORY, or /etc/vxreporting
  std::string logs;           // LOGS_DIRECTORY, or /var/log/vxreporting
  static Directories fromEnvironment();
};

struct PlatformConfiguration {
  DevicePropertyOptions device;
  LogOptions log;
  struct Relay {
    std::vector<std::string> backends{"store"};  // of kRelayBackendNames
  } relay;
  MemoryLimits memory;
  StoreOptions store;
  ListenerOptions listener;
  InspectOptions inspect;
  DriverOptions drivers;
  OrientationOptions orientation;
  PreferencesOptions preferences;

  // Reads <configuration>/platform.toml. A missing file gives the defaults. Every unknown key,
  // wrong type or value out of range keeps the default and adds one line "file:line: key: what is
  // wrong" to `complaints`; a file that does not parse adds one line with file, line and column and
  // gives the defaults.
  static PlatformConfiguration load(const Directories& directories,
                                    std::vector<std::string>& complaints);
};

}  // namespace vx::lnx
