// Changes of the device's physical orientation and of the user interface's.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "base/Function.h"

namespace vx {

// Thread-safe. Handlers run on a thread of the notifier's choosing, once per change, never before
// the registering call returned, and possibly once more while or shortly after they are
// unregistered.
class OrientationNotifier {
 public:
  using Handler = Function<void(int64_t orientation)>;
  virtual ~OrientationNotifier() = default;
  virtual void registerDeviceOrientationHandler(std::string_view identifier, Handler handler) = 0;
  virtual void registerInterfaceOrientationHandler(std::string_view identifier,
                                                   Handler handler) = 0;
  virtual void unregisterDeviceOrientationHandler(std::string_view identifier) = 0;
  virtual void unregisterInterfaceOrientationHandler(std::string_view identifier) = 0;
  virtual std::string orientationText(int64_t orientation) = 0;
};

}  // namespace vx
