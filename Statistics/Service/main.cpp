// The process entry: installs the Linux platform, creates the service, and serves until told to
// end.
#include <cstdio>
#include <memory>
#include <string>

#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "Statistics/VXReportingProcessState.h"
#include "platform/Platform.h"
#include "platform/linux/LinuxPlatform.h"

int main() {
  std::string problem;
  const std::unique_ptr<vx::lnx::LinuxPlatform> linuxPlatform =
      vx::lnx::LinuxPlatform::start(problem);
  if (linuxPlatform == nullptr) {
    std::fprintf(stderr, "<3>vxreportingd: %s\n", problem.c_str());
    return 1;
  }
  vx::Platform& services = linuxPlatform->services();
  vx::installPlatform(&services);
  linuxPlatform->begin();
  linuxPlatform->recover([] { return vx::VXReportingServiceDelegate::create(); });
  {
    const std::shared_ptr<vx::VXReportingServiceDelegate> delegate =
        vx::VXReportingServiceDelegate::create();
    services.serviceListener.setDelegate(delegate);
    services.serviceListener.resume();
    vx::VXReportingProcessState::current().delayedMessages().sendAllFromNow();
  }
  return linuxPlatform->shutDown();
}
