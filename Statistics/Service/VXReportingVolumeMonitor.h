// A per-device volume watcher that does not exist on this class of device.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <string>

#include "platform/Threading.h"

namespace vx {

class VXReportingSession;

// Kept because the service's interface has it on every device class: code that asks for a monitor
// finds that there is none here. Nothing in the service creates or calls it.
class VXReportingVolumeMonitor {
 public:
  // Null: on this device class its construction yields no object.
  static std::shared_ptr<VXReportingVolumeMonitor> create();

  void stop();
  void addSession(const std::shared_ptr<VXReportingSession>& session);
  void removeSession(const std::shared_ptr<VXReportingSession>& session);

  std::shared_ptr<OneShotTimer> timer;
  std::shared_ptr<Thread> timerThread;
  std::set<uint32_t> deviceIDs;
  std::map<uint32_t, std::string> deviceIDtoName;
  std::map<uint32_t, float> deviceIDToVolume;
  std::set<std::shared_ptr<VXReportingSession>> sessions;

 private:
  VXReportingVolumeMonitor() = default;
};

}  // namespace vx
