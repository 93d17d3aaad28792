#include "platform/linux/device/LinuxOrientation.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <sys/inotify.h>
#include <systemd/sd-bus.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <chrono>
#include <cstring>
#include <filesystem>
#include <map>
#include <optional>
#include <vector>

#include "base/FileReading.h"
#include "base/Mutex.h"
#include "platform/Log.h"
#include "platform/linux/execution/Threads.h"

namespace vx::lnx {

namespace {

using SteadyClock = std::chrono::steady_clock;

constexpr const char* kSensorName = "net.hadess.SensorProxy";
constexpr const char* kSensorPath = "/net/hadess/SensorProxy";
constexpr const char* kProperty = "AccelerometerOrientation";
constexpr std::size_t kMaxWordBytes = 64;
constexpr std::size_t kMaxWords = 64;
constexpr std::chrono::milliseconds kFirstRetry{200};
constexpr std::chrono::milliseconds kLastClaimRetry{5000};
constexpr std::chrono::seconds kLastConnectRetry{30};

// Index is the value; more words are added as they are met, up to kMaxWords.
constexpr const char* kKnownWords[] = {
    "unknown",  "undefined", "normal",         "bottom-up",       "left-up",
    "right-up", "portrait",  "landscape-left", "landscape-right", "portrait-upside-down"};

}  // namespace

// What the notifier and its thread share.
struct LinuxOrientation::State {
  using Handlers = std::map<std::string, std::shared_ptr<Handler>, std::less<>>;

  explicit State(const OrientationOptions& configured) : options(configured) {
    for (const char* word : kKnownWords) words.emplace_back(word);
  }
  ~State() {
    if (wakeFd >= 0) close(wakeFd);
  }

  void wake() const {
    const uint64_t one = 1;
    [[maybe_unused]] const ssize_t written = write(wakeFd, &one, sizeof one);
  }
  int64_t valueOf(const std::string& word) REQUIRES(mutex) {
    const auto found = std::find(words.begin(), words.end(), word);
    if (found != words.end()) return found - words.begin();
    if (words.size() >= kMaxWords) return 0;
    words.push_back(word);
    return static_cast<int64_t>(words.size()) - 1;
  }
  // Calls the handlers when the word is another than the last one known.
  void report(Handlers State::*which, std::string State::*last, const std::string& word) {
    std::vector<std::shared_ptr<Handler>> called;
    int64_t value = 0;
    {
      MutexLock lock(mutex);
      const bool isChange = !(this->*last).empty() && this->*last != word;
      this->*last = word;
      if (!isChange) return;
      value = valueOf(word);
      for (const auto& [identifier, handler] : this->*which) called.push_back(handler);
    }
    for (const auto& handler : called) (*handler)(value);
  }

  const OrientationOptions options;
  const int wakeFd = eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK);
  Mutex mutex;
  std::vector<std::string> words GUARDED_BY(mutex);
  // As many handlers as there are sessions that track orientation.
  Handlers
      device;  // guarded by mutex; named by pointers to members, which the analysis does not follow
  Handlers interface;  // likewise
  std::string lastDevice;
  std::string lastInterface;
  // What is missing is said once, and again only after it had been there.
  std::atomic<bool> saidBusIsMissing{false};
  std::atomic<bool> saidFolderIsMissing{false};
  bool running GUARDED_BY(mutex) = false;
  bool ending GUARDED_BY(mutex) = false;
};

namespace {

// The notifier's thread: lives while there are handlers.
class Watcher {
 public:
  using State = LinuxOrientation::State;
  explicit Watcher(std::shared_ptr<State> state) : state_(std::move(state)) {}
  ~Watcher() {
    disconnect();
    if (inotifyFd_ >= 0) close(inotifyFd_);
  }

  void run() {
    while (wanted()) {
      if (deviceWanted_ && state_->options.deviceSensor)
        maintainBus();
      else
        disconnect();
      if (interfaceWanted_) watchFile();
      waitAndDispatch();
    }
  }

 private:
  bool wanted() {
    MutexLock lock(state_->mutex);
    deviceWanted_ = !state_->device.empty();
    interfaceWanted_ = !state_->interface.empty();
    if (!state_->ending && (deviceWanted_ || interfaceWanted_)) return true;
    state_->running = false;
    state_->lastDevice.clear();
    state_->lastInterface.clear();
    return false;
  }

  void waitAndDispatch() {
    pollfd fds[3] = {{state_->wakeFd, POLLIN, 0}, {inotifyFd_, POLLIN, 0}, {-1, 0, 0}};
    std::optional<SteadyClock::time_point> until = retryAt_;
    if (bus_ != nullptr) {
      fds[2] = {sd_bus_get_fd(bus_), static_cast<short>(std::max(0, sd_bus_get_events(bus_))), 0};
      uint64_t microseconds = UINT64_MAX;
      if (sd_bus_get_timeout(bus_, &microseconds) >= 0 && microseconds != UINT64_MAX) {
        const SteadyClock::time_point at{
            std::chrono::microseconds(microseconds)};  // CLOCK_MONOTONIC
        if (!until || at < *until) until = at;
      }
    }
    int timeout = -1;
    if (until) {
      const auto left = std::chrono::ceil<std::chrono::milliseconds>(*until - SteadyClock::now());
      timeout = static_cast<int>(std::clamp<int64_t>(left.count(), 0, 60000));
    }
    if (poll(fds, 3, timeout) < 0) return;
    if (fds[0].revents != 0) {
      uint64_t count = 0;
      [[maybe_unused]] const ssize_t got = read(state_->wakeFd, &count, sizeof count);
    }
    if (fds[1].revents != 0) readFileEvents();
    if (bus_ != nullptr) processBus();
  }

  // --- the system bus ---

  void maintainBus() {
    if (bus_ == nullptr && (!retryAt_ || SteadyClock::now() >= *retryAt_))
      connect();
    else if (bus_ != nullptr && retryAt_ && SteadyClock::now() >= *retryAt_)
      claim();
  }

  void connect() {
    retryAt_.reset();
    sd_bus* bus = nullptr;
    int code = sd_bus_open_system(&bus);
    if (code >= 0) {
      bus_ = bus;
      code = sd_bus_match_signal_async(bus_, nullptr, "org.freedesktop.DBus",
                                       "/org/freedesktop/DBus", "org.freedesktop.DBus",
                                       "NameOwnerChanged", &Watcher::onOwnerChanged, nullptr, this);
    }
    if (code >= 0) {
      code = sd_bus_match_signal_async(bus_, nullptr, nullptr, kSensorPath,
                                       "org.freedesktop.DBus.Properties", "PropertiesChanged",
                                       &Watcher::onPropertiesChanged, nullptr, this);
    }
    if (code < 0) {
      if (!state_->saidBusIsMissing.exchange(true)) {
        VX_LOG(nullptr, Info, "device orientation is off for now: no system bus (%s)",
               std::strerror(-code));
      }
      disconnect();
      retryLater(kLastConnectRetry);
      return;
    }
    state_->saidBusIsMissing = false;
    backoff_ = {};
    claim();
  }

  void disconnect() {
    if (bus_ == nullptr) return;
    // Closing lets go of the claim as well.
    sd_bus_close(bus_);
    sd_bus_unref(bus_);
    bus_ = nullptr;
    claimed_ = false;
    retryAt_.reset();
  }

  void retryLater(std::chrono::milliseconds most) {
    backoff_ = std::clamp<std::chrono::milliseconds>(backoff_ * 2, kFirstRetry, most);
    retryAt_ = SteadyClock::now() + backoff_;
  }

  void claim() {
    retryAt_.reset();
    claimed_ = false;
    sd_bus_message* call = nullptr;
    int code = sd_bus_message_new_method_call(bus_, &call, kSensorName, kSensorPath, kSensorName,
                                              "ClaimAccelerometer");
    if (code >= 0) {
      // A sensor that is not there must not be started by asking for it: it appears when it
      // appears.
      sd_bus_message_set_auto_start(call, 0);
      code = sd_bus_call_async(bus_, nullptr, call, &Watcher::onClaimed, this, 0);
    }
    sd_bus_message_unref(call);
    if (code < 0) retryLater(kLastClaimRetry);
  }

  static int onClaimed(sd_bus_message* answer, void* self, sd_bus_error*) {
    static_cast<Watcher*>(self)->claimAnswered(answer);
    return 0;
  }
  void claimAnswered(sd_bus_message* answer) {
    if (const sd_bus_error* error = sd_bus_message_get_error(answer)) {
      // Without an owner there is nothing to try again: its appearance is announced. Otherwise it
      // is still waking up.
      const bool absent =
          sd_bus_error_has_name(error, "org.freedesktop.DBus.Error.ServiceUnknown") != 0 ||
          sd_bus_error_has_name(error, "org.freedesktop.DBus.Error.NameHasNoOwner") != 0;
      if (!absent) retryLater(kLastClaimRetry);
      return;
    }
    claimed_ = true;
    backoff_ = {};
    (void)sd_bus_call_method_async(bus_, nullptr, kSensorName, kSensorPath,
                                   "org.freedesktop.DBus.Properties", "Get", &Watcher::onProperty,
                                   this, "ss", kSensorName, kProperty);
  }

  static int onProperty(sd_bus_message* answer, void* self, sd_bus_error*) {
    const char* word = nullptr;
    if (sd_bus_message_get_error(answer) == nullptr &&
        sd_bus_message_read(answer, "v", "s", &word) >= 0) {
      static_cast<Watcher*>(self)->deviceIs(word);
    }
    return 0;
  }

  static int onOwnerChanged(sd_bus_message* signal, void* self, sd_bus_error*) {
    const char* name = nullptr;
    const char* before = nullptr;
    const char* after = nullptr;
    if (sd_bus_message_read(signal, "sss", &name, &before, &after) < 0 ||
        std::strcmp(name, kSensorName) != 0)
      return 0;
    auto* watcher = static_cast<Watcher*>(self);
    watcher->claimed_ = false;
    watcher->backoff_ = {};
    if (*after != '\0') watcher->claim();
    return 0;
  }

  static int onPropertiesChanged(sd_bus_message* signal, void* self, sd_bus_error*) {
    const char* interface = nullptr;
    if (sd_bus_message_read(signal, "s", &interface) < 0 ||
        std::strcmp(interface, kSensorName) != 0)
      return 0;
    if (sd_bus_message_enter_container(signal, 'a', "{sv}") < 0) return 0;
    while (sd_bus_message_enter_container(signal, 'e', "sv") > 0) {
      const char* key = nullptr;
      const char* word = nullptr;
      if (sd_bus_message_read(signal, "s", &key) < 0) break;
      if (std::strcmp(key, kProperty) == 0) {
        if (sd_bus_message_read(signal, "v", "s", &word) >= 0)
          static_cast<Watcher*>(self)->deviceIs(word);
      } else if (sd_bus_message_skip(signal, "v") < 0) {
        break;
      }
      if (sd_bus_message_exit_container(signal) < 0) break;
    }
    return 0;
  }

  void deviceIs(const char* word) {
    const std::string text = std::string(word).substr(0, kMaxWordBytes);
    if (!text.empty()) state_->report(&State::device, &State::lastDevice, text);
  }

  void processBus() {
    int code = 0;
    while (bus_ != nullptr && (code = sd_bus_process(bus_, nullptr)) > 0) {
    }
    if (code < 0) {
      VX_LOG(nullptr, Info, "the system bus is gone (%s); device orientation waits for it",
             std::strerror(-code));
      state_->saidBusIsMissing = true;
      disconnect();
      retryLater(kLastConnectRetry);
    }
  }

  // --- the state file ---

  // Tried again whenever a handler comes or goes.
  void watchFile() {
    if (inotifyFd_ >= 0) return;
    const std::filesystem::path folder =
        std::filesystem::path(state_->options.interfaceStateFile).parent_path();
    inotifyFd_ = inotify_init1(IN_NONBLOCK | IN_CLOEXEC);
    if (inotifyFd_ < 0 || inotify_add_watch(inotifyFd_, folder.c_str(),
                                            IN_CLOSE_WRITE | IN_MOVED_TO | IN_ONLYDIR) < 0) {
      const int failure = errno;
      if (!state_->saidFolderIsMissing.exchange(true)) {
        VX_LOG(nullptr, Info, "interface orientation is off for now: cannot watch %s (%s)",
               folder.c_str(), std::strerror(failure));
      }
      if (inotifyFd_ >= 0) close(inotifyFd_);
      inotifyFd_ = -1;
      return;
    }
    state_->saidFolderIsMissing = false;
    readFile();
  }

  void readFileEvents() {
    alignas(inotify_event) char buffer[4096];
    const std::string name = std::filesystem::path(state_->options.interfaceStateFile).filename();
    bool changed = false;
    ssize_t got = 0;
    while ((got = read(inotifyFd_, buffer, sizeof buffer)) > 0) {
      for (char* at = buffer; at < buffer + got;) {
        const auto* event = reinterpret_cast<const inotify_event*>(at);
        at += sizeof(inotify_event) + event->len;
        changed = changed || (event->mask & IN_Q_OVERFLOW) != 0 ||
                  (event->len > 0 && name == event->name);
      }
    }
    if (changed) readFile();
  }

  void readFile() {
    const Result<std::string> text =
        readRegularFile(state_->options.interfaceStateFile, kMaxWordBytes);
    if (!text.ok()) return;
    const std::size_t first = text->find_first_not_of(" \t\r\n");
    if (first == std::string::npos) return;
    const std::size_t last = text->find_last_not_of(" \t\r\n");
    state_->report(&State::interface, &State::lastInterface, text->substr(first, last - first + 1));
  }

  const std::shared_ptr<State> state_;
  bool deviceWanted_ = false;
  bool interfaceWanted_ = false;
  sd_bus* bus_ = nullptr;
  bool claimed_ = false;
  std::optional<SteadyClock::time_point> retryAt_;
  std::chrono::milliseconds backoff_{0};
  int inotifyFd_ = -1;
};

void add(const std::shared_ptr<LinuxOrientation::State>& state,
         LinuxOrientation::State::Handlers LinuxOrientation::State::*which,
         std::string_view identifier, OrientationNotifier::Handler handler) {
  {
    MutexLock lock(state->mutex);
    ((*state).*which)[std::string(identifier)] =
        std::make_shared<OrientationNotifier::Handler>(std::move(handler));
    if (state->running) return state->wake();
    state->running = true;
  }
  startThread("vx-orientation", [state] { Watcher(state).run(); }).detach();
}

void remove(LinuxOrientation::State& state,
            LinuxOrientation::State::Handlers LinuxOrientation::State::*which,
            std::string_view identifier) {
  std::shared_ptr<OrientationNotifier::Handler> removed;  // destroyed after the lock
  MutexLock lock(state.mutex);
  auto& handlers = state.*which;
  const auto found = handlers.find(identifier);
  if (found == handlers.end()) return;
  removed = std::move(found->second);
  handlers.erase(found);
  state.wake();
}

}  // namespace

LinuxOrientation::LinuxOrientation(const OrientationOptions& options)
    : state_(std::make_shared<State>(options)) {}

LinuxOrientation::~LinuxOrientation() {
  State::Handlers device;
  State::Handlers interface;
  MutexLock lock(state_->mutex);
  state_->ending = true;
  device.swap(state_->device);
  interface.swap(state_->interface);
  state_->wake();
}

void LinuxOrientation::registerDeviceOrientationHandler(std::string_view identifier,
                                                        Handler handler) {
  if (!state_->options.deviceSensor) return;
  add(state_, &State::device, identifier, std::move(handler));
}

void LinuxOrientation::registerInterfaceOrientationHandler(std::string_view identifier,
                                                           Handler handler) {
  if (state_->options.interfaceStateFile.empty()) return;
  add(state_, &State::interface, identifier, std::move(handler));
}

void LinuxOrientation::unregisterDeviceOrientationHandler(std::string_view identifier) {
  remove(*state_, &State::device, identifier);
}

void LinuxOrientation::unregisterInterfaceOrientationHandler(std::string_view identifier) {
  remove(*state_, &State::interface, identifier);
}

std::string LinuxOrientation::orientationText(int64_t orientation) {
  MutexLock lock(state_->mutex);
  const auto index = static_cast<std::size_t>(orientation);
  return index < state_->words.size() ? state_->words[index] : "unknown";
}

}  // namespace vx::lnx
