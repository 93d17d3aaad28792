#include "Statistics/VXReportingTallyhubBridge.h"

#include <array>
#include <atomic>
#include <string>

#include "Statistics/Service/VXReportingSession.h"
#include "platform/Platform.h"

namespace vx {

namespace {

const Payload kNoMessage;

// The event name of a kind, made when the kind is first met and kept for ever.
std::string_view eventName(MessageKind kind) {
  static std::array<std::atomic<const std::string*>, kMessageKinds> names{};
  std::atomic<const std::string*>& name = names[kind];
  if (const std::string* known = name.load(std::memory_order_acquire)) return *known;
  const auto* made = new std::string("com.quorvel.sonik." + messageKindName(kind, '.'));
  const std::string* before = nullptr;
  if (name.compare_exchange_strong(before, made, std::memory_order_acq_rel)) return *made;
  delete made;
  return *before;
}

}  // namespace

void VXReportingTallyhubBridge::handleEvent(const Payload* payload, MessageCategory category,
                                            MessageType type, const VXReportingSession* session) {
  // Both dictionaries are immutable, so holding them is as good as copying them now: the event's
  // own dictionary is put together only if and when the service wants it.
  std::optional<Payload> userInfo;
  if (session != nullptr) userInfo = session->userInfo()->application();
  const std::size_t holds = userInfo ? userInfo->encoded().size() : 0;
  const Payload& message = payload != nullptr ? *payload : kNoMessage;
  platform().analytics.sendEventLazy(
      eventName(messageKind(category, type)),
      [message = Payload(message), userInfo = std::move(userInfo)] {
        return VXReportingHostApplicationDisplayID(userInfo).addedTo(message,
                                                                     kHostApplicationDisplayIDKey);
      },
      message, holds);
}

}  // namespace vx
