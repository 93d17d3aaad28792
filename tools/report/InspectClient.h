// The running service, asked at inspect.socket.
#pragma once

#include <chrono>
#include <optional>
#include <string>
#include <vector>

#include "base/Function.h"
#include "base/UniqueFd.h"
#include "propertylist/CborWriter.h"
#include "propertylist/Payload.h"
#include "wire/FrameReader.h"
#include "wire/InspectOperations.h"

namespace vx::report {

#define VX_INSPECT_HELP                                                                            \
  "The socket: $VXREPORTING_INSPECT_SOCKET, or inspect.socket beside $VXREPORTING_SOCKET, or in\n" \
  "/run/vxreporting. Root, the service's user and members of vxreporting-read may ask.\n"

// One connection. Owned by a command; one thread. One call at a time, waited for.
class InspectClient {
 public:
  // Failure when the service cannot be asked, with one sentence that says why.
  InspectClient();
  // None when no service is there to be asked; Failure when it turns the caller away.
  static std::optional<InspectClient> ifThere();

  using Arguments = Function<void(CborWriter&)>;
  Payload call(wire::InspectOperation operation, std::size_t count = 0,
               const Arguments& arguments = nullptr);
  Payload callOn(wire::InspectOperation operation, int64_t number);
  // All of what `connections` and `sessions` answer in parts.
  std::vector<Payload> all(wire::InspectOperation operation, const char* key);
  // An answer that may take for ever.
  void waitForEver() { patience_ = std::chrono::hours(24 * 365); }

 private:
  InspectClient(const std::string& path, UniqueFd socket);
  void sayHello();
  Payload receive(uint64_t number);
  void send(const std::vector<uint8_t>& bytes);
  void read();

  std::string path_;
  UniqueFd socket_;
  std::chrono::milliseconds patience_{30000};
  uint64_t calls_ = 0;
  std::vector<uint8_t> received_;
};

}  // namespace vx::report
