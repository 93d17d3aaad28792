// The store as a relay back end.
#pragma once

#include <memory>
#include <optional>
#include <string_view>

#include "platform/linux/RelayBackend.h"
#include "platform/linux/store/StoreQueue.h"

namespace vx::lnx {

// Owned by the local store. Thread-safe. Refers to a queue that outlives it and its sessions, and
// that bounds what it takes.
class StoreBackend final : public RelayBackend {
 public:
  explicit StoreBackend(StoreQueue& queue) : queue_(queue) {}

  std::string_view name() const override { return kStoreBackendName; }
  std::unique_ptr<Session> open(const VyrSessionInfo& info, const Payload& userInfo) override;
  std::optional<Error> sendOne(const VyrSessionInfo& info, const Payload& userInfo,
                               uint16_t category, uint16_t type, const Payload& payload) override;

 private:
  StoreQueue& queue_;
};

}  // namespace vx::lnx
