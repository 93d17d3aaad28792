#include "Statistics/VXReportingUtility.h"

#include <array>
#include <chrono>

#include "Statistics/VXReportingProcessState.h"
#include "platform/Log.h"

namespace vx {

namespace {

constexpr std::array<std::string_view, 13> kServiceTypeNames = {
    "generic",          "ondi",          "telephony",
    "haptics",          "alarms",        "standalone",
    "soundautoconfig",  "longformaudio", "nonlongformaudio",
    "audiodeviceusage", "alerts",        "test",
    "apiusage"};

struct Area {
  uint32_t code;
  std::string_view name;
};
constexpr std::array<Area, 5> kAreas = {{{0x08000000, "Session"},
                                         {0x10000000, "DSP"},
                                         {0x20000000, "HAL"},
                                         {0x40000000, "Routing"},
                                         {0x80000000, "Toolbox"}}};

// Index 0 stands for every kind without a name of its own.
constexpr std::array<std::string_view, 12> kKindNames = {
    "Undefined",     "Generic",     "Record", "Playback",         "PlaybackAndRecord", "Setup",
    "ClientRequest", "RouteChange", "Error",  "ChannelReporting", "Performance",       "Volume"};

// The last two: the all-ones code, and every other code without a name.
constexpr std::array<std::string_view, 8> kTypeNames = {
    "Generic", "Start", "Stop", "Setup", "Error", "IssueDetector", "Unknown", "Undefined"};

// What stands before the kind name: nothing, "_" alone for an unlisted area, or an area's name and
// "_".
constexpr std::size_t kNoPrefix = 0;
constexpr std::size_t kNamelessPrefix = 1;
constexpr std::size_t kFirstArea = 2;

static_assert(kMessageKinds ==
              (kFirstArea + kAreas.size()) * kKindNames.size() * kTypeNames.size());

std::size_t prefixIndex(MessageCategory category) {
  if (category < 0x00010000 || category == kCategoryUndefined) return kNoPrefix;
  const uint32_t area = category & 0xFFFF0000;
  for (std::size_t i = 0; i < kAreas.size(); ++i) {
    if (kAreas[i].code == area) return kFirstArea + i;
  }
  return kNamelessPrefix;
}

std::size_t kindIndex(MessageCategory category) {
  const uint32_t kind = category & 0xFFFF;
  return kind < kKindNames.size() ? kind : 0;
}

std::size_t typeIndex(MessageType type) {
  if (type < 6) return type;
  return type == kMessageTypeUnknown ? 6 : 7;
}

void appendCategoryName(std::string& out, std::size_t prefix, std::size_t kind) {
  if (prefix >= kFirstArea) out += kAreas[prefix - kFirstArea].name;
  if (prefix != kNoPrefix) out += '_';
  out += kKindNames[kind];
}

}  // namespace

std::string_view VXReportingServiceTypeName(ServiceType type) {
  if (type < kServiceTypeNames.size()) return kServiceTypeNames[type];
  return type == kServiceTypeUnknown ? "unknown" : "telephony";
}

std::string VXReportingCategoryName(MessageCategory category) {
  std::string name;
  appendCategoryName(name, prefixIndex(category), kindIndex(category));
  return name;
}

std::string_view VXReportingMessageTypeName(MessageType type) {
  return kTypeNames[typeIndex(type)];
}

MessageKind messageKind(MessageCategory category, MessageType type) {
  return static_cast<MessageKind>(
      (prefixIndex(category) * kKindNames.size() + kindIndex(category)) * kTypeNames.size() +
      typeIndex(type));
}

std::string messageKindName(MessageKind kind, char separator) {
  const std::size_t type = kind % kTypeNames.size();
  const std::size_t category = kind / kTypeNames.size();
  std::string name;
  appendCategoryName(name, category / kKindNames.size(), category % kKindNames.size());
  name += separator;
  name += kTypeNames[type];
  return name;
}

std::string messageIdentifier(MessageKind kind, uint64_t count) {
  return messageKindName(kind, '_') + "_" + std::to_string(count);
}

void HostApplicationDisplayID::storeUnder(std::string_view key, PayloadBuilder& builder) const {
  if (value_)
    builder.set(key, *value_);
  else
    builder.set(key, "Unknown");
}

Payload HostApplicationDisplayID::addedTo(const Payload& dictionary, std::string_view key) const {
  static const Payload unknown = PayloadBuilder().set("", "Unknown").build();
  return dictionary.withEntry(key, value_ ? *value_ : *unknown.find(""));
}

HostApplicationDisplayID VXReportingHostApplicationDisplayID(
    const std::optional<Payload>& payload) {
  return payload ? HostApplicationDisplayID(*payload) : HostApplicationDisplayID();
}

bool VXReportingIsInternalBuild() { return VXReportingProcessState::current().isInternalBuild(); }

bool VXReportingUtilityWait(Condition& condition, const bool& done, const char* waitingMessage,
                            const char* timeoutMessage, const LogScope* log,
                            double timeLimitSeconds) {
  const auto limit = std::chrono::duration_cast<std::chrono::nanoseconds>(
      std::chrono::duration<double>(timeLimitSeconds));
  condition.lock();
  if (done) {
    condition.unlock();
    return true;
  }
  for (;;) {
    VX_LOG(log, Default, "%s", waitingMessage);
    if (!condition.waitUntil(platform().clock.monotonic() + limit)) {
      VX_LOG(log, Error, "%s", timeoutMessage);
      condition.unlock();
      return false;
    }
    VX_LOG(log, Default, "continuing");
    if (done) {
      condition.unlock();
      return true;
    }
  }
}

}  // namespace vx
