// What the service says of itself at inspect.socket (docs/inspecting.md).
#pragma once

#include <cstdint>
#include <memory>
#include <string>

#include "base/Clock.h"
#include "platform/ClientConnection.h"
#include "platform/ServiceInspection.h"
#include "platform/linux/CrashSafety.h"
#include "platform/linux/PlatformConfiguration.h"
#include "platform/linux/device/LinuxOrientation.h"
#include "platform/linux/diagnostics/SystemLog.h"
#include "platform/linux/execution/Executor.h"
#include "platform/linux/execution/UserAccounts.h"
#include "platform/linux/ipc/InspectEndpoint.h"
#include "platform/linux/ipc/SocketListener.h"
#include "platform/linux/store/LocalStore.h"

namespace vx::lnx {

// Puts the account together from the parts, when it is asked: nothing of it is kept. Owned by
// LinuxPlatform, whose other parts outlive it; interactive thread.
class Inspection {
 public:
  struct Means {
    Clock& clock;
    Executor& executor;
    UserAccounts& accounts;
    SocketListener& listener;
    InspectEndpoint& endpoint;
    LocalStore& store;
    CrashSafety& crashSafety;
    LinuxOrientation& orientation;
    SystemLog& log;
    const PlatformConfiguration& configuration;
    const std::string& logsDirectory;
  };

  explicit Inspection(const Means& means);
  Inspection(const Inspection&) = delete;
  Inspection& operator=(const Inspection&) = delete;

  static const InterfaceDescription& interface();
  // What a connection exports.
  std::shared_ptr<ExportedObject> makeObject();

 private:
  class Inspector;

  // Null when the service says nothing of itself.
  ServiceInspection* service() const;
  Payload status(const Payload& service) const;
  Payload connections(std::size_t first, const std::vector<ServiceInspection::Client>& clients);
  void erase(const Payload& which, Reply reply);

  const Means means_;
  const Date startedAt_;
  const Monotonic started_;
  const std::shared_ptr<WorkQueue> queue_;
  uint64_t notFollowed_ = 0;  // messages that followers have not been told of
};

}  // namespace vx::lnx
