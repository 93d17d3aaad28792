#include "Statistics/VXReportingTallyhubBridge.h"

#include "Statistics/Service/VXReportingSession.h"
#include "platform/Platform.h"

namespace vx {

void VXReportingTallyhubBridge::handleEvent(const std::optional<Payload>& payload,
                                            MessageCategory category, MessageType type,
                                            const VXReportingSession* session) {
  // Both dictionaries are immutable, so holding them is as good as copying them now: the event's
  // own dictionary is put together only if and when the service wants it.
  std::optional<Payload> userInfo;
  if (session != nullptr) userInfo = session->userInfo()->snapshot();
  platform().analytics.sendEventLazy(
      "com.quorvel.sonik." + messageKindName(messageKind(category, type), '.'),
      [payload = payload.value_or(Payload()), userInfo = std::move(userInfo)] {
        return VXReportingHostApplicationDisplayID(userInfo).addedTo(payload,
                                                                     kHostApplicationDisplayIDKey);
      });
}

}  // namespace vx
