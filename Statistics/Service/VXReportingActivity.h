// What the service has done with the messages it was given, for whoever looks into it.
#pragma once

#include <array>
#include <cstddef>
#include <cstdint>
#include <memory>
#include <vector>

#include "Statistics/VXReportingUtility.h"
#include "platform/ServiceInspection.h"

namespace vx {

class VXReportingSession;

// Owned by the service delegate; lives on the service queue. A message costs a count; what watchers
// are told is put together only for those who want it. Bounded by the watchers, who are
// connections of a bounded number.
class VXReportingActivity {
 public:
  enum class Fate : uint8_t {
    Delivered,       // to a session, once for each
    Standalone,      // no session was started
    UnknownSession,  // it names one that nobody has
    ReportingOff,    // refused by the preferences
    Drivers,         // the service's own: driver statistics at a session's end
  };
  static constexpr std::size_t kFates = 5;

  // `session`: of that identifier; null where there is none.
  void routed(Fate fate, const Payload& message, MessageCategory category, MessageType type,
              ReporterID reporterID, const VXReportingSession* session) {
    ++counts_[static_cast<std::size_t>(fate)];
    if (!watchers_.empty()) [[unlikely]]
      tell(fate, message, category, type, reporterID, session);
  }
  uint64_t count(Fate fate) const { return counts_[static_cast<std::size_t>(fate)]; }

  void watch(std::weak_ptr<MessageWatcher> watcher) { watchers_.push_back(std::move(watcher)); }
  std::size_t watchers() const { return watchers_.size(); }

 private:
  void tell(Fate fate, const Payload& message, MessageCategory category, MessageType type,
            ReporterID reporterID, const VXReportingSession* session);

  std::array<uint64_t, kFates> counts_{};
  std::vector<std::weak_ptr<MessageWatcher>> watchers_;
};

}  // namespace vx
