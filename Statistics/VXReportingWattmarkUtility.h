// The power sink: turns haptics running-time messages into power log records.
#pragma once

#include <optional>

#include "Statistics/VXReportingUtility.h"

namespace vx {

class VXReportingSession;

// No state; callable from any thread.
class VXReportingWattmarkUtility {
 public:
  // Handles messages of type 6, whatever their category; ignores all others
  // without a word, and so a null payload.
  static void handleEvent(const Payload* payload, MessageCategory category, MessageType type,
                          const VXReportingSession* session);
};

}  // namespace vx
