#include "platform/linux/PlatformConfiguration.h"

#include <pwd.h>
#include <toml++/toml.h>

#include <algorithm>
#include <cerrno>
#include <cstdlib>
#include <limits>
#include <optional>
#include <set>
#include <span>

#include "platform/linux/RelayBackend.h"
#include "platform/linux/settings/TomlText.h"

namespace vx::lnx {

namespace {

std::string directoryFrom(const char* variable, const char* fallback) {
  const char* value = std::getenv(variable);
  std::string path = value != nullptr ? value : "";
  path = path.substr(0, path.find(':'));  // the service manager may name several: the first is ours
  if (path.empty()) path = std::string(fallback) + "/vxreporting";
  while (path.size() > 1 && path.back() == '/') path.pop_back();
  return path;
}

// "256MiB" and the like.
std::optional<int64_t> sizeFromText(const std::string& text) {
  char* end = nullptr;
  errno = 0;
  const long long number = std::strtoll(text.c_str(), &end, 10);
  if (end == text.c_str() || errno != 0 || number < 0) return std::nullopt;
  const std::string unit = end;
  int shift = -1;
  if (unit.empty() || unit == "B")
    shift = 0;
  else if (unit == "KiB")
    shift = 10;
  else if (unit == "MiB")
    shift = 20;
  else if (unit == "GiB")
    shift = 30;
  if (shift < 0 || number > (std::numeric_limits<int64_t>::max() >> shift)) return std::nullopt;
  return int64_t{number} << shift;
}

std::string quoted(std::span<const std::string_view> names) {
  std::string text;
  for (const std::string_view name : names)
    text += (text.empty() ? "\"" : ", \"") + std::string(name) + "\"";
  return text;
}

// One table of the file: takes the keys it is asked for, and complains of all others.
class Section {
 public:
  Section(const toml::table& table, std::string name, std::string file,
          std::vector<std::string>& complaints)
      : table_(table), name_(std::move(name)), file_(std::move(file)), complaints_(complaints) {}
  ~Section() {
    for (const auto& [key, node] : table_) {
      if (!known_.contains(std::string(key.str()))) complain(key.str(), node, "unknown key");
    }
  }
  Section(const Section&) = delete;
  Section& operator=(const Section&) = delete;

  void boolean(const char* key, bool& out) {
    const toml::node* node = find(key);
    if (node == nullptr) return;
    if (const auto value = node->value_exact<bool>())
      out = *value;
    else
      complain(key, *node, "must be true or false");
  }
  template <class T>
  void integer(const char* key, T& out, int64_t least, int64_t most) {
    const toml::node* node = find(key);
    if (node == nullptr) return;
    const auto value = node->value_exact<int64_t>();
    if (value && *value >= least && *value <= most)
      out = static_cast<T>(*value);
    else
      complain(key, *node,
               "must be an integer from " + std::to_string(least) + " to " + std::to_string(most));
  }
  void size(const char* key, uint64_t& out, int64_t least) {
    const toml::node* node = find(key);
    if (node == nullptr) return;
    std::optional<int64_t> value = node->value_exact<int64_t>();
    if (const auto text = node->value_exact<std::string>()) value = sizeFromText(*text);
    if (value && *value >= least)
      out = static_cast<uint64_t>(*value);
    else
      complain(key, *node,
               "must be a number of bytes, or a text such as \"256MiB\", of at least " +
                   std::to_string(least));
  }
  void real(const char* key, double& out, double least, double most) {
    const toml::node* node = find(key);
    if (node == nullptr) return;
    std::optional<double> value = node->value_exact<double>();
    if (const auto whole = node->value_exact<int64_t>()) value = static_cast<double>(*whole);
    if (value && *value >= least && *value <= most)
      out = *value;
    else
      complain(key, *node,
               "must be a number from " + std::to_string(least) + " to " + std::to_string(most));
  }
  void milliseconds(const char* key, std::chrono::milliseconds& out, int64_t least, int64_t most) {
    int64_t value = out.count();
    integer(key, value, least, most);
    out = std::chrono::milliseconds(value);
  }
  void text(const char* key, std::string& out) {
    const toml::node* node = find(key);
    if (node == nullptr) return;
    if (const auto value = node->value_exact<std::string>())
      out = *value;
    else
      complain(key, *node, "must be a text");
  }
  template <class E>
  void choice(const char* key, E& out, const std::map<std::string, E>& choices) {
    const toml::node* node = find(key);
    if (node == nullptr) return;
    const auto value = node->value_exact<std::string>();
    const auto found = value ? choices.find(*value) : choices.end();
    if (found != choices.end()) {
      out = found->second;
      return;
    }
    std::vector<std::string_view> known;
    known.reserve(choices.size());
    for (const auto& [name, choice] : choices) known.push_back(name);
    complain(key, *node, "must be one of " + quoted(known));
  }
  // Those of an array's texts that are known, each once; the others are complained of.
  void names(const char* key, std::vector<std::string>& out,
             std::span<const std::string_view> known) {
    const toml::node* node = find(key);
    if (node == nullptr) return;
    const toml::array* array = node->as_array();
    if (array == nullptr || (!array->empty() && !array->is_homogeneous(toml::node_type::string)))
      return complain(key, *node, "must be an array of texts");
    out.clear();
    for (const toml::node& element : *array) {
      const std::string name = element.value_or(std::string());
      if (std::find(known.begin(), known.end(), name) == known.end())
        complain(key, element, "\"" + name + "\" is not known; must be one of " + quoted(known));
      else if (std::find(out.begin(), out.end(), name) == out.end())
        out.push_back(name);
    }
  }
  // Numbers and names; what is no user is complained of.
  void users(const char* key, std::vector<uid_t>& out) {
    const toml::node* node = find(key);
    if (node == nullptr) return;
    const toml::array* array = node->as_array();
    if (array == nullptr) return complain(key, *node, "must be an array of users");
    out.clear();
    for (const toml::node& element : *array) {
      const auto number = element.value_exact<int64_t>();
      const auto name = element.value_exact<std::string>();
      const passwd* const user = name ? getpwnam(name->c_str()) : nullptr;
      if (user != nullptr)
        out.push_back(user->pw_uid);
      else if (number && *number >= 0 && *number < UINT32_MAX)
        out.push_back(static_cast<uid_t>(*number));
      else
        complain(key, element,
                 name ? "there is no user \"" + *name + "\""
                      : "must hold names and numbers of users only");
    }
  }
  const toml::node* find(const char* key) {
    known_.insert(key);
    return table_.get(key);
  }
  void complain(std::string_view key, const toml::node& node, const std::string& what) {
    complaints_.push_back(file_ + ":" + std::to_string(node.source().begin.line) + ": " +
                          (name_.empty() ? "" : name_ + ".") + std::string(key) + ": " + what);
  }

 private:
  const toml::table& table_;
  const std::string name_;
  const std::string file_;
  std::vector<std::string>& complaints_;
  std::set<std::string> known_;
};

class Reader {
 public:
  Reader(const toml::table& root, std::string file, std::vector<std::string>& complaints)
      : file_(std::move(file)), complaints_(complaints), root_(root, "", file_, complaints_) {}

  void read(PlatformConfiguration& c) {
    section("device", [&](Section& s) {
      s.boolean("internal_build", c.device.internalBuild);
      s.integer("device_class_number", c.device.deviceClassNumber, INT32_MIN, INT32_MAX);
    });
    section("log", [&](Section& s) {
      using Log = LogOptions;
      s.choice<Log::Destination>("destination", c.log.destination,
                                 {{"auto", Log::Destination::Auto},
                                  {"journal", Log::Destination::Journal},
                                  {"stderr", Log::Destination::Stderr}});
      s.choice<Log::Level>("level", c.log.level,
                           {{"debug", Log::Level::Debug},
                            {"info", Log::Level::Info},
                            {"default", Log::Level::Default},
                            {"error", Log::Level::Error}});
      s.integer("burst", c.log.burst, 0, UINT16_MAX);
      s.real("refill_per_second", c.log.refillPerSecond, 0.001, 1000000);
    });
    section("relay",
            [&](Section& s) { s.names("backends", c.relay.backends, kRelayBackendNames); });
    section("store", [&](Section& s) {
      s.size("max_bytes", c.store.maxBytes, 1 << 20);
      s.integer("max_age_days", c.store.maxAgeDays, 0, 36500);
      s.size("queue_bytes", c.memory.maxWaitingBytes, 64 << 10);
      s.milliseconds("commit_interval_ms", c.store.commit.interval, 1, 60000);
    });
    section("memory", [&](Section& s) {
      s.size("max_user_bytes", c.memory.maxUserBytes, 64 << 10);
      s.size("max_bytes", c.memory.maxBytes, 64 << 10);
      s.size("max_user_waiting_bytes", c.memory.maxUserWaitingBytes, 64 << 10);
    });
    section("listener", [&](Section& s) {
      auto& l = c.listener;
      s.integer("max_connections", l.maxConnections, 1, 1000000);
      s.integer("max_connections_per_user", l.maxConnectionsPerUser, 1, 1000000);
      s.integer("max_sessions_per_connection", l.maxSessionsPerConnection, 1, 1000000);
      s.integer("max_identifiers", l.maxIdentifiers, 1, 1000000);
      s.integer("max_calls_in_flight", l.maxCallsInFlight, 1, 1000000);
      s.integer("max_frame_bytes", l.maxFrameBytes, 1024, ListenerOptions::kLargestFrameBytes);
      s.integer("max_unread_reply_bytes", l.maxUnreadReplyBytes, 4096, 64 << 20);
      s.milliseconds("stalled_client_timeout_ms", l.stalledClientTimeout, 10, 3600000);
      s.users("kill_allowed_users", l.killAllowedUsers);
    });
    section("inspect", [&](Section& s) { s.text("group", c.inspect.group); });
    section("drivers", [&](Section& s) {
      s.text("root", c.drivers.root);
      readMapped(s, c.drivers.mapped);
    });
    section("orientation", [&](Section& s) {
      s.boolean("device_sensor", c.orientation.deviceSensor);
      s.text("interface_state_file", c.orientation.interfaceStateFile);
    });
    section("preferences", [&](Section& s) {
      s.milliseconds("settle_ms", c.preferences.settle, 1, 10000);
      s.milliseconds("poll_interval_ms", c.preferences.pollInterval, 100, 3600000);
    });
    // Nobody waits for a commit that is not due yet.
    c.store.commit.bytes = std::min<std::size_t>(
        c.store.commit.bytes, std::min(c.memory.maxUserWaitingBytes, c.memory.maxWaitingBytes) / 4);
  }

 private:
  template <class F>
  void section(const char* name, const F& read) {
    const toml::node* node = root_.find(name);
    if (node == nullptr) return;
    const toml::table* table = node->as_table();
    if (table == nullptr) return root_.complain(name, *node, "must be a table");
    Section s(*table, name, file_, complaints_);
    read(s);
  }
  void readMapped(Section& drivers, std::vector<MappedChannelSource>& out) {
    const toml::node* node = drivers.find("mapped");
    if (node == nullptr) return;
    const toml::array* array = node->as_array();
    if (array == nullptr || (!array->empty() && !array->is_homogeneous(toml::node_type::table))) {
      return drivers.complain("mapped", *node, "must be written as [[drivers.mapped]] tables");
    }
    for (const toml::node& element : *array) {
      MappedChannelSource source;
      {
        Section s(*element.as_table(), "drivers.mapped", file_, complaints_);
        s.text("group", source.group);
        s.text("subgroup", source.subGroup);
        s.text("path", source.path);
        s.choice<MappedChannelSource::Kind>(
            "kind", source.kind,
            {{"alsa", MappedChannelSource::Kind::AlsaProc},
             {"statistics", MappedChannelSource::Kind::Statistics}});
      }
      if (source.path.empty())
        drivers.complain("mapped", element, "needs a path");
      else if (source.group.empty() && source.subGroup.empty())
        drivers.complain("mapped", element, "needs a group or a subgroup");
      else
        out.push_back(std::move(source));
    }
  }

  const std::string file_;
  std::vector<std::string>& complaints_;
  Section root_;
};

}  // namespace

Directories Directories::fromEnvironment() {
  return {.runtime = directoryFrom("RUNTIME_DIRECTORY", "/run"),
          .state = directoryFrom("STATE_DIRECTORY", "/var/lib"),
          .configuration = directoryFrom("CONFIGURATION_DIRECTORY", "/etc"),
          .logs = directoryFrom("LOGS_DIRECTORY", "/var/log")};
}

PlatformConfiguration PlatformConfiguration::load(const Directories& directories,
                                                  std::vector<std::string>& complaints) {
  PlatformConfiguration configuration;
  const std::string path = directories.configuration + "/platform.toml";
  const Result<std::string> text = readTomlText(path);
  if (!text.ok()) {
    const int code = text.status().code();
    if (code != ENOENT && code != ENOTDIR) complaints.push_back(text.status().text());
    return configuration;
  }
  try {
    const toml::table root = toml::parse(*text, path);
    Reader(root, path, complaints).read(configuration);
  } catch (const toml::parse_error& failure) {
    complaints.push_back(complaintOf(path, failure));
  }
  return configuration;
}

}  // namespace vx::lnx
