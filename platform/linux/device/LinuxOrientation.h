// Orientation of the device, from the sensor proxy on the system bus, and of the user interface,
// from a state file.
#pragma once

#include <memory>
#include <string>

#include "platform/OrientationNotifier.h"
#include "platform/linux/device/DeviceOptions.h"

namespace vx::lnx {

// Thread-safe. Owned by the platform. Its thread, bus connection and file watch exist only while a
// handler is registered.
//
// Device: the property AccelerometerOrientation of net.hadess.SensorProxy ("normal", "bottom-up",
// "left-up", "right-up", "undefined"). The service may be absent, appear, vanish and come back; a
// claim that fails is tried again; a bus that dies is connected to again after a while. Interface:
// one word in a file of at most 64 bytes that a session agent writes, for example "portrait" or
// "landscape-left"; its folder is watched, so it may be written in place or renamed over.
//
// A handler is called once per change after its registration; the first value that becomes known is
// not a change. Handlers run on the notifier's thread, never under a lock.
class LinuxOrientation final : public OrientationNotifier {
 public:
  explicit LinuxOrientation(const OrientationOptions& options);
  ~LinuxOrientation() override;

  void registerDeviceOrientationHandler(std::string_view identifier, Handler handler) override;
  void registerInterfaceOrientationHandler(std::string_view identifier, Handler handler) override;
  void unregisterDeviceOrientationHandler(std::string_view identifier) override;
  void unregisterInterfaceOrientationHandler(std::string_view identifier) override;
  std::string orientationText(int64_t orientation) override;

  struct State;

 private:
  const std::shared_ptr<State> state_;
};

}  // namespace vx::lnx
