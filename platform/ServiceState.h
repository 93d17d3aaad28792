// What the service must be given back so that it can go on where it was.
#pragma once

#include <cstdint>
#include <optional>
#include <vector>

#include "base/Function.h"
#include "platform/WorkQueue.h"
#include "propertylist/Payload.h"

namespace vx {

class ExportedObject;

// Dictionaries that only the service understands: facts of its own, which are small, and what
// clients gave it, in pieces that are no larger together with the facts than one call may be.
struct SavedSession {
  int64_t reporterID = 0;
  Payload facts;
  std::vector<Payload> information;  // merged in this order; one at least
  // Whose work set up what the session's messages are relayed to; none where there is none. To be
  // asked, from any thread, once all work that was queued before the state was saved has run.
  Function<std::optional<WorkOrigin>()> relay;
};

struct SavedClient {
  const ExportedObject* object = nullptr;
  Payload facts;
  std::vector<SavedSession> sessions;
};

struct SavedService {
  Payload facts;
  std::vector<SavedClient> clients;  // in order of registration
  // False: some of it lies where it does not survive the process. The calls that made it are better
  // kept, while they can be.
  bool complete = true;
};

}  // namespace vx
