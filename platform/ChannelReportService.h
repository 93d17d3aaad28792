// The audio drivers' statistics channels: subscription, samples, differences.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "base/Error.h"
#include "base/Function.h"

namespace vx {

// A set of channels or of samples, in the service's own layout. Immutable once handed out, so
// sharing one is as good as copying it.
class ChannelDictionary {
 public:
  virtual ~ChannelDictionary() = default;
};
using ChannelDictionaryRef = std::shared_ptr<const ChannelDictionary>;

// A handle that lives as long as the process.
class ChannelSubscription {
 public:
  virtual ~ChannelSubscription() = default;
};

// One channel's sample, valid during the iteration callback.
class ChannelSample;

class ChannelReportService {
 public:
  virtual ~ChannelReportService() = default;
  // Channels in a group: an absent group or subgroup stands for any. Null when there is nothing;
  // fills `error` (code: errno) on failure. `flags` must be 0.
  virtual ChannelDictionaryRef copyChannelsInGroup(const std::optional<std::string>& group,
                                                   const std::optional<std::string>& subGroup,
                                                   uint64_t flags, std::optional<Error>& error) = 0;
  virtual int32_t channelCount(const ChannelDictionary& channels) = 0;
  // Null on failure. `subscribed` receives the channels actually subscribed.
  virtual ChannelSubscription* createSubscription(const ChannelDictionaryRef& channels,
                                                  ChannelDictionaryRef& subscribed) = 0;
  // A null subscription fills `error`.
  virtual ChannelDictionaryRef createSamples(ChannelSubscription* subscription,
                                             const ChannelDictionaryRef& subscribed,
                                             std::optional<Error>& error) = 0;
  // Differences per channel; channels missing on either side are left out. An absent earlier set
  // fills `error`.
  virtual ChannelDictionaryRef createSamplesDelta(const ChannelDictionaryRef& earlier,
                                                  const ChannelDictionaryRef& later,
                                                  std::optional<Error>& error) = 0;
  virtual ChannelDictionaryRef copyDictionary(const ChannelDictionaryRef& samples) = 0;
  // Calls back once per channel sample, in order, until the callback returns something other than
  // 0.
  virtual void iterateSamples(const ChannelDictionary& samples,
                              const Function<int(const ChannelSample& sample)>& callback) = 0;
  virtual std::optional<std::string_view> channelName(const ChannelSample& sample) = 0;
  virtual int64_t simpleIntegerValue(const ChannelSample& sample, int index) = 0;
};

}  // namespace vx
