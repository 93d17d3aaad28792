// The analytics sink: publishes every message that reaches a session as an analytics event.
#pragma once

#include <memory>
#include <optional>

#include "Statistics/VXReportingUtility.h"

namespace vx {

class VXReportingSession;

// No state; callable from any thread.
class VXReportingTallyhubBridge {
 public:
  // Publishes "com.quorvel.sonik.<category name>.<type name>" with the payload's entries and the
  // session's "HostApplicationDisplayID", which wins over the client's. Filters nothing. A null
  // payload stands for an absent one.
  static void handleEvent(const Payload* payload, MessageCategory category, MessageType type,
                          const VXReportingSession* session);
};

}  // namespace vx
