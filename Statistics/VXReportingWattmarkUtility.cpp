#include "Statistics/VXReportingWattmarkUtility.h"

#include "Statistics/Service/VXReportingSession.h"
#include "platform/Log.h"

namespace vx {

namespace {

constexpr MessageType kRunningTimeType = 6;
constexpr int64_t kPowerClientIdentifier = 28;
constexpr std::string_view kEngineOnTime = "EngineOnTime";
constexpr std::string_view kHardwareTime = "Haptic_Active_Hardware_Time_Seconds";
constexpr std::string_view kActiveClients = "Active_Clients";
constexpr std::string_view kTimestamp = "vxreporting_timestamp";

}  // namespace

void VXReportingWattmarkUtility::handleEvent(const Payload* payload, MessageCategory,
                                             MessageType type, const VXReportingSession* session) {
  if (payload == nullptr || type != kRunningTimeType) return;
  if (const std::optional<Value> onTime = payload->find(kEngineOnTime)) {
    PayloadBuilder record;
    record.set("EngineOnDuration", *onTime);
    std::optional<Payload> userInfo;
    if (session != nullptr) userInfo = session->userInfo()->application();
    const std::optional<HostApplicationDisplayID> application =
        VXReportingHostApplicationDisplayID(userInfo);
    // Always there while the lookup falls back to "Unknown"; kept for the day it does not.
    if (application) {
      application->storeUnder("ApplicationName", record);
    } else {
      VX_LOG(nullptr, Error, "failed to get app name for wattmark");
    }
    if (const std::optional<Value> timestamp = payload->find(kTimestamp)) {
      record.set("TimestampEnd", *timestamp);
    } else {
      VX_LOG(nullptr, Error, "failed to get VXReporting timestamp for wattmark");
    }
    platform().powerLog.logRegisteredEvent(kPowerClientIdentifier, "Lumo_Haptics", record.build(),
                                           nullptr);
    return;
  }
  if (const std::optional<Value> hardwareTime = payload->find(kHardwareTime)) {
    PayloadBuilder record;
    record.set(kHardwareTime, *hardwareTime);
    if (const std::optional<Value> clients = payload->find(kActiveClients))
      record.set(kActiveClients, *clients);
    platform().powerLog.logRegisteredEvent(kPowerClientIdentifier, "LeakedHapticsSessionInfo",
                                           record.build(), nullptr);
  }
}

}  // namespace vx
