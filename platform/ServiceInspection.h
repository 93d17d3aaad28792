// What the service says of itself to whoever may look into it.
#pragma once

#include <cstdint>
#include <memory>
#include <vector>

#include "base/Function.h"
#include "platform/ClientConnection.h"
#include "propertylist/Payload.h"

namespace vx {

// Is told of messages as they are routed, on the service's queue. Never waited for: it takes a
// message at once or leaves it out.
class MessageWatcher {
 public:
  virtual ~MessageWatcher() = default;
  // Asked before a message is put together for it. `session`: 0 for none.
  virtual bool wants(int64_t session, uint32_t category) = 0;
  virtual void routed(Payload message) = 0;
};

// Asked on any thread; answers on the service's queue, later. Dictionaries are for people: their
// keys are those of docs/inspecting.md. Costs nothing while nobody asks.
class ServiceInspection {
 public:
  struct Client {
    const ExportedObject* object = nullptr;  // what its connection exports
    Payload facts;
  };
  using Answer = Function<void(Payload)>;

  virtual ~ServiceInspection() = default;
  // What it has done so far, in numbers.
  virtual void totals(Answer answer) = 0;
  // In order of registration.
  virtual void clients(Function<void(std::vector<Client>)> answer) = 0;
  // Those of all clients, from the one at `first` on; the answer says whether there are more.
  virtual void sessions(std::size_t first, Answer answer) = 0;
  // Everybody's session of that identifier, in full.
  virtual void session(int64_t session, Answer answer) = 0;
  // From now on, for as long as the watcher lives.
  virtual void watch(std::weak_ptr<MessageWatcher> watcher) = 0;
};

}  // namespace vx
