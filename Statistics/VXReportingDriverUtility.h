// How much the audio drivers' statistics counters moved while a session ran.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "Statistics/VXReportingUtility.h"
#include "platform/ChannelReportService.h"

namespace vx {

// ---------------------------------------------------------------------------------------------------------------------
// VXReportingDriver

// Names one driver group of the channel report service. Immutable.
class VXReportingDriver {
 public:
  static std::shared_ptr<const VXReportingDriver> driverWithGroupName(
      std::optional<std::string> groupName, std::optional<std::string> subGroupName);
  const std::optional<std::string>& groupName() const { return groupName_; }
  const std::optional<std::string>& subGroupName() const { return subGroupName_; }
  // "<group>-<subgroup>", an absent name as "(null)". The key of snapshots.
  std::string description() const;

 private:
  VXReportingDriver(std::optional<std::string> groupName, std::optional<std::string> subGroupName)
      : groupName_(std::move(groupName)), subGroupName_(std::move(subGroupName)) {}
  const std::optional<std::string> groupName_;
  const std::optional<std::string> subGroupName_;
};

// ---------------------------------------------------------------------------------------------------------------------
// VXReportingIOChannelSubscription

// One subscription to the channels of one driver group. Filled once by the utility, read-only
// afterwards. The handle is never released: it lives as long as the process.
struct VXReportingIOChannelSubscription {
  explicit VXReportingIOChannelSubscription(std::shared_ptr<const VXReportingDriver> forDriver)
      : driver(std::move(forDriver)) {}
  ChannelSubscription* subscription =
      nullptr;  // null when subscribing failed, which shows when it is sampled
  ChannelDictionaryRef subscribedChannels;
  std::shared_ptr<const VXReportingDriver> driver;
};

// ---------------------------------------------------------------------------------------------------------------------
// VXReportingDriverUtility

// Driver description to the sample set taken of it. Opaque to everyone but the utility.
using DriverSnapShot = std::map<std::string, ChannelDictionaryRef>;

// Owned by the service delegate, for the life of the process. Subscribes once, at construction; its
// operations run on the service queue.
class VXReportingDriverUtility {
 public:
  VXReportingDriverUtility();

  const std::vector<VXReportingIOChannelSubscription>& ioChannelSubscriptions() const {
    return ioChannelSubscriptions_;
  }
  // One entry per subscription that could be sampled; possibly empty, never null.
  std::shared_ptr<DriverSnapShot> getSnapShot() const;
  // Channel key to the growth since the snapshot (absolute values where no difference can be made),
  // 1 or more each; none when no channel qualifies. A null snapshot gives absolute values.
  std::optional<Payload> getDriverStatisticsRelativeToSnapShot(
      const std::shared_ptr<DriverSnapShot>& snapShot) const;

 private:
  void subscribeTo(const std::shared_ptr<const VXReportingDriver>& driver);
  std::vector<VXReportingIOChannelSubscription>
      ioChannelSubscriptions_;  // in the order of the driver list
};

}  // namespace vx
