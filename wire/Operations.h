// The operations of the service by the numbers they have on the wire. The service describes them
// with their arguments in an array of its own, which a test holds against this one.
#pragma once

#include <array>
#include <cstdint>
#include <string_view>

namespace vx::wire {

// One line per operation, in the order of their numbers.
#define VX_WIRE_OPERATIONS(X)                                   \
  X(CreateReportingSession, "createReportingSession")           \
  X(SetServiceType, "setServiceType")                           \
  X(GetServiceNameForReporterID, "getServiceNameForReporterID") \
  X(SetConfiguration, "setConfiguration")                       \
  X(StartReportingSessionForID, "startReportingSessionForID")   \
  X(SendMessage, "sendMessage")                                 \
  X(StopReportingSessionForID, "stopReportingSessionForID")     \
  X(DestroyReportingSession, "destroyReportingSession")         \
  X(ReporterID, "reporterID")                                   \
  X(GetAllReporters, "getAllReporters")                         \
  X(KillService, "killService")

enum class Operation : uint8_t {
  None = 0,  // numbers begin with 1
#define VX_WIRE_ENUMERATOR(enumerator, name) enumerator,
  VX_WIRE_OPERATIONS(VX_WIRE_ENUMERATOR)
#undef VX_WIRE_ENUMERATOR
};

// The name of operation n is at n - 1.
inline constexpr auto kOperationNames = std::to_array<std::string_view>({
#define VX_WIRE_NAME(enumerator, name) name,
    VX_WIRE_OPERATIONS(VX_WIRE_NAME)
#undef VX_WIRE_NAME
});

}  // namespace vx::wire
