// The drivers' counters, as files in a folder of the test's own.
#pragma once

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <functional>
#include <string>

#include "platform/linux/device/CounterChannels.h"

namespace vx {

class DriverFolder {
 public:
  ~DriverFolder() { std::filesystem::remove_all(path); }
  // `name`: group, subgroup if any, and channel, with slashes.
  void count(const std::string& name, const std::string& value) const {
    std::filesystem::create_directories((path / name).parent_path());
    std::ofstream(path / name) << value;
  }
  const std::filesystem::path path = [] {
    std::string pattern = "/tmp/vxdrivers-XXXXXX";
    return std::string(mkdtemp(pattern.data()));
  }();
};

class DriverChannels final : public DriverFolder, public lnx::CounterChannels {
 public:
  DriverChannels() : CounterChannels({path, {}}) {}
  ChannelDictionaryRef createSamples(ChannelSubscription* subscription,
                                     const ChannelDictionaryRef& subscribed,
                                     std::optional<Error>& error) override {
    if (onSample) onSample();
    return CounterChannels::createSamples(subscription, subscribed, error);
  }
  std::optional<std::string_view> channelName(const ChannelSample& sample) override {
    return nameless ? std::nullopt : CounterChannels::channelName(sample);
  }
  std::function<void()> onSample;
  bool nameless = false;
};

}  // namespace vx
