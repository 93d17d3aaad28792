// The reporting relay of the platform: every back end that the configuration names.
#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/VyrReporting.h"
#include "platform/linux/RelayBackend.h"

namespace vx::lnx {

// Thread-safe: immutable. Owned by the platform; refers to back ends that outlive it, and outlives
// its sessions. A message goes to every back end; of several errors the first is told.
class RelayReporting final : public VyrReporting {
 public:
  // `runSoon` runs a job soon, on another thread.
  using RunSoon = Function<void(Function<void()> job)>;
  RelayReporting(std::vector<RelayBackend*> backends, RunSoon runSoon);

  std::shared_ptr<const VyrSecureHierarchyToken> newSecureHierarchyTokenFromParentToken(
      const VyrSecureHierarchyToken* parent) override;
  std::shared_ptr<VyrReportingSession> initWithSessionInfo(
      const VyrSessionInfo& sessionInfo, const Payload& userInfo,
      const std::vector<std::string>& frameworksToCheck) override;
  bool sendOneMessageWithSessionInfo(const VyrSessionInfo& sessionInfo, const Payload& userInfo,
                                     uint16_t category, uint16_t type, const Payload& payload,
                                     std::optional<Error>& error) override;

 private:
  class Session;

  const std::vector<RelayBackend*> backends_;
  const RunSoon runSoon_;
};

}  // namespace vx::lnx
