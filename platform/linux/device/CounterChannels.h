// The drivers' statistics channels: a tree of counter files, and sources that the kernel publishes
// mapped into it.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <set>
#include <string>
#include <string_view>
#include <vector>

#include "base/Status.h"
#include "base/ThreadChecker.h"
#include "platform/ChannelReportService.h"
#include "platform/linux/device/DeviceOptions.h"

namespace vx::lnx {

// <root>/<group>[/<subgroup>]/<channel>: one file per channel, decimal or 0x, with an optional
// trailing newline. Mapped sources appear under the group and subgroup they are given.
// A file that holds no number is left out and named in the log, once. Subscriptions are never taken
// back. Confined to the thread of the service queue; at most
// kMaxChannels channels per subscription, the rest are left out with a log line.
class CounterChannels : public ChannelReportService {
 public:
  static constexpr std::size_t kMaxChannels = 4096;

  explicit CounterChannels(const DriverOptions& options) : options_(options) {}

  ChannelDictionaryRef copyChannelsInGroup(const std::optional<std::string>& group,
                                           const std::optional<std::string>& subGroup,
                                           uint64_t flags, std::optional<Error>& error) override;
  int32_t channelCount(const ChannelDictionary& channels) override;
  ChannelSubscription* createSubscription(const ChannelDictionaryRef& channels,
                                          ChannelDictionaryRef& subscribed) override;
  ChannelDictionaryRef createSamples(ChannelSubscription* subscription,
                                     const ChannelDictionaryRef& subscribed,
                                     std::optional<Error>& error) override;
  ChannelDictionaryRef createSamplesDelta(const ChannelDictionaryRef& earlier,
                                          const ChannelDictionaryRef& later,
                                          std::optional<Error>& error) override;
  ChannelDictionaryRef copyDictionary(const ChannelDictionaryRef& samples) override {
    return samples;
  }
  void iterateSamples(const ChannelDictionary& samples,
                      const Function<int(const ChannelSample& sample)>& callback) override;
  std::optional<std::string_view> channelName(const ChannelSample& sample) override;
  int64_t simpleIntegerValue(const ChannelSample& sample, int index) override;

 private:
  const DriverOptions options_;
  ThreadChecker thread_;
  std::vector<std::unique_ptr<ChannelSubscription>> subscriptions_ GUARDED_BY(thread_);
  std::set<std::string> complainedOf_ GUARDED_BY(thread_);  // channels, so bounded by theirs
};

// A counter's text as a number: decimal with an optional sign, or 0x and hexadecimal digits, and at
// most one newline after it. Code EINVAL when it is none, ERANGE when it does not fit into 64 bits.
Result<int64_t> parseCounter(std::string_view text);

// The number after "key" in the text of a status file, which has lines "key : number". Code ENOENT
// when the line is not there. A stream that is closed has moved nothing yet: once it is opened, it
// counts from zero.
Result<int64_t> parseStatus(std::string_view text, std::string_view key);

}  // namespace vx::lnx
