// The named service endpoint.
#pragma once

#include <memory>

#include "platform/ClientConnection.h"
#include "platform/ServiceInspection.h"
#include "platform/ServiceState.h"

namespace vx {

class ServiceListener;

class ServiceListenerDelegate {
 public:
  virtual ~ServiceListenerDelegate() = default;
  // Runs on the listener's queue for every new connection. True accepts it; the delegate must have
  // resumed it by then.
  virtual bool listener(ServiceListener& listener,
                        const std::shared_ptr<ClientConnection>& connection) = 0;

  // Calls back on its own queue, later, with the state that all work leaves which reached the
  // service before this call. False: it has none that could be kept.
  virtual bool saveState(Function<void(SavedService)> /*saved*/) { return false; }

  // None: it says nothing of itself. As long as this object lives.
  virtual ServiceInspection* inspection() { return nullptr; }

  // For a service that has just been made, on the interactive thread while its queues are idle.
  // What cannot be understood is left out, and the answer is false. Clients have been accepted
  // again before, in the order in which they were saved.
  virtual bool restoreService(const Payload& /*facts*/) { return false; }
  virtual bool restoreClient(ExportedObject& /*object*/, const Payload& /*facts*/) { return false; }
  // Once for each piece of information.
  virtual bool restoreSession(ExportedObject& /*object*/, int64_t /*reporterID*/,
                              const Payload& /*facts*/, const Payload& /*information*/) {
    return false;
  }
  // As work of the origin that the session named.
  virtual bool restoreRelay(ExportedObject& /*object*/, int64_t /*reporterID*/) { return false; }
  // What RecordedInputs::keepDelayed was given.
  virtual bool restoreDelayed(const Payload& /*facts*/, const Payload& /*content*/,
                              std::unique_ptr<WorkCause> /*cause*/) {
    return false;
  }
};

class ServiceListener {
 public:
  virtual ~ServiceListener() = default;
  virtual void setDelegate(std::weak_ptr<ServiceListenerDelegate> delegate) = 0;
  // Runs the listener's loop on this thread until the service is told to end.
  virtual void resume() = 0;
};

}  // namespace vx
