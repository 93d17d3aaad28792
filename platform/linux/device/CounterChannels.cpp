#include "platform/linux/device/CounterChannels.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <map>
#include <set>

#include "base/Status.h"
#include "platform/Log.h"

namespace vx {

class ChannelSample {
 public:
  std::string name;
  int64_t value = 0;
};

}  // namespace vx

namespace vx::lnx {

namespace {

constexpr std::size_t kMaxCounterBytes = 64;
constexpr std::size_t kMaxStatusBytes = 4096;

// Where a channel's number comes from. A status file (ALSA's) holds several, each as "key :
// number".
struct Channel {
  std::string name;
  std::string path;
  std::string statusKey;  // empty: the file holds the number alone
};

// Keyed by what tells channels apart even where names repeat: the path, and the key inside it.
struct ChannelSet final : ChannelDictionary {
  std::map<std::string, Channel> channels;
};
struct SampleSet final : ChannelDictionary {
  std::map<std::string, ChannelSample> samples;
};
struct CounterSubscription final : ChannelSubscription {};

const ChannelSet* asChannels(const ChannelDictionary* set) {
  return dynamic_cast<const ChannelSet*>(set);
}
const SampleSet* asSamples(const ChannelDictionary* set) {
  return dynamic_cast<const SampleSet*>(set);
}

bool isDirectory(const std::string& path) {
  struct stat status {};
  return stat(path.c_str(), &status) == 0 && S_ISDIR(status.st_mode);
}

// False for folders, FIFOs, devices and sockets, which are never opened. What cannot be looked at
// counts as a channel: sampling it will say why.
bool mayBeCounter(const std::string& path) {
  struct stat status {};
  return stat(path.c_str(), &status) != 0 || S_ISREG(status.st_mode);
}

// Names in a folder, sorted, without those that start with a dot; just more than a subscription may
// have when there are so many. False with errno when it cannot be read.
bool listFolder(const std::string& path, std::set<std::string>& names) {
  DIR* folder = opendir(path.c_str());
  if (folder == nullptr) return false;
  while (const dirent* entry = readdir(folder)) {
    if (names.size() > CounterChannels::kMaxChannels) break;
    if (entry->d_name[0] != '.') names.insert(entry->d_name);
  }
  closedir(folder);
  return true;
}

// What stands in the way of reading a folder; nothing when it simply is not there.
bool folderMissing(int errnoValue) { return errnoValue == ENOENT || errnoValue == ENOTDIR; }

class Collector {
 public:
  bool found = false;  // a folder of the group exists
  std::optional<Error> error;
  std::shared_ptr<ChannelSet> set = std::make_shared<ChannelSet>();

  void addFolder(const std::string& path) {
    std::set<std::string> names;
    if (!list(path, names)) return;
    found = true;
    for (const std::string& name : names) {
      const std::string file = path + "/" + name;
      if (mayBeCounter(file)) add({name, file, ""});
    }
  }
  void addSubFolders(const std::string& path) {
    std::set<std::string> names;
    if (!list(path, names)) return;
    for (const std::string& name : names) {
      if (isDirectory(path + "/" + name)) addFolder(path + "/" + name);
    }
  }
  // /proc/asound/card*/pcm*/sub*/status: lines "key : value"; a closed stream says so and gives no
  // channel.
  void addAlsa(const std::string& root) {
    std::set<std::string> cards;
    if (!list(root, cards)) return;
    found = true;
    for (const std::string& card : cards) {
      if (card.rfind("card", 0) != 0 || !isDirectory(root + "/" + card)) continue;
      std::set<std::string> devices;
      listFolder(root + "/" + card, devices);
      for (const std::string& device : devices) {
        if (device.rfind("pcm", 0) != 0) continue;
        std::set<std::string> streams;
        listFolder(root + "/" + card + "/" + device, streams);
        for (const std::string& stream : streams) {
          if (stream.rfind("sub", 0) != 0) continue;
          const std::string file = root + "/" + card + "/" + device + "/" + stream + "/status";
          for (const char* key : {"delay", "avail", "avail_max", "hw_ptr", "appl_ptr"}) {
            add({card + "_" + device + "_" + stream + "_" + key, file, key});
          }
        }
      }
    }
  }
  bool list(const std::string& path, std::set<std::string>& names) {
    if (listFolder(path, names)) return true;
    if (!folderMissing(errno)) error = posixError(errno, path);
    return false;
  }

 private:
  void add(Channel channel) {
    if (set->channels.size() >= CounterChannels::kMaxChannels) {
      if (!full_) {
        VX_LOG(nullptr, Error, "more than %zu channels; those after %s are left out",
               CounterChannels::kMaxChannels, channel.path.c_str());
      }
      full_ = true;
      return;
    }
    const std::string key = channel.path + ":" + channel.statusKey;
    set->channels.emplace(key, std::move(channel));
  }
  bool full_ = false;
};

// The number behind "key" in a status file. ENOENT when the stream is closed or the line is not
// there.
int statusValue(const std::string& text, const std::string& key, int64_t& value) {
  std::size_t at = 0;
  while (at < text.size()) {
    const std::size_t end = std::min(text.find('\n', at), text.size());
    const std::string_view line = std::string_view(text).substr(at, end - at);
    const std::size_t colon = line.find(':');
    if (colon != std::string_view::npos) {
      std::string_view name = line.substr(0, colon);
      std::string_view number = line.substr(colon + 1);
      while (!name.empty() && name.back() == ' ') name.remove_suffix(1);
      while (!number.empty() && number.front() == ' ') number.remove_prefix(1);
      if (name == key) return parseCounter(number, value);
    }
    at = end + 1;
  }
  return ENOENT;
}

// 0, or an errno value; ENOENT and ENODEV mean that the channel has vanished.
int readChannel(const Channel& channel, int64_t& value) {
  const std::size_t most = channel.statusKey.empty() ? kMaxCounterBytes : kMaxStatusBytes;
  // Files below /proc and /sys say 0 or 4096 of their size, whatever they hold.
  const int fd = open(channel.path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY);
  if (fd < 0) return errno;
  struct stat status {};
  if (fstat(fd, &status) != 0 || !S_ISREG(status.st_mode)) {
    close(fd);
    return EINVAL;
  }
  std::string text(most + 1, '\0');
  std::size_t had = 0;
  ssize_t got = 0;
  while (had < text.size() && (got = read(fd, text.data() + had, text.size() - had)) > 0) {
    had += static_cast<std::size_t>(got);
  }
  const int failure = got < 0 ? errno : 0;
  close(fd);
  if (failure != 0) return failure;
  if (had > most) return EINVAL;
  text.resize(had);
  return channel.statusKey.empty() ? parseCounter(text, value)
                                   : statusValue(text, channel.statusKey, value);
}

}  // namespace

int parseCounter(std::string_view text, int64_t& value) {
  if (!text.empty() && text.back() == '\n') text.remove_suffix(1);
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
    if (text.front() == '-') return EINVAL;
  } else if (!text.empty() && text.front() == '+') {
    text.remove_prefix(1);
    if (!text.empty() && text.front() == '-') return EINVAL;
  }
  const auto [end, code] = std::from_chars(text.data(), text.data() + text.size(), value, base);
  if (code == std::errc::result_out_of_range) return ERANGE;
  return code == std::errc() && end == text.data() + text.size() && !text.empty() ? 0 : EINVAL;
}

ChannelDictionaryRef CounterChannels::copyChannelsInGroup(
    const std::optional<std::string>& group, const std::optional<std::string>& subGroup,
    uint64_t flags, std::optional<Error>& error) {
  if (flags != 0) {
    error = posixError(EINVAL, "channel flags");
    return nullptr;
  }
  Collector collector;
  const std::string& root = options_.root;
  std::set<std::string> groups;
  if (group)
    groups.insert(*group);
  else
    collector.list(root, groups);
  for (const std::string& name : groups) {
    const std::string folder = root + "/" + name;
    if (subGroup) {
      collector.addFolder(folder + "/" + *subGroup);
    } else {
      collector.addFolder(folder);
      collector.addSubFolders(folder);
    }
  }
  for (const MappedChannelSource& source : options_.mapped) {
    if ((group && *group != source.group) || (subGroup && *subGroup != source.subGroup)) continue;
    if (source.kind == MappedChannelSource::Kind::Statistics)
      collector.addFolder(source.path);
    else
      collector.addAlsa(source.path);
  }
  if (collector.error) error = collector.error;
  return collector.found ? collector.set : nullptr;
}

int32_t CounterChannels::channelCount(const ChannelDictionary& channels) {
  const ChannelSet* set = asChannels(&channels);
  return set != nullptr ? static_cast<int32_t>(set->channels.size()) : 0;
}

ChannelSubscription* CounterChannels::createSubscription(const ChannelDictionaryRef& channels,
                                                         ChannelDictionaryRef& subscribed) {
  if (asChannels(channels.get()) == nullptr) return nullptr;
  subscribed = channels;
  return subscriptions_.emplace_back(std::make_unique<CounterSubscription>()).get();
}

ChannelDictionaryRef CounterChannels::createSamples(ChannelSubscription* subscription,
                                                    const ChannelDictionaryRef& subscribed,
                                                    std::optional<Error>& error) {
  const ChannelSet* channels = asChannels(subscribed.get());
  if (subscription == nullptr || channels == nullptr) {
    error = posixError(EBADF, "no subscription");
    return nullptr;
  }
  auto samples = std::make_shared<SampleSet>();
  for (const auto& [key, channel] : channels->channels) {
    int64_t value = 0;
    const int failure = readChannel(channel, value);
    if (failure == ENOENT || failure == ENODEV) continue;  // vanished, or a stream that is closed
    if (failure != 0) {
      error = posixError(failure, channel.path);
      return nullptr;
    }
    samples->samples[key] = ChannelSample{channel.name, value};
  }
  return samples;
}

ChannelDictionaryRef CounterChannels::createSamplesDelta(const ChannelDictionaryRef& earlier,
                                                         const ChannelDictionaryRef& later,
                                                         std::optional<Error>& error) {
  const SampleSet* before = asSamples(earlier.get());
  const SampleSet* after = asSamples(later.get());
  if (before == nullptr || after == nullptr) {
    error = posixError(EINVAL, "no earlier samples");
    return nullptr;
  }
  auto delta = std::make_shared<SampleSet>();
  for (const auto& [key, sample] : after->samples) {
    const auto old = before->samples.find(key);
    if (old == before->samples.end()) continue;
    // Counters wrap; unsigned arithmetic does the same without being undefined.
    const uint64_t difference =
        static_cast<uint64_t>(sample.value) - static_cast<uint64_t>(old->second.value);
    delta->samples[key] = ChannelSample{sample.name, static_cast<int64_t>(difference)};
  }
  return delta;
}

void CounterChannels::iterateSamples(const ChannelDictionary& samples,
                                     const Function<int(const ChannelSample&)>& callback) {
  const SampleSet* set = asSamples(&samples);
  if (set == nullptr) return;
  for (const auto& [key, sample] : set->samples) {
    if (callback(sample) != 0) return;
  }
}

std::optional<std::string_view> CounterChannels::channelName(const ChannelSample& sample) {
  return sample.name;
}

int64_t CounterChannels::simpleIntegerValue(const ChannelSample& sample, int) {
  return sample.value;
}

}  // namespace vx::lnx
