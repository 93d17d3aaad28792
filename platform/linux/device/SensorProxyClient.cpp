#include "platform/linux/device/SensorProxyClient.h"

#include <poll.h>
#include <systemd/sd-bus.h>

#include <algorithm>
#include <cstring>

#include "platform/Log.h"
#include "platform/linux/device/SensorProxyMessages.h"

namespace vx::lnx {

namespace {

constexpr const char* kSensorPath = "/net/hadess/SensorProxy";
constexpr const char* kProperties = "org.freedesktop.DBus.Properties";
constexpr std::chrono::milliseconds kFirstRetry{200};
constexpr std::chrono::milliseconds kLastClaimRetry{5000};
constexpr std::chrono::seconds kLastConnectRetry{30};

}  // namespace

void SensorProxyClient::CloseBus::operator()(sd_bus* bus) const {
  sd_bus_close(bus);  // lets go of the claim as well
  sd_bus_unref(bus);
}

void SensorProxyClient::maintain() {
  thread_.assertHere();
  if (retryAt_ && TimePoint::clock::now() < *retryAt_) return;
  if (bus_ == nullptr)
    connect();
  else if (retryAt_)
    claim();
}

void SensorProxyClient::stop() {
  thread_.assertHere();
  disconnect();
  retryAt_.reset();
  backoff_ = {};
  thread_.unbind();
}

pollfd SensorProxyClient::pollEntry() const {
  thread_.assertHere();
  if (bus_ == nullptr) return {-1, 0, 0};
  return {sd_bus_get_fd(bus_.get()), static_cast<short>(std::max(0, sd_bus_get_events(bus_.get()))),
          0};
}

std::optional<SensorProxyClient::TimePoint> SensorProxyClient::nextDue() const {
  thread_.assertHere();
  uint64_t microseconds = UINT64_MAX;  // on CLOCK_MONOTONIC
  if (bus_ == nullptr || sd_bus_get_timeout(bus_.get(), &microseconds) < 0 ||
      microseconds == UINT64_MAX)
    return retryAt_;
  const TimePoint due{std::chrono::microseconds(microseconds)};
  return retryAt_ ? std::min(due, *retryAt_) : due;
}

void SensorProxyClient::process() {
  thread_.assertHere();
  int code = 0;
  while (bus_ != nullptr && (code = sd_bus_process(bus_.get(), nullptr)) > 0) {
  }
  if (code >= 0) return;
  VX_LOG(nullptr, Info, "the system bus is gone (%s); device orientation waits for it",
         std::strerror(-code));
  saidBusIsMissing_ = true;
  disconnect();
  retryLater(kLastConnectRetry);
}

void SensorProxyClient::connect() {
  retryAt_.reset();
  sd_bus* bus = nullptr;
  int code = sd_bus_open_system(&bus);
  bus_.reset(bus);
  if (code >= 0) code = subscribe();
  if (code < 0) {
    if (!std::exchange(saidBusIsMissing_, true)) {
      VX_LOG(nullptr, Info, "device orientation is off for now: no system bus (%s)",
             std::strerror(-code));
    }
    disconnect();
    retryLater(kLastConnectRetry);
    return;
  }
  saidBusIsMissing_ = false;
  backoff_ = {};
  claim();
}

int SensorProxyClient::subscribe() {
  const int code = sd_bus_match_signal_async(
      bus_.get(), nullptr, "org.freedesktop.DBus", "/org/freedesktop/DBus", "org.freedesktop.DBus",
      "NameOwnerChanged",
      [](sd_bus_message* signal, void* self, sd_bus_error*) {
        static_cast<SensorProxyClient*>(self)->onOwnerChanged(signal);
        return 0;
      },
      nullptr, this);
  if (code < 0) return code;
  return sd_bus_match_signal_async(
      bus_.get(), nullptr, nullptr, kSensorPath, kProperties, "PropertiesChanged",
      [](sd_bus_message* signal, void* self, sd_bus_error*) {
        static_cast<SensorProxyClient*>(self)->onPropertiesChanged(signal);
        return 0;
      },
      nullptr, this);
}

void SensorProxyClient::disconnect() {
  if (bus_ == nullptr) return;
  bus_.reset();
  retryAt_.reset();
}

void SensorProxyClient::retryLater(std::chrono::milliseconds most) {
  backoff_ = std::clamp<std::chrono::milliseconds>(backoff_ * 2, kFirstRetry, most);
  retryAt_ = TimePoint::clock::now() + backoff_;
}

void SensorProxyClient::claim() {
  retryAt_.reset();
  sd_bus_message* call = nullptr;
  int code = sd_bus_message_new_method_call(bus_.get(), &call, kSensorName, kSensorPath,
                                            kSensorName, "ClaimAccelerometer");
  if (code >= 0) {
    // A sensor that is not there must not be started by asking for it: it appears when it appears.
    sd_bus_message_set_auto_start(call, 0);
    code = sd_bus_call_async(
        bus_.get(), nullptr, call,
        [](sd_bus_message* answer, void* self, sd_bus_error*) {
          static_cast<SensorProxyClient*>(self)->onClaimed(answer);
          return 0;
        },
        this, 0);
  }
  sd_bus_message_unref(call);
  if (code < 0) retryLater(kLastClaimRetry);
}

void SensorProxyClient::onClaimed(sd_bus_message* answer) {
  thread_.assertHere();
  if (const sd_bus_error* error = sd_bus_message_get_error(answer)) {
    // Without an owner there is nothing to try again: its appearance is announced. Otherwise it is
    // still waking up.
    const bool absent =
        sd_bus_error_has_name(error, "org.freedesktop.DBus.Error.ServiceUnknown") != 0 ||
        sd_bus_error_has_name(error, "org.freedesktop.DBus.Error.NameHasNoOwner") != 0;
    if (!absent) retryLater(kLastClaimRetry);
    return;
  }
  backoff_ = {};
  (void)sd_bus_call_method_async(
      bus_.get(), nullptr, kSensorName, kSensorPath, kProperties, "Get",
      [](sd_bus_message* property, void* self, sd_bus_error*) {
        static_cast<SensorProxyClient*>(self)->onProperty(property);
        return 0;
      },
      this, "ss", kSensorName, kProperty);
}

void SensorProxyClient::onProperty(sd_bus_message* answer) { deviceIs(propertyIn(answer)); }

void SensorProxyClient::onOwnerChanged(sd_bus_message* signal) {
  thread_.assertHere();
  const std::optional<bool> owned = ownerIn(signal);
  if (!owned) return;
  backoff_ = {};
  if (*owned) claim();
}

void SensorProxyClient::onPropertiesChanged(sd_bus_message* signal) {
  deviceIs(changedPropertyIn(signal));
}

void SensorProxyClient::deviceIs(const std::string& word) {
  if (!word.empty()) report_(word);
}

}  // namespace vx::lnx
