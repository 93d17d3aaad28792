// Orientation of the device, from the sensor proxy on the system bus, and of the user interface,
// from a state file.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <string>
#include <thread>

#include "base/Clock.h"
#include "base/Function.h"
#include "platform/OrientationNotifier.h"
#include "platform/linux/device/DeviceOptions.h"

namespace vx::lnx {

class OrientationHandlers;

// Thread-safe. Owned by the platform. Its thread, bus connection and file watch exist only while a
// handler is registered; see SensorProxyClient and InterfaceStateFile for these.
//
// A handler is called once per change after its registration; the first value that becomes known is
// not a change. Handlers run on the notifier's thread, never under a lock. Where the process may
// have no more threads they wait for the next registration, which tries again.
class LinuxOrientation final : public OrientationNotifier {
 public:
  // std::system_error when there is no thread to be had.
  using StartThread = Function<std::thread(Function<void()> body)>;

  explicit LinuxOrientation(const OrientationOptions& options);
  LinuxOrientation(const OrientationOptions& options, StartThread startThread);
  ~LinuxOrientation() override;
  LinuxOrientation(const LinuxOrientation&) = delete;
  LinuxOrientation& operator=(const LinuxOrientation&) = delete;

  void registerDeviceOrientationHandler(std::string_view identifier, const void* registrant,
                                        Handler handler) override;
  void registerInterfaceOrientationHandler(std::string_view identifier, const void* registrant,
                                           Handler handler) override;
  void unregisterDeviceOrientationHandler(std::string_view identifier,
                                          const void* registrant) override;
  void unregisterInterfaceOrientationHandler(std::string_view identifier,
                                             const void* registrant) override;
  std::string orientationText(int64_t orientation) override;

  // Lets go of the handlers that are left, while the services that their sessions' end needs are
  // there. No registration may follow. False: the thread has not ended in time.
  bool stop(Monotonic until);
  uint64_t refusedHandlers() const { return refused_.load(std::memory_order_relaxed); }

 private:
  class Worker;

  void add(OrientationHandlers& handlers, std::string_view identifier, const void* registrant,
           Handler handler);

  const OrientationOptions options_;
  std::atomic<uint64_t> refused_{0};
  const std::shared_ptr<Worker> worker_;  // its thread may outlive the notifier for a moment
};

}  // namespace vx::lnx
