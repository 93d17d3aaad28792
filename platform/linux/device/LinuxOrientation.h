// Orientation of the device, from the sensor proxy on the system bus, and of the user interface,
// from a state file.
#pragma once

#include <memory>
#include <string>

#include "platform/OrientationNotifier.h"
#include "platform/linux/device/DeviceOptions.h"

namespace vx::lnx {

// Thread-safe. Owned by the platform. Its thread, bus connection and file watch exist only while a
// handler is registered; see SensorProxyClient and InterfaceStateFile for these.
//
// A handler is called once per change after its registration; the first value that becomes known is
// not a change. Handlers run on the notifier's thread, never under a lock.
class LinuxOrientation final : public OrientationNotifier {
 public:
  explicit LinuxOrientation(const OrientationOptions& options);
  ~LinuxOrientation() override;
  LinuxOrientation(const LinuxOrientation&) = delete;
  LinuxOrientation& operator=(const LinuxOrientation&) = delete;

  void registerDeviceOrientationHandler(std::string_view identifier, Handler handler) override;
  void registerInterfaceOrientationHandler(std::string_view identifier, Handler handler) override;
  void unregisterDeviceOrientationHandler(std::string_view identifier) override;
  void unregisterInterfaceOrientationHandler(std::string_view identifier) override;
  std::string orientationText(int64_t orientation) override;

 private:
  class Worker;

  const OrientationOptions options_;
  const std::shared_ptr<Worker> worker_;  // its thread may outlive the notifier for a moment
};

}  // namespace vx::lnx
