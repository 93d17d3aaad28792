// The reporting relay back end: relay sessions with session and user information, and one-off
// messages.
#pragma once

#include <atomic>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <utility>
#include <variant>
#include <vector>

#include "base/Error.h"
#include "base/Function.h"
#include "propertylist/Payload.h"

namespace vx {

// Names one place in the hierarchy of reporting sessions. Immutable.
class VyrSecureHierarchyToken {
 public:
  virtual ~VyrSecureHierarchyToken() = default;
};

using VyrSessionInfoValue =
    std::variant<int32_t, int64_t, float, bool, std::shared_ptr<const VyrSecureHierarchyToken>>;
// Key to value, in the order given; keys are the constants below.
using VyrSessionInfo = std::vector<std::pair<std::string_view, VyrSessionInfoValue>>;

inline constexpr std::string_view kVyrReportingSessionInfoClientType = "clientType";
inline constexpr std::string_view kVyrReportingSessionInfoClientVersion = "clientVersion";
inline constexpr std::string_view kVyrReportingSessionInfoSessionID = "sessionID";
inline constexpr std::string_view kVyrReportingSessionInfoBatchEvent = "batchEvent";
inline constexpr std::string_view kVyrReportingSessionInfoHierarchyToken = "hierarchyToken";
inline constexpr std::string_view kVyrReportingSessionInfoContainsRealtimeEvents =
    "containsRealtimeEvents";

inline constexpr std::string_view kVyrReportingUserInfoClientName = "clientName";
inline constexpr std::string_view kVyrReportingUserInfoServiceName = "serviceName";

// One relay session. Thread-safe.
class VyrReportingSession {
 public:
  using BackendList = std::vector<std::string>;
  virtual ~VyrReportingSession() = default;
  virtual std::string description() const = 0;
  // Returns at once; the handler runs later on a thread of the platform's choosing with the back
  // ends found, or with none when there are none.
  virtual void startConfigurationWithCompletionHandler(
      Function<void(std::optional<BackendList>)> handler) = 0;
  // False and an error when the message could not be handed over.
  virtual bool sendMessageWithCategory(uint16_t category, uint16_t type, const Payload& payload,
                                       std::optional<Error>& error) = 0;
  // The handler runs once every message handed over before is where it belongs, or with the error
  // that prevents it.
  virtual void flushMessagesWithCompletion(Function<void(std::optional<Error>)> handler) = 0;
  // How many of the messages are where they belong by now, for whoever looks into the service; null
  // where nobody counts them.
  virtual std::shared_ptr<const std::atomic<uint64_t>> storedMessages() const { return nullptr; }
};

class VyrReporting {
 public:
  virtual ~VyrReporting() = default;
  virtual std::shared_ptr<const VyrSecureHierarchyToken> newSecureHierarchyTokenFromParentToken(
      const VyrSecureHierarchyToken* parent) = 0;
  virtual std::shared_ptr<VyrReportingSession> initWithSessionInfo(
      const VyrSessionInfo& sessionInfo, const Payload& userInfo,
      const std::vector<std::string>& frameworksToCheck) = 0;
  virtual bool sendOneMessageWithSessionInfo(const VyrSessionInfo& sessionInfo,
                                             const Payload& userInfo, uint16_t category,
                                             uint16_t type, const Payload& payload,
                                             std::optional<Error>& error) = 0;
};

}  // namespace vx
