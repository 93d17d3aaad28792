#include "tests/fakes/FakePlatform.h"

#include <algorithm>

namespace vx::fakes {

namespace {

class FakeQueue final : public WorkQueue {
 public:
  FakeQueue(FakeWorkQueues& owner, std::string_view label) : owner_(owner), label_(label) {}
  void async(Work work) override {
    owner_.post(label_, std::chrono::nanoseconds(0), this, std::move(work));
  }
  void asyncAfter(std::chrono::nanoseconds delay, Work work) override {
    owner_.post(label_, delay, this, std::move(work));
  }
  bool isCurrent() const override { return owner_.current == this; }
  std::string_view label() const override { return label_; }

 private:
  FakeWorkQueues& owner_;
  const std::string_view label_;
};

struct FakeToken final : VyrSecureHierarchyToken {};
class FakeThread final : public Thread {};

}  // namespace

std::shared_ptr<WorkQueue> FakeWorkQueues::makeSerial(std::string_view label,
                                                      QualityOfService quality) {
  made.emplace_back(label, quality);
  return std::make_shared<FakeQueue>(*this, label);
}

WorkQueue& FakeWorkQueues::background() {
  if (background_ == nullptr) background_ = std::make_shared<FakeQueue>(*this, "background");
  return *background_;
}

void FakeWorkQueues::post(std::string_view label, std::chrono::nanoseconds delay,
                          const WorkQueue* queue, Work work) {
  items_.push_back({clock_.steady + delay, std::string(label), queue, std::move(work)});
}

bool FakeWorkQueues::runOne(std::string_view skip) {
  const auto due = std::find_if(items_.begin(), items_.end(), [&](const Item& item) {
    return item.due <= clock_.steady && item.label != skip;
  });
  if (due == items_.end()) return false;
  Item item = std::move(*due);
  items_.erase(due);
  const WorkQueue* outer = std::exchange(current, item.queue);
  item.work();
  current = outer;
  return true;
}

void FakeWorkQueues::runAll(std::string_view skip) {
  while (runOne(skip)) {
  }
}

std::optional<Monotonic> FakeWorkQueues::nextDue() const {
  std::optional<Monotonic> next;
  for (const Item& item : items_) {
    if (!next || item.due < *next) next = item.due;
  }
  return next;
}

void FakeWorkQueues::advance(std::chrono::nanoseconds by) {
  const Monotonic end = clock_.steady + by;
  runAll();
  for (auto next = nextDue(); next && *next <= end; next = nextDue()) {
    clock_.advance(*next - clock_.steady);
    runAll();
  }
  clock_.advance(end - clock_.steady);
}

// A wait on the test's one thread: time passes, event by event, until somebody signals.
class FakeCondition final : public Condition {
 public:
  explicit FakeCondition(FakeThreading& threading) : threading_(threading) {}
  void lock() override {}
  void unlock() override {}
  void signal() override { ++signals_; }
  bool waitUntil(Monotonic deadline) override {
    const int before = signals_;
    for (;;) {
      const std::optional<Monotonic> next = threading_.nextEvent();
      if (!next || *next > deadline) break;
      threading_.passTimeUntil(*next);
      if (signals_ != before) return true;
    }
    threading_.passTimeUntil(deadline);
    return false;
  }

 private:
  FakeThreading& threading_;
  int signals_ = 0;
};

class FakeTimer final : public OneShotTimer {
 public:
  FakeTimer(Monotonic when, Function<void()> action) : due(when), action_(std::move(action)) {}
  void setFireTime(Monotonic when) override { due = when; }
  void invalidate() override { valid = false; }
  void fire() {
    valid = false;
    action_();
  }
  Monotonic due;
  bool valid = true;

 private:
  Function<void()> action_;
};

class FakeRunLoop final : public RunLoop {
 public:
  FakeRunLoop(FakeThreading& threading, FakeClock& clock) : threading_(threading), clock_(clock) {}
  void attach(std::shared_ptr<OneShotTimer> timer) override {
    timers_.push_back(std::static_pointer_cast<FakeTimer>(std::move(timer)));
  }
  void runUntilEmpty() override {
    for (;;) {
      std::erase_if(timers_, [](const auto& timer) { return !timer->valid; });
      if (timers_.empty()) return;
      const auto first =
          std::min_element(timers_.begin(), timers_.end(),
                           [](const auto& a, const auto& b) { return a->due < b->due; });
      const std::optional<Monotonic> event = threading_.nextEvent();
      if ((*first)->due > clock_.steady) {  // an event on the way may move timers
        threading_.passTimeUntil(event && *event < (*first)->due ? *event : (*first)->due);
        continue;
      }
      const auto timer = *first;
      timers_.erase(first);
      timer->fire();
    }
  }

 private:
  FakeThreading& threading_;
  FakeClock& clock_;
  std::vector<std::shared_ptr<FakeTimer>> timers_;
};

std::unique_ptr<Condition> FakeThreading::makeCondition() {
  return std::make_unique<FakeCondition>(*this);
}

std::shared_ptr<OneShotTimer> FakeThreading::makeTimer(std::chrono::nanoseconds delay,
                                                       Function<void()> action) {
  return std::make_shared<FakeTimer>(clock_.steady + delay, std::move(action));
}

std::unique_ptr<RunLoop> FakeThreading::makeRunLoop() {
  return std::make_unique<FakeRunLoop>(*this, clock_);
}

std::unique_ptr<Thread> FakeThreading::startThread(std::string_view, Function<void()> body) {
  threadBody = std::move(body);
  return std::make_unique<FakeThread>();
}

void FakeThreading::sleepFor(std::chrono::nanoseconds duration) {
  sleeps.push_back(duration);
  if (onSleep) onSleep();
  passTimeUntil(clock_.steady + duration);
}

void FakeThreading::at(std::chrono::nanoseconds fromNow, std::function<void()> event) {
  events_.emplace(clock_.steady + fromNow, std::move(event));
}

std::optional<Monotonic> FakeThreading::nextEvent() const {
  if (events_.empty()) return std::nullopt;
  return events_.begin()->first;
}

void FakeThreading::passTimeUntil(Monotonic when) {
  while (!events_.empty() && events_.begin()->first <= when) {
    const auto first = events_.begin();
    if (first->first > clock_.steady) clock_.advance(first->first - clock_.steady);
    const std::function<void()> event = std::move(first->second);
    events_.erase(first);
    event();
  }
  if (when > clock_.steady) clock_.advance(when - clock_.steady);
}

const LogScope* FakeLog::registerScope(bool enabled, uint32_t code, std::string_view name,
                                       std::string_view domain, std::string_view verboseKey,
                                       uint32_t level) {
  registrations.push_back(std::string(name) + " " + std::to_string(code) + " " +
                          std::string(domain) + " " + std::string(verboseKey) + " " +
                          std::to_string(level) + (enabled ? "" : " off"));
  if (refuseScopes) return nullptr;
  FakeScope& scope = scopes_.emplace_back();
  scope.name = name;
  scope.verboseKey = verboseKey;
  return &scope;
}

void FakeLog::write(const LogScope* scope, LogLevel level, const LogSite& site,
                    std::string_view text, std::size_t prefixLength) {
  static constexpr const char* kLevels[] = {"default", "info", "debug", "error"};
  std::string line = scope != nullptr ? static_cast<const FakeScope*>(scope)->name : "system";
  line += std::string(" ") + kLevels[static_cast<int>(level)] + " " +
          std::string(text.substr(prefixLength));
  lines.push_back(line);
  functions.push_back(site.function);
  journal_.push_back("log " + line);
}

void FakeRelaySession::startConfigurationWithCompletionHandler(
    Function<void(std::optional<BackendList>)> handler) {
  if (!service_.configurationAfter) return;
  auto shared = std::make_shared<Function<void(std::optional<BackendList>)>>(std::move(handler));
  service_.threading_.at(*service_.configurationAfter,
                         [shared, backends = service_.backends] { (*shared)(backends); });
}

bool FakeRelaySession::sendMessageWithCategory(uint16_t category, uint16_t type,
                                               const Payload& payload,
                                               std::optional<Error>& error) {
  service_.journal_.push_back("relay " + std::to_string(category) + " " + std::to_string(type));
  if (service_.sendError) {
    error = service_.sendError;
    return false;
  }
  service_.sent.push_back({category, type, payload});
  return true;
}

void FakeRelaySession::flushMessagesWithCompletion(Function<void(std::optional<Error>)> handler) {
  service_.journal_.push_back("flush");
  handler(service_.flushError);
}

std::shared_ptr<const VyrSecureHierarchyToken>
FakeVyrReporting::newSecureHierarchyTokenFromParentToken(const VyrSecureHierarchyToken*) {
  ++tokens;
  return std::make_shared<FakeToken>();
}

std::shared_ptr<VyrReportingSession> FakeVyrReporting::initWithSessionInfo(
    const VyrSessionInfo& sessionInfo, const Payload& userInfo, const std::vector<std::string>&) {
  journal_.push_back("relay session");
  return sessions.emplace_back(std::make_shared<FakeRelaySession>(*this, sessionInfo, userInfo));
}

bool FakeVyrReporting::sendOneMessageWithSessionInfo(const VyrSessionInfo& sessionInfo,
                                                     const Payload& userInfo, uint16_t category,
                                                     uint16_t type, const Payload& payload,
                                                     std::optional<Error>& error) {
  journal_.push_back("one-off " + std::to_string(category) + " " + std::to_string(type));
  if (sendError) {
    error = sendError;
    return false;
  }
  oneOffs.push_back({sessionInfo, userInfo, category, type, payload});
  return true;
}

void FakeServices::sendEventLazy(std::string_view name, Function<Payload()> builder,
                                 const Payload&) {
  journal_.push_back("event " + std::string(name));
  events.push_back({std::string(name), std::make_shared<Function<Payload()>>(std::move(builder))});
}

void FakeServices::logRegisteredEvent(int64_t client, std::string_view name, const Payload& record,
                                      const Payload*) {
  journal_.push_back("power " + std::string(name));
  powers.push_back({client, std::string(name), record});
}

void FakeServices::emit(uint32_t code, uint64_t, uint64_t, uint64_t, uint64_t) {
  char text[24];
  std::snprintf(text, sizeof text, "trace 0x%08X", code);
  journal_.push_back(text);
  traces.push_back(code);
}

std::optional<std::string> FakeServices::shortCommandName(int32_t pid) {
  const auto found = processNames.find(pid);
  return found != processNames.end() ? std::optional(found->second) : std::nullopt;
}

bool FakeServices::boolean(std::string_view name) {
  ++internalBuildQuestions;
  return name == "InternalBuild" && internalBuild;
}

int32_t FakeServices::integer(std::string_view name, int32_t defaultValue) {
  return name == "DeviceClassNumber" ? deviceClass : defaultValue;
}

std::unique_ptr<PreferencesDomain> FakeServices::open(std::string_view) {
  class Domain final : public PreferencesDomain {
   public:
    explicit Domain(std::map<std::string, std::string> held) : held_(std::move(held)) {}
    bool hasObject(std::string_view key) const override { return held_.contains(std::string(key)); }
    std::optional<std::string> string(std::string_view key) const override {
      const auto found = held_.find(std::string(key));
      if (found == held_.end() || found->second == "<table>") return std::nullopt;
      return found->second;
    }
    bool boolean(std::string_view key) const override { return string(key) == "true"; }

   private:
    const std::map<std::string, std::string> held_;
  };
  ++preferenceReads;
  return std::make_unique<Domain>(preferences);
}

uint32_t FakeServices::registerHandler(std::string_view name, int& token,
                                       std::shared_ptr<WorkQueue> queue,
                                       Function<void(int)> handler) {
  journal_.push_back("notify " + std::string(name));
  token = kToken;
  notifyQueue = std::move(queue);
  notifyHandler = std::make_shared<Function<void(int)>>(std::move(handler));
  return notifyStatus;
}

void FakeServices::registerDeviceOrientationHandler(std::string_view identifier, Handler handler) {
  journal_.push_back("register device " + std::string(identifier));
  deviceHandlers[std::string(identifier)] = std::make_shared<Handler>(std::move(handler));
}

void FakeServices::registerInterfaceOrientationHandler(std::string_view identifier,
                                                       Handler handler) {
  journal_.push_back("register interface " + std::string(identifier));
  interfaceHandlers[std::string(identifier)] = std::make_shared<Handler>(std::move(handler));
}

void FakeServices::unregisterDeviceOrientationHandler(std::string_view identifier) {
  journal_.push_back("unregister device " + std::string(identifier));
  deviceHandlers.erase(std::string(identifier));
}

void FakeServices::unregisterInterfaceOrientationHandler(std::string_view identifier) {
  journal_.push_back("unregister interface " + std::string(identifier));
  interfaceHandlers.erase(std::string(identifier));
}

std::optional<Error> FakeServices::createDirectory(const std::string& path, unsigned mode) {
  char text[160];
  std::snprintf(text, sizeof text, "mkdir %s %o", path.c_str(), mode);
  journal_.push_back(text);
  return directoryError;
}

std::unique_ptr<AtomicFile> FakeServices::createAtomically(const std::string& directory,
                                                           const std::string& name,
                                                           std::optional<Error>& error) {
  class File final : public AtomicFile {
   public:
    File(FakeServices& owner, std::string path) : owner_(owner), path_(std::move(path)) {}
    std::optional<Error> take(std::string& text) override {
      content_ += text;
      text.clear();
      return std::exchange(owner_.writeError, std::nullopt);
    }
    std::optional<Error> commit() override {
      owner_.journal_.push_back("file " + path_);
      owner_.files[path_] = content_;
      return std::nullopt;
    }

   private:
    FakeServices& owner_;
    const std::string path_;
    std::string content_;
  };
  if (fileError) {
    error = fileError;
    return nullptr;
  }
  return std::make_unique<File>(*this, directory + "/" + name);
}

FakePlatform::FakePlatform(ChannelReportService& channels)
    : platform_{.serviceListener = listener,
                .workQueues = queues,
                .clock = clock,
                .threading = threading,
                .processInfo = services,
                .processControl = services,
                .random = services,
                .preferences = services,
                .systemNotify = services,
                .vyrReporting = vyr,
                .analytics = services,
                .powerLog = services,
                .channelReports = channels,
                .deviceProperties = services,
                .orientation = services,
                .log = log,
                .trace = services,
                .diagnosticFiles = services} {
  installPlatform(&platform_);
}

FakePlatform::~FakePlatform() { installPlatform(nullptr); }

}  // namespace vx::fakes
