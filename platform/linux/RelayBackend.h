// What a relay back end must do. The platform's reporting relay is made of those that the
// configuration names (see RelayReporting).
#pragma once

#include <array>
#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string_view>

#include "base/Error.h"
#include "base/Function.h"
#include "platform/VyrReporting.h"
#include "propertylist/Payload.h"

namespace vx::lnx {

inline constexpr std::string_view kStoreBackendName = "store";
// Every name that `[relay] backends` may hold.
inline constexpr std::array kRelayBackendNames{kStoreBackendName};

// Domain of the relay's errors, and their codes.
inline constexpr const char* kRelayErrorDomain = "com.quorvel.vyr";
inline constexpr int64_t kRelayErrorNoBackend = 1;
inline constexpr int64_t kRelayErrorClosed = 2;

// Thread-safe. Owned by the platform, which outlives all sessions. Nothing here blocks.
class RelayBackend {
 public:
  // One relay session at this back end. Thread-safe; owned by the platform's relay session.
  class Session {
   public:
    virtual ~Session() = default;
    // An error when the message could not be handed over.
    virtual std::optional<Error> send(uint16_t category, uint16_t type, const Payload& payload) = 0;
    // The handler runs once: when every message handed over before is where it belongs, or with the
    // error that prevents it; on a thread of the back end's choosing, perhaps before this returns.
    virtual void flush(Function<void(std::optional<Error>)> handler) = 0;
    // See VyrReportingSession.
    virtual std::shared_ptr<const std::atomic<uint64_t>> storedMessages() const { return nullptr; }
  };

  virtual ~RelayBackend() = default;
  virtual std::string_view name() const = 0;
  // Never null; a back end that is closed says so when something is sent.
  virtual std::unique_ptr<Session> open(const VyrSessionInfo& info, const Payload& userInfo) = 0;
  // A message without a session of its own. An error when it could not be handed over.
  virtual std::optional<Error> sendOne(const VyrSessionInfo& info, const Payload& userInfo,
                                       uint16_t category, uint16_t type,
                                       const Payload& payload) = 0;
};

}  // namespace vx::lnx
