#include "platform/linux/device/CounterChannels.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <map>
#include <memory>
#include <set>

#include "base/UniqueFd.h"
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

using Names = std::set<std::string>;

// Names in a folder, sorted, without those that start with a dot; just more than a subscription may
// have when there are so many.
Result<Names> listFolder(const std::string& path) {
  const std::unique_ptr<DIR, int (*)(DIR*)> folder(opendir(path.c_str()), closedir);
  if (folder == nullptr) return Status::lastError(path);
  Names names;
  while (const dirent* entry = readdir(folder.get())) {
    if (names.size() > CounterChannels::kMaxChannels) break;
    if (entry->d_name[0] != '.') names.insert(entry->d_name);
  }
  return names;
}

class Collector {
 public:
  bool found = false;  // a folder of the group exists
  Status status;       // the last folder that cannot be read
  std::shared_ptr<ChannelSet> set = std::make_shared<ChannelSet>();

  void addFolder(const std::string& path) {
    const std::optional<Names> names = list(path);
    if (!names) return;
    found = true;
    for (const std::string& name : *names) {
      const std::string file = path + "/" + name;
      if (mayBeCounter(file)) add({name, file, ""});
    }
  }
  void addSubFolders(const std::string& path) {
    for (const std::string& name : list(path).value_or(Names())) {
      if (isDirectory(path + "/" + name)) addFolder(path + "/" + name);
    }
  }
  // /proc/asound/card*/pcm*/sub*/status: lines "key : value"; a closed stream says so and is at 0.
  void addAlsa(const std::string& root) {
    const std::optional<Names> cards = list(root);
    if (!cards) return;
    found = true;
    for (const std::string& card : *cards) {
      if (!card.starts_with("card") || !isDirectory(root + "/" + card)) continue;
      for (const std::string& device : below(root + "/" + card, "pcm")) {
        for (const std::string& stream : below(root + "/" + card + "/" + device, "sub")) {
          const std::string file = root + "/" + card + "/" + device + "/" + stream + "/status";
          for (const char* key : {"delay", "avail", "avail_max", "hw_ptr", "appl_ptr"}) {
            add({card + "_" + device + "_" + stream + "_" + key, file, key});
          }
        }
      }
    }
  }
  // None when it cannot be read, which is a failure unless it simply is not there.
  std::optional<Names> list(const std::string& path) {
    Result<Names> names = listFolder(path);
    if (names.ok()) return std::move(*names);
    const int code = names.status().code();
    if (code != ENOENT && code != ENOTDIR) status = names.status();
    return std::nullopt;
  }

 private:
  // What has that beginning; a device may have gone meanwhile.
  static Names below(const std::string& path, std::string_view beginning) {
    Result<Names> names = listFolder(path);
    if (!names.ok()) return {};
    std::erase_if(*names, [&](const std::string& name) { return !name.starts_with(beginning); });
    return std::move(*names);
  }
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

// The beginning of a regular file, as much as fits into `text`. Not by the size that the file says
// it has: below /proc and /sys that is 0 or 4096, whatever it holds.
Result<std::size_t> readInto(const std::string& path, std::string& text) {
  const UniqueFd fd(open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
  if (!fd) return Status::lastError(path);
  struct stat status {};
  if (fstat(fd.get(), &status) != 0 || !S_ISREG(status.st_mode)) return Status::posix(path, EINVAL);
  std::size_t had = 0;
  ssize_t got = 0;
  while (had < text.size() && (got = read(fd.get(), text.data() + had, text.size() - had)) > 0) {
    had += static_cast<std::size_t>(got);
  }
  if (got < 0) return Status::lastError(path);
  return had;
}

// Codes ENOENT and ENODEV mean that the channel has vanished, or is being written.
Result<int64_t> readChannel(const Channel& channel) {
  const std::size_t most = channel.statusKey.empty() ? kMaxCounterBytes : kMaxStatusBytes;
  std::string text(most + 1, '\0');
  const Result<std::size_t> size = readInto(channel.path, text);
  if (!size.ok()) return size.status();
  if (*size > most) return Status::posix(channel.path, EINVAL);
  if (*size == 0) return Status::posix(channel.path, ENOENT);
  text.resize(*size);
  const Result<int64_t> value =
      channel.statusKey.empty() ? parseCounter(text) : parseStatus(text, channel.statusKey);
  return value.ok() ? value : Status::posix(channel.path, value.status().code());
}

}  // namespace

Result<int64_t> parseCounter(std::string_view text) {
  const Status none = Status::posix("not a number", EINVAL);
  if (!text.empty() && text.back() == '\n') text.remove_suffix(1);
  int base = 10;
  if (text.size() > 2 && text[0] == '0' && (text[1] == 'x' || text[1] == 'X')) {
    base = 16;
    text.remove_prefix(2);
    if (text.front() == '-') return none;
  } else if (!text.empty() && text.front() == '+') {
    text.remove_prefix(1);
    if (!text.empty() && text.front() == '-') return none;
  }
  int64_t value = 0;
  const auto [end, code] = std::from_chars(text.data(), text.data() + text.size(), value, base);
  if (code == std::errc::result_out_of_range) return Status::posix("too large a number", ERANGE);
  if (code != std::errc() || end != text.data() + text.size() || text.empty()) return none;
  return value;
}

Result<int64_t> parseStatus(std::string_view text, std::string_view key) {
  if (text.starts_with("closed")) return 0;
  std::size_t at = 0;
  while (at < text.size()) {
    const std::size_t end = std::min(text.find('\n', at), text.size());
    const std::string_view line = text.substr(at, end - at);
    const std::size_t colon = line.find(':');
    if (colon != std::string_view::npos) {
      std::string_view name = line.substr(0, colon);
      std::string_view number = line.substr(colon + 1);
      while (!name.empty() && name.back() == ' ') name.remove_suffix(1);
      while (!number.empty() && number.front() == ' ') number.remove_prefix(1);
      if (name == key) return parseCounter(number);
    }
    at = end + 1;
  }
  return Status::posix(std::string(key), ENOENT);
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
  const Names groups = group ? Names{*group} : collector.list(root).value_or(Names());
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
  if (!collector.status.ok()) error = collector.status.error();
  return collector.found ? collector.set : nullptr;
}

int32_t CounterChannels::channelCount(const ChannelDictionary& channels) {
  const ChannelSet* set = asChannels(&channels);
  return set != nullptr ? static_cast<int32_t>(set->channels.size()) : 0;
}

ChannelSubscription* CounterChannels::createSubscription(const ChannelDictionaryRef& channels,
                                                         ChannelDictionaryRef& subscribed) {
  thread_.assertHere();
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
  thread_.assertHere();
  auto samples = std::make_shared<SampleSet>();
  for (const auto& [key, channel] : channels->channels) {
    const Result<int64_t> value = readChannel(channel);
    if (!value.ok()) {
      const int code = value.status().code();
      if (code == ENOENT || code == ENODEV) continue;
      if (complainedOf_.insert(key).second) {
        VX_LOG(nullptr, Error, "no driver counter: %s (left out whenever it is so)",
               value.status().text().c_str());
      }
      continue;
    }
    samples->samples[key] = ChannelSample{channel.name, *value};
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
