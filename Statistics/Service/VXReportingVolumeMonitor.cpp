#include "Statistics/Service/VXReportingVolumeMonitor.h"

namespace vx {

std::shared_ptr<VXReportingVolumeMonitor> VXReportingVolumeMonitor::create() { return nullptr; }

void VXReportingVolumeMonitor::stop() {}
void VXReportingVolumeMonitor::addSession(const std::shared_ptr<VXReportingSession>&) {}
void VXReportingVolumeMonitor::removeSession(const std::shared_ptr<VXReportingSession>&) {}

}  // namespace vx
