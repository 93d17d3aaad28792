#include "platform/linux/recovery/ReplayPlatform.h"

#include <algorithm>
#include <map>
#include <utility>

#include "platform/linux/execution/CauseScope.h"

namespace vx::lnx {

namespace {

// Of the call that the thread works for; none for what the service does for its own sake.
const JournalTicket* currentCall() { return CauseScope::current(); }

// What the call writes is where it belongs. A place is taken all the same, so that what the call
// causes besides keeps its own.
bool isWritten() {
  const JournalTicket* const call = currentCall();
  if (call == nullptr || !call->wasDone()) return false;
  (void)Cause::take();
  return true;
}

// ---------------------------------------------------------------------------------------------------------------------
// Time and waiting

class RecordedClock final : public Clock {
 public:
  explicit RecordedClock(Clock& live) : live_(live) {}
  Date now() override {
    const JournalTicket* const call = currentCall();
    if (call == nullptr) return live_.now();
    // To the microsecond: that much of a second such a number has.
    return Date(
        std::chrono::round<std::chrono::microseconds>(std::chrono::duration<double>(call->time())));
  }
  Monotonic monotonic() override { return live_.monotonic(); }
  std::string formatLocal(Date date, const char* format) override {
    return live_.formatLocal(date, format);
  }

 private:
  Clock& live_;
};

// What is not there at once never comes.
class PassedCondition final : public Condition {
 public:
  void lock() override {}
  void unlock() override {}
  bool waitUntil(Monotonic) override { return false; }
  void signal() override {}
};

class WaitlessThreading final : public Threading {
 public:
  explicit WaitlessThreading(Threading& live) : live_(live) {}
  std::unique_ptr<Condition> makeCondition() override {
    return std::make_unique<PassedCondition>();
  }
  std::shared_ptr<OneShotTimer> makeTimer(std::chrono::nanoseconds delay,
                                          Function<void()> action) override {
    return live_.makeTimer(delay, std::move(action));
  }
  std::unique_ptr<RunLoop> makeRunLoop() override { return live_.makeRunLoop(); }
  std::unique_ptr<Thread> startThread(std::string_view name, Function<void()> body) override {
    return live_.startThread(name, std::move(body));
  }
  void sleepFor(std::chrono::nanoseconds) override {}
  void memoryWasFreed(std::size_t approximateBytes) override {
    live_.memoryWasFreed(approximateBytes);
  }

 private:
  Threading& live_;
};

// The background queue. A delay began when its call was accepted: what is left of it is waited for.
class RestOfDelays final : public WorkQueue {
 public:
  RestOfDelays(WorkQueue& live, Clock& clock) : live_(live), clock_(clock) {}
  void async(Work work, std::size_t) override { asyncAfter({}, std::move(work)); }
  void asyncAfter(std::chrono::nanoseconds delay, Work work) override {
    const JournalTicket* const call = currentCall();
    if (isWritten()) return;
    if (call != nullptr) {
      const std::chrono::duration<double> passed =
          clock_.now().time_since_epoch() - std::chrono::duration<double>(call->time());
      // Not longer either, where the clock was set back.
      if (passed.count() > 0)
        delay -= std::min(delay, std::chrono::duration_cast<std::chrono::nanoseconds>(passed));
    }
    live_.asyncAfter(delay, std::move(work));
  }
  bool isCurrent() const override { return live_.isCurrent(); }
  std::string_view label() const override { return live_.label(); }

 private:
  WorkQueue& live_;
  Clock& clock_;
};

class ReplayQueues final : public WorkQueues {
 public:
  ReplayQueues(WorkQueues& live, Clock& clock)
      : live_(live), background_(live.background(), clock) {}
  // All work is done by the thread that replays, in one order.
  std::shared_ptr<WorkQueue> makeSerial(std::string_view label, QualityOfService) override {
    return live_.makeSerial(label, QualityOfService::UserInteractive);
  }
  WorkQueue& background() override { return background_; }
  std::unique_ptr<WorkCause> takeCause(std::size_t holds) override {
    if (isWritten()) return nullptr;
    return live_.takeCause(holds);
  }
  void withoutCause(const Work& work) override { live_.withoutCause(work); }
  void beginBlocking() override { live_.beginBlocking(); }
  void endBlocking() override { live_.endBlocking(); }

 private:
  WorkQueues& live_;
  RestOfDelays background_;
};

// ---------------------------------------------------------------------------------------------------------------------
// What calls write

class ReplaySession final : public VyrReportingSession {
 public:
  ReplaySession(std::shared_ptr<VyrReportingSession> live, const BackendList& backends)
      : live_(std::move(live)), backends_(backends) {}
  std::string description() const override { return live_->description(); }
  void startConfigurationWithCompletionHandler(
      Function<void(std::optional<BackendList>)> handler) override {
    handler(backends_.empty() ? std::nullopt : std::optional<BackendList>(backends_));
  }
  bool sendMessageWithCategory(uint16_t category, uint16_t type, const Payload& payload,
                               std::optional<Error>& error) override {
    return isWritten() || live_->sendMessageWithCategory(category, type, payload, error);
  }
  void flushMessagesWithCompletion(Function<void(std::optional<Error>)> handler) override {
    if (!isWritten()) return live_->flushMessagesWithCompletion(std::move(handler));
    if (handler) handler(std::nullopt);
  }

 private:
  const std::shared_ptr<VyrReportingSession> live_;
  const BackendList backends_;
};

class ReplayRelay final : public VyrReporting {
 public:
  ReplayRelay(VyrReporting& live, std::vector<std::string> backends)
      : live_(live), backends_(std::move(backends)) {}
  std::shared_ptr<const VyrSecureHierarchyToken> newSecureHierarchyTokenFromParentToken(
      const VyrSecureHierarchyToken* parent) override {
    return live_.newSecureHierarchyTokenFromParentToken(parent);
  }
  // Of a call that was done too: the session's later messages belong to it.
  std::shared_ptr<VyrReportingSession> initWithSessionInfo(
      const VyrSessionInfo& sessionInfo, const Payload& userInfo,
      const std::vector<std::string>& frameworksToCheck) override {
    return std::make_shared<ReplaySession>(
        live_.initWithSessionInfo(sessionInfo, userInfo, frameworksToCheck), backends_);
  }
  bool sendOneMessageWithSessionInfo(const VyrSessionInfo& sessionInfo, const Payload& userInfo,
                                     uint16_t category, uint16_t type, const Payload& payload,
                                     std::optional<Error>& error) override {
    return live_.sendOneMessageWithSessionInfo(sessionInfo, userInfo, category, type, payload,
                                               error);
  }

 private:
  VyrReporting& live_;
  const std::vector<std::string> backends_;
};

class UnwrittenEvents final : public AnalyticsEventService, public PowerEventLog {
 public:
  UnwrittenEvents(AnalyticsEventService& analytics, PowerEventLog& power)
      : analytics_(analytics), power_(power) {}
  void sendEventLazy(std::string_view name, Function<Payload()> builder, const Payload& message,
                     std::size_t holds) override {
    if (!isWritten()) analytics_.sendEventLazy(name, std::move(builder), message, holds);
  }
  void logRegisteredEvent(int64_t clientIdentifier, std::string_view eventName,
                          const Payload& record, const Payload* options) override {
    if (!isWritten()) power_.logRegisteredEvent(clientIdentifier, eventName, record, options);
  }

 private:
  AnalyticsEventService& analytics_;
  PowerEventLog& power_;
};

class UnwrittenFiles final : public DiagnosticFiles {
 public:
  explicit UnwrittenFiles(DiagnosticFiles& live) : live_(live) {}
  std::string logsDirectory() override { return live_.logsDirectory(); }
  std::optional<Error> createDirectory(const std::string& path, unsigned mode) override {
    return live_.createDirectory(path, mode);
  }
  std::unique_ptr<AtomicFile> createAtomically(const std::string& directory,
                                               const std::string& name,
                                               std::optional<Error>& error) override {
    const JournalTicket* const call = currentCall();
    if (call != nullptr && call->wasDone()) return nullptr;
    return live_.createAtomically(directory, name, error);
  }

 private:
  DiagnosticFiles& live_;
};

// Most of what there is to say was said when it happened.
class ErrorsOfUndone final : public ScopedLog {
 public:
  explicit ErrorsOfUndone(ScopedLog& live) : live_(live) {}
  const LogScope* registerScope(bool enabled, uint32_t code, std::string_view name,
                                std::string_view domain, std::string_view verboseKey,
                                uint32_t level) override {
    return live_.registerScope(enabled, code, name, domain, verboseKey, level);
  }
  bool isLogEnabled(int, const LogScope*) override { return false; }
  bool wantsLine(const LogScope* scope, LogLevel level, const LogSite& site) override {
    const JournalTicket* const call = currentCall();
    if (call != nullptr && (level != LogLevel::Error || call->wasDone())) return false;
    return live_.wantsLine(scope, level, site);
  }
  void write(const LogScope* scope, LogLevel level, const LogSite& site, std::string_view text,
             std::size_t prefixLength) override {
    live_.write(scope, level, site, text, prefixLength);
  }

 private:
  ScopedLog& live_;
};

// ---------------------------------------------------------------------------------------------------------------------
// What is not asked, watched or told

class NoChannels final : public ChannelReportService {
 public:
  ChannelDictionaryRef copyChannelsInGroup(const std::optional<std::string>&,
                                           const std::optional<std::string>&, uint64_t,
                                           std::optional<Error>&) override {
    return nullptr;
  }
  int32_t channelCount(const ChannelDictionary&) override { return 0; }
  ChannelSubscription* createSubscription(const ChannelDictionaryRef&,
                                          ChannelDictionaryRef&) override {
    return nullptr;
  }
  ChannelDictionaryRef createSamples(ChannelSubscription*, const ChannelDictionaryRef&,
                                     std::optional<Error>&) override {
    return nullptr;
  }
  ChannelDictionaryRef createSamplesDelta(const ChannelDictionaryRef&, const ChannelDictionaryRef&,
                                          std::optional<Error>&) override {
    return nullptr;
  }
  ChannelDictionaryRef copyDictionary(const ChannelDictionaryRef&) override { return nullptr; }
  void iterateSamples(const ChannelDictionary&,
                      const Function<int(const ChannelSample&)>&) override {}
  std::optional<std::string_view> channelName(const ChannelSample&) override { return {}; }
  int64_t simpleIntegerValue(const ChannelSample&, int) override { return 0; }
};

class NoOrientation final : public OrientationNotifier {
 public:
  explicit NoOrientation(OrientationNotifier& live) : live_(live) {}
  void registerDeviceOrientationHandler(std::string_view, const void*, Handler) override {}
  void registerInterfaceOrientationHandler(std::string_view, const void*, Handler) override {}
  void unregisterDeviceOrientationHandler(std::string_view, const void*) override {}
  void unregisterInterfaceOrientationHandler(std::string_view, const void*) override {}
  std::string orientationText(int64_t orientation) override {
    return live_.orientationText(orientation);
  }

 private:
  OrientationNotifier& live_;
};

class NoProcessControl final : public ProcessControl {
 public:
  void exit(int) override {}
};

class NoTrace final : public TracePoint {
 public:
  void emit(uint32_t, uint64_t, uint64_t, uint64_t, uint64_t) override {}
};

class RecordedNotify final : public SystemNotify {
 public:
  uint32_t registerHandler(std::string_view name, int& token, std::shared_ptr<WorkQueue> queue,
                           Function<void(int token)> handler) override {
    token = static_cast<int>(registered_.size());
    registered_.insert_or_assign(
        std::string(name),
        Registered{token, std::move(queue),
                   std::make_shared<const Function<void(int)>>(std::move(handler))});
    return kStatusOk;
  }
  void fire(std::string_view name) {
    const auto found = registered_.find(name);
    if (found == registered_.end()) return;
    const Registered& to = found->second;
    to.queue->async([handler = to.handler, token = to.token] { (*handler)(token); });
  }

 private:
  struct Registered {
    int token;
    std::shared_ptr<WorkQueue> queue;
    std::shared_ptr<const Function<void(int)>> handler;
  };
  std::map<std::string, Registered, std::less<>> registered_;
};

}  // namespace

struct ReplayPlatform::Parts {
  Parts(Platform& live, std::vector<std::string> backends, RecordedInputs& inputs)
      : queues(live.workQueues, live.clock),
        clock(live.clock),
        threading(live.threading),
        relay(live.vyrReporting, std::move(backends)),
        events(live.analytics, live.powerLog),
        orientation(live.orientation),
        log(live.log),
        files(live.diagnosticFiles),
        services{.serviceListener = live.serviceListener,
                 .workQueues = queues,
                 .clock = clock,
                 .threading = threading,
                 .processInfo = live.processInfo,
                 .processControl = processControl,
                 .random = live.random,
                 .preferences = live.preferences,
                 .systemNotify = notify,
                 .vyrReporting = relay,
                 .analytics = events,
                 .powerLog = events,
                 .channelReports = channels,
                 .deviceProperties = live.deviceProperties,
                 .orientation = orientation,
                 .log = log,
                 .trace = trace,
                 .diagnosticFiles = files,
                 .inputs = inputs,
                 .aggregates = live.aggregates} {}
  ReplayQueues queues;
  RecordedClock clock;
  WaitlessThreading threading;
  NoProcessControl processControl;
  RecordedNotify notify;
  ReplayRelay relay;
  UnwrittenEvents events;
  NoChannels channels;
  NoOrientation orientation;
  ErrorsOfUndone log;
  NoTrace trace;
  UnwrittenFiles files;
  Platform services;
};

ReplayPlatform::ReplayPlatform(Platform& live, std::vector<std::string> backends,
                               RecordedInputs& inputs)
    : parts_(std::make_unique<Parts>(live, std::move(backends), inputs)) {}
ReplayPlatform::~ReplayPlatform() = default;

Platform& ReplayPlatform::services() { return parts_->services; }
void ReplayPlatform::notify(std::string_view name) { parts_->notify.fire(name); }

}  // namespace vx::lnx
