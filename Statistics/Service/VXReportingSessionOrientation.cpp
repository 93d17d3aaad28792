// Changes of orientation while a long-form audio or telephony session is started, on internal
// builds.
#include <cmath>

#include "Statistics/Service/VXReportingSession.h"
#include "platform/Log.h"

namespace vx {

namespace {

constexpr int32_t kDeviceClassWithoutOrientation = 6;

// Seconds since `start`, to the nearest millisecond, halves away from zero.
double secondsSince(Date start) {
  const double d = std::chrono::duration<double>(start - platform().clock.now()).count();
  return std::round(d * 1000.0) / -1000.0;
}

}  // namespace

// Asked at start and again at stop, with the service type of the moment: a type changed in between
// leaves the handlers registered, or finds none to unregister. Intended.
bool VXReportingSession::shouldReportOrientation() const {
  return VXReportingIsInternalBuild() &&
         (serviceType() == kServiceTypeLongFormAudio || serviceType() == kServiceTypeTelephony) &&
         platform().deviceProperties.integer("DeviceClassNumber", 0) !=
             kDeviceClassWithoutOrientation;
}

void VXReportingSession::registerOrientationHandlers() {
  const std::string identifier = "VXReportingService " + std::to_string(reporterID_);
  {
    MutexLock lock(fieldsMutex_);
    orientationCallbackID_ = identifier;
    startDate_ = platform().clock.now();
  }
  OrientationNotifier& notifier = platform().orientation;
  notifier.registerDeviceOrientationHandler(
      identifier, [self = shared_from_this()](int64_t orientation) {
        self->orientationChanged("device", "device_orientation", orientation);
      });
  notifier.registerInterfaceOrientationHandler(
      identifier, [self = shared_from_this()](int64_t orientation) {
        self->orientationChanged("ui", "ui_orientation", orientation);
      });
}

void VXReportingSession::unregisterOrientationHandlers() {
  const std::optional<std::string> identifier = orientationCallbackID();
  if (!identifier) return;
  OrientationNotifier& notifier = platform().orientation;
  notifier.unregisterDeviceOrientationHandler(*identifier);
  notifier.unregisterInterfaceOrientationHandler(*identifier);
  MutexLock lock(fieldsMutex_);
  orientationCallbackID_.reset();
}

void VXReportingSession::orientationChanged(const char* mode, std::string_view key,
                                            int64_t orientation) {
  const std::string name = platform().orientation.orientationText(orientation);
  const std::optional<Date> began = startDate();
  const double time = began ? secondsSince(*began) : 0;
  if (platform().log.isLogEnabled(5, sessionLogScope())) {
    const Payload info = userInfo_->snapshot();
    const std::optional<Value> application = info.find(kHostApplicationDisplayIDKey);
    VX_LOG_AS(
        "start", sessionLogScope(), Debug,
        "Orientation handler callback mode=%s orientation=\"%s\" app=\"%s\", time=%s, id=\"%s\"",
        mode, name.c_str(), application ? application->text().c_str() : "(null)",
        PayloadBuilder().set("t", time).build().find("t")->text().c_str(),
        orientationCallbackID().value_or("(null)").c_str());
  }
  aggregatedPayloadData_.append(
      PayloadBuilder().set(key, name).set(std::string(key) + "_time", time).build());
}

}  // namespace vx
