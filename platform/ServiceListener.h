// The named service endpoint.
#pragma once

#include <memory>

#include "platform/ClientConnection.h"

namespace vx {

class ServiceListener;

class ServiceListenerDelegate {
 public:
  virtual ~ServiceListenerDelegate() = default;
  // Runs on the listener's queue for every new connection. True accepts it; the delegate must have
  // resumed it by then.
  virtual bool listener(ServiceListener& listener,
                        const std::shared_ptr<ClientConnection>& connection) = 0;
};

class ServiceListener {
 public:
  virtual ~ServiceListener() = default;
  virtual void setDelegate(std::weak_ptr<ServiceListenerDelegate> delegate) = 0;
  // Runs the listener's loop on this thread until the service is told to end.
  virtual void resume() = 0;
};

}  // namespace vx
