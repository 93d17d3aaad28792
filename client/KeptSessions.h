// What a client that keeps its sessions makes again on a new connection. Private to the client
// library.
#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <set>
#include <span>
#include <vector>

#include "propertylist/Payload.h"

namespace vx {

// The sessions of one client, as the calls have made them that were written so far. Owned by its
// ServiceConnection. Bounds: as many as the service lets a client hold, and creations that it has
// not answered yet.
class KeptSessions {
 public:
  // Calls that make sessions again have numbers from here on; nobody waits for their answers.
  static constexpr uint64_t kFirstNumber = uint64_t{1} << 62;
  static bool isCreation(uint64_t number) { return (number - kFirstNumber) % kSteps == 0; }
  // The number of a call that this library has encoded.
  static uint64_t numberOf(std::span<const uint8_t> body);

  // A call was written, or begun to be.
  void written(std::span<const uint8_t> body);
  void answered(uint64_t number, bool refused);
  // Starts that hold: they go on under the same number, and are answered when their session stops.
  std::set<uint64_t> heldStarts() const;
  // Appends the calls that make all sessions again, in the order of their creation. Returns how
  // many of them are left out because they are larger than `largestFrame` bytes.
  std::size_t restore(std::vector<uint8_t>& out, std::size_t largestFrame) const;
  void clear() { sessions_.clear(); }

 private:
  static constexpr uint64_t kSteps = 3;  // create, set the type, configure
  struct Session {
    int64_t identifier = 0;
    uint64_t createdBy = 0;
    std::optional<uint16_t> serviceType;
    std::optional<Payload> configuration;
    uint64_t startedBy = 0;  // 0: it is not
  };
  Session* find(int64_t identifier);

  std::vector<Session> sessions_;
};

}  // namespace vx
