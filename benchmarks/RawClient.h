// A connection that speaks the protocol with as little of its own work as possible, so that what is
// measured is the daemon: frames are encoded in advance, only call numbers are filled in.
#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <string>
#include <vector>

#include "base/UniqueFd.h"
#include "propertylist/Payload.h"
#include "wire/FrameReader.h"
#include "wire/Operations.h"

namespace vx::bench {

class RawClient {
 public:
  explicit RawClient(const std::string& socketPath);

  // Blocking calls; each throws when the answer is not what it must be.
  void create(int64_t reporter);
  void setServiceType(uint16_t type, int64_t reporter);
  void configure(const Payload& configuration, int64_t reporter);
  void start(int64_t reporter);  // returns once the session is started; its answer comes at stop
  void stop(int64_t reporter);
  void sendOnce(const std::vector<uint8_t>& frame);  // one round trip of a prepared call

  // Sends `count` prepared calls in turn with at most `window` unanswered and returns when all are
  // answered. Sends and receives as many at once as there are.
  void pump(const std::vector<std::vector<uint8_t>>& frames, std::size_t count, std::size_t window);

  // A sendMessage call without an id list, or with one id.
  static std::vector<uint8_t> messageFrame(const Payload& payload,
                                           const int64_t* reporter = nullptr);

 private:
  // One call and its answer. `arguments` writes that many items.
  template <class Write>
  void call(wire::Operation operation, std::size_t count, const Write& arguments);
  void sendAll(const uint8_t* data, std::size_t size);
  // Reads at least one byte; returns how many complete replies arrived, those to starts not
  // counted.
  std::size_t receiveReplies();

  UniqueFd fd_;
  std::unique_ptr<wire::ReadBuffers> readBuffers_ = std::make_unique<wire::ReadBuffers>();
  wire::FrameReader reader_{*readBuffers_};
};

}  // namespace vx::bench
