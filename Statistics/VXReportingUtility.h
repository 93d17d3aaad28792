// The vocabulary that every part of the service shares: names of service types, message categories
// and message types, the host application of a payload, the internal-build flag, and a bounded
// wait.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <string>
#include <string_view>

#include "platform/ScopedLog.h"
#include "platform/Threading.h"
#include "propertylist/Payload.h"

namespace vx {

using ReporterID = int64_t;    // 0 means "no session"
using ServiceType = uint16_t;  // 0xFFFF is "unknown"
using MessageCategory =
    uint32_t;  // area in the upper 16 bits, kind in the lower; 0xFFFFFFFF is "Undefined"
using MessageType = uint16_t;  // 0xFFFF is "Unknown"

inline constexpr ServiceType kServiceTypeTelephony = 2;
inline constexpr ServiceType kServiceTypeAlarms = 4;
inline constexpr ServiceType kServiceTypeStandalone = 5;
inline constexpr ServiceType kServiceTypeLongFormAudio = 7;
inline constexpr ServiceType kServiceTypeTest = 11;
inline constexpr ServiceType kServiceTypeApiUsage = 12;
inline constexpr ServiceType kServiceTypeUnknown = 0xFFFF;
inline constexpr MessageCategory kCategoryUndefined = 0xFFFFFFFF;
inline constexpr MessageCategory kCategoryChannelReporting = 9;
inline constexpr MessageType kMessageTypeGeneric = 0;
inline constexpr MessageType kMessageTypeUnknown = 0xFFFF;

inline constexpr std::string_view kHostApplicationDisplayIDKey = "HostApplicationDisplayID";

// Unlisted codes are "telephony": intended. Only 0xFFFF is "unknown". Views of literals.
std::string_view VXReportingServiceTypeName(ServiceType type);
// Area name, "_" and kind name; no prefix below 0x00010000 and for 0xFFFFFFFF; an unlisted area
// leaves just the "_".
std::string VXReportingCategoryName(MessageCategory category);
std::string_view VXReportingMessageTypeName(MessageType type);

// A category and type by their names: pairs with the same names are the same kind. There are few of
// them, so a kind is a small number, and its text is made only when somebody reads it.
using MessageKind = uint16_t;
inline constexpr std::size_t kMessageKinds =
    std::size_t{7} * 12 * 8;  // prefixes, kind names and type names
MessageKind messageKind(MessageCategory category, MessageType type);
// "<category name><separator><type name>".
std::string messageKindName(MessageKind kind, char separator);
// "Session_Setup_Start_1" for the first one.
std::string messageIdentifier(MessageKind kind, uint64_t count);

// The value under "HostApplicationDisplayID" as it stands, of whatever kind, or the string
// "Unknown".
class HostApplicationDisplayID {
 public:
  HostApplicationDisplayID() = default;
  explicit HostApplicationDisplayID(const Payload& payload)
      : owner_(payload), value_(payload.find(kHostApplicationDisplayIDKey)) {}
  void storeUnder(std::string_view key, PayloadBuilder& builder) const;
  Payload addedTo(const Payload& dictionary, std::string_view key) const;
  std::string text() const { return value_ ? value_->text() : "Unknown"; }

 private:
  Payload owner_;  // keeps value_ valid
  std::optional<Value> value_;
};
HostApplicationDisplayID VXReportingHostApplicationDisplayID(const std::optional<Payload>& payload);

// Asked of the device once per process.
bool VXReportingIsInternalBuild();

// Waits until `done` is seen set. The other party sets it while holding the condition's lock, then
// signals. Each signal that does not set it starts a whole new time limit: intended. False when a
// wait ran out.
bool VXReportingUtilityWait(Condition& condition, const bool& done, const char* waitingMessage,
                            const char* timeoutMessage, const LogScope* log,
                            double timeLimitSeconds);

}  // namespace vx
