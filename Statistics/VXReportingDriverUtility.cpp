#include "Statistics/VXReportingDriverUtility.h"

#include <atomic>

#include "platform/Log.h"

namespace vx {

namespace {

// Shared by everything in this file; replaced when another utility is made.
std::atomic<const LogScope*> driverLogScope{nullptr};

const LogScope* scope() { return driverLogScope.load(std::memory_order_acquire); }

std::string orNull(const std::optional<std::string>& name) { return name.value_or("(null)"); }

// The entry's key: group, subgroup and channel name, each as far as there is one, with "_" after
// the first two.
std::string channelKey(const VXReportingDriver& driver,
                       std::optional<std::string_view> channelName) {
  std::string key;
  if (driver.groupName()) key += *driver.groupName() + "_";
  if (driver.subGroupName()) key += *driver.subGroupName() + "_";
  if (channelName) key += *channelName;
  return key;
}

}  // namespace

std::shared_ptr<const VXReportingDriver> VXReportingDriver::driverWithGroupName(
    std::optional<std::string> groupName, std::optional<std::string> subGroupName) {
  return std::shared_ptr<const VXReportingDriver>(
      new VXReportingDriver(std::move(groupName), std::move(subGroupName)));
}

std::string VXReportingDriver::description() const {
  return orNull(groupName_) + "-" + orNull(subGroupName_);
}

VXReportingDriverUtility::VXReportingDriverUtility() {
  driverLogScope.store(
      platform().log.registerScope(true, fourCharacterCode("vxrd"), "vxrd", "com.quorvel.sonik",
                                   "reporting_driver_verbose", 31),
      std::memory_order_release);
  VX_LOG(scope(), Info, "creating channelreporting driver utility");
  // Uneven on purpose: two whole groups, one subgroup of any group, one subgroup of one group.
  subscribeTo(VXReportingDriver::driverWithGroupName("QuorvelAE2MCA", std::nullopt));
  subscribeTo(VXReportingDriver::driverWithGroupName("Speaker", std::nullopt));
  subscribeTo(VXReportingDriver::driverWithGroupName(std::nullopt, "MCA"));
  subscribeTo(VXReportingDriver::driverWithGroupName("Haptics", "Stats"));
}

void VXReportingDriverUtility::subscribeTo(const std::shared_ptr<const VXReportingDriver>& driver) {
  static constexpr const char* kFunction = "init";
  ChannelReportService& service = platform().channelReports;
  const std::string group = orNull(driver->groupName());
  const std::string subGroup = orNull(driver->subGroupName());
  std::optional<Error> error;
  const ChannelDictionaryRef channels =
      service.copyChannelsInGroup(driver->groupName(), driver->subGroupName(), 0, error);
  if (error) {
    VX_LOG_AS(kFunction, scope(), Error, "error %li getting channels for driver %s-%s",
              static_cast<long>(error->code), group.c_str(), subGroup.c_str());
  }
  if (channels == nullptr) return;
  if (service.channelCount(*channels) < 1) {
    VX_LOG_AS(kFunction, scope(), Info, "couldn't find any channels for driver group %s-%s",
              group.c_str(), subGroup.c_str());
  } else {
    VXReportingIOChannelSubscription& made = ioChannelSubscriptions_.emplace_back(driver);
    ChannelDictionaryRef subscribed;
    made.subscription = service.createSubscription(channels, subscribed);
    made.subscribedChannels = std::move(subscribed);
  }
  // Written for a group without channels too, and the doubled word is part of the text.
  VX_LOG_AS(kFunction, scope(), Default, "subscribed to group group %s-%s", group.c_str(),
            subGroup.c_str());
}

std::shared_ptr<DriverSnapShot> VXReportingDriverUtility::getSnapShot() const {
  ChannelReportService& service = platform().channelReports;
  auto result = std::make_shared<DriverSnapShot>();
  for (const VXReportingIOChannelSubscription& subscription : ioChannelSubscriptions_) {
    std::optional<Error> error;
    VX_LOG(scope(), Info, "sampling driver %s", subscription.driver->description().c_str());
    ChannelDictionaryRef samples =
        service.createSamples(subscription.subscription, subscription.subscribedChannels, error);
    if (error) {
      VX_LOG(scope(), Error, "ChannelReportCreateSamples error %li",
             static_cast<long>(error->code));
    } else if (samples != nullptr) {
      (*result)[subscription.driver->description()] = std::move(samples);
    }
  }
  return result;
}

std::optional<Payload> VXReportingDriverUtility::getDriverStatisticsRelativeToSnapShot(
    const std::shared_ptr<DriverSnapShot>& snapShot) const {
  ChannelReportService& service = platform().channelReports;
  PayloadBuilder statistics;
  for (const VXReportingIOChannelSubscription& subscription : ioChannelSubscriptions_) {
    std::optional<Error> error;
    VX_LOG(scope(), Info, "getting latest samples");
    const ChannelDictionaryRef samples =
        service.createSamples(subscription.subscription, subscription.subscribedChannels, error);
    VX_LOG(scope(), Info, "done getting latest samples");
    if (error) {
      VX_LOG(scope(), Error, "ChannelReportCreateSamples error %li",
             static_cast<long>(error->code));
      continue;
    }
    if (samples == nullptr) continue;

    ChannelDictionaryRef chosen;
    if (snapShot == nullptr) {
      chosen = service.copyDictionary(samples);
    } else {
      const auto earlier = snapShot->find(subscription.driver->description());
      chosen = service.createSamplesDelta(earlier != snapShot->end() ? earlier->second : nullptr,
                                          samples, error);
      if (error) {
        // The driver still contributes, with its absolute values.
        VX_LOG(scope(), Error, "ChannelReportCreateSamplesDelta error %li",
               static_cast<long>(error->code));
        chosen = service.copyDictionary(samples);
      }
    }
    if (chosen == nullptr) continue;
    service.iterateSamples(*chosen, [&](const ChannelSample& sample) {
      const int64_t value = service.simpleIntegerValue(sample, 0);
      if (value < 1) return 0;
      statistics.set(channelKey(*subscription.driver, service.channelName(sample)), value);
      return 0;
    });
  }
  if (statistics.size() == 0) return std::nullopt;
  return statistics.build();
}

}  // namespace vx
