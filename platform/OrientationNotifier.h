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
//
// A registration is known by its identifier and its registrant, which is compared and nothing else:
// two that use one identifier do not meet. A second one of the same pair takes the place of the
// first. One beyond a bound is refused, which is logged and counted; none is ever dropped for it.
class OrientationNotifier {
 public:
  using Handler = Function<void(int64_t orientation)>;
  virtual ~OrientationNotifier() = default;
  virtual void registerDeviceOrientationHandler(std::string_view identifier, const void* registrant,
                                                Handler handler) = 0;
  virtual void registerInterfaceOrientationHandler(std::string_view identifier,
                                                   const void* registrant, Handler handler) = 0;
  virtual void unregisterDeviceOrientationHandler(std::string_view identifier,
                                                  const void* registrant) = 0;
  virtual void unregisterInterfaceOrientationHandler(std::string_view identifier,
                                                     const void* registrant) = 0;
  virtual std::string orientationText(int64_t orientation) = 0;
};

}  // namespace vx
