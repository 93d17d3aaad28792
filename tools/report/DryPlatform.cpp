#include "tools/report/DryPlatform.h"

#include <deque>

namespace vx::report {

namespace {

class Queue final : public WorkQueue {
 public:
  explicit Queue(std::deque<Work>& waiting) : waiting_(waiting) {}
  void async(Work work, std::size_t) override { waiting_.push_back(std::move(work)); }
  void asyncAfter(std::chrono::nanoseconds, Work work) override {
    waiting_.push_back(std::move(work));
  }
  bool isCurrent() const override { return true; }
  std::string_view label() const override { return "dry"; }

 private:
  std::deque<Work>& waiting_;
};

class Queues final : public WorkQueues {
 public:
  std::shared_ptr<WorkQueue> makeSerial(std::string_view, QualityOfService) override {
    return std::make_shared<Queue>(waiting);
  }
  WorkQueue& background() override { return background_; }
  void beginBlocking() override {}
  void endBlocking() override {}
  std::deque<Work> waiting;

 private:
  Queue background_{waiting};
};

// What comes at all has come before it is waited for.
class NoCondition final : public Condition {
 public:
  void lock() override {}
  void unlock() override {}
  bool waitUntil(Monotonic) override { return false; }
  void signal() override {}
};

class NoThreads final : public Threading {
 public:
  std::unique_ptr<Condition> makeCondition() override { return std::make_unique<NoCondition>(); }
  std::shared_ptr<OneShotTimer> makeTimer(std::chrono::nanoseconds, Function<void()>) override {
    return nullptr;
  }
  std::unique_ptr<RunLoop> makeRunLoop() override { return nullptr; }
  std::unique_ptr<Thread> startThread(std::string_view, Function<void()>) override {
    return nullptr;
  }
  void sleepFor(std::chrono::nanoseconds) override {}
  void memoryWasFreed(std::size_t) override {}
};

class SystemClock final : public Clock {
 public:
  Date now() override { return std::chrono::system_clock::now(); }
  Monotonic monotonic() override { return std::chrono::steady_clock::now(); }
  std::string formatLocal(Date, const char*) override { return {}; }
};

class Heap final : public AggregateMemory {
 public:
  uint64_t nameAggregate() override { return 0; }
  Block acquire(uint64_t, uint32_t, std::size_t bytes) override {
    blocks_.push_back(std::make_unique<uint8_t[]>(bytes));
    return {blocks_.back().get(), bytes, false};
  }
  void release(std::span<const Block>) override {}
  std::vector<Block> find(uint64_t, std::size_t) override { return {}; }
  void snapshotBegan() override {}
  void snapshotCompleted() override {}

 private:
  std::vector<std::unique_ptr<uint8_t[]>> blocks_;
};

class RelaySession final : public VyrReportingSession {
 public:
  explicit RelaySession(DryOutcome& outcome) : outcome_(outcome) {}
  std::string description() const override { return "dry"; }
  void startConfigurationWithCompletionHandler(
      Function<void(std::optional<BackendList>)> handler) override {
    handler(BackendList{"store"});
  }
  bool sendMessageWithCategory(uint16_t category, uint16_t type, const Payload& payload,
                               std::optional<Error>&) override {
    outcome_.relayed.push_back({category, type, payload});
    return true;
  }
  void flushMessagesWithCompletion(Function<void(std::optional<Error>)> handler) override {
    handler(std::nullopt);
  }

 private:
  DryOutcome& outcome_;
};

// Where messages go: it keeps them.
class Sinks final : public VyrReporting,
                    public AnalyticsEventService,
                    public PowerEventLog,
                    public ScopedLog {
 public:
  std::shared_ptr<const VyrSecureHierarchyToken> newSecureHierarchyTokenFromParentToken(
      const VyrSecureHierarchyToken*) override {
    return nullptr;
  }
  std::shared_ptr<VyrReportingSession> initWithSessionInfo(
      const VyrSessionInfo&, const Payload&, const std::vector<std::string>&) override {
    return std::make_shared<RelaySession>(outcome);
  }
  bool sendOneMessageWithSessionInfo(const VyrSessionInfo&, const Payload&, uint16_t category,
                                     uint16_t type, const Payload& payload,
                                     std::optional<Error>&) override {
    outcome.relayed.push_back({category, type, payload});
    return true;
  }
  void sendEventLazy(std::string_view name, Function<Payload()> builder, const Payload&,
                     std::size_t) override {
    outcome.events.emplace_back(name, builder());
  }
  void logRegisteredEvent(int64_t, std::string_view name, const Payload& record,
                          const Payload*) override {
    outcome.powerRecords.emplace_back(name, record);
  }
  const LogScope* registerScope(bool, uint32_t, std::string_view, std::string_view,
                                std::string_view, uint32_t) override {
    return nullptr;
  }
  bool isLogEnabled(int, const LogScope*) override { return false; }
  bool wantsLine(const LogScope*, LogLevel, const LogSite&) override { return true; }
  void write(const LogScope*, LogLevel, const LogSite&, std::string_view text,
             std::size_t prefixLength) override {
    outcome.lines.emplace_back(text.substr(prefixLength));
  }
  DryOutcome outcome;
};

// What a session of this build does not ask, or gets no answer from.
class Nothing final : public ServiceListener,
                      public ProcessInfoQuery,
                      public ProcessControl,
                      public RandomSource,
                      public Preferences,
                      public SystemNotify,
                      public ChannelReportService,
                      public DevicePropertyQuery,
                      public OrientationNotifier,
                      public TracePoint,
                      public DiagnosticFiles,
                      public RecordedInputs {
 public:
  void setDelegate(std::weak_ptr<ServiceListenerDelegate>) override {}
  void resume() override {}
  int32_t ownProcessIdentifier() override { return 0; }
  std::string ownProcessName() override { return {}; }
  std::optional<std::string> shortCommandName(int32_t) override { return {}; }
  void exit(int) override {}
  uint32_t below(uint32_t) override { return 0; }
  std::unique_ptr<PreferencesDomain> open(std::string_view) override { return nullptr; }
  uint32_t registerHandler(std::string_view, int&, std::shared_ptr<WorkQueue>,
                           Function<void(int)>) override {
    return kStatusOk;
  }
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
  bool boolean(std::string_view) override { return false; }
  int32_t integer(std::string_view, int32_t defaultValue) override { return defaultValue; }
  void registerDeviceOrientationHandler(std::string_view, const void*, Handler) override {}
  void registerInterfaceOrientationHandler(std::string_view, const void*, Handler) override {}
  void unregisterDeviceOrientationHandler(std::string_view, const void*) override {}
  void unregisterInterfaceOrientationHandler(std::string_view, const void*) override {}
  std::string orientationText(int64_t) override { return {}; }
  void emit(uint32_t, uint64_t, uint64_t, uint64_t, uint64_t) override {}
  std::string logsDirectory() override { return {}; }
  std::optional<Error> createDirectory(const std::string&, unsigned) override { return {}; }
  std::unique_ptr<AtomicFile> createAtomically(const std::string&, const std::string&,
                                               std::optional<Error>&) override {
    return nullptr;
  }
  std::optional<Payload> once(std::string_view,
                              const Function<std::optional<Payload>()>& source) override {
    return source();
  }
};

}  // namespace

struct DryPlatform::Parts {
  Queues queues;
  NoThreads threads;
  SystemClock clock;
  Heap heap;
  Sinks sinks;
  Nothing nothing;
  Platform platform{.serviceListener = nothing,
                    .workQueues = queues,
                    .clock = clock,
                    .threading = threads,
                    .processInfo = nothing,
                    .processControl = nothing,
                    .random = nothing,
                    .preferences = nothing,
                    .systemNotify = nothing,
                    .vyrReporting = sinks,
                    .analytics = sinks,
                    .powerLog = sinks,
                    .channelReports = nothing,
                    .deviceProperties = nothing,
                    .orientation = nothing,
                    .log = sinks,
                    .trace = nothing,
                    .diagnosticFiles = nothing,
                    .inputs = nothing,
                    .aggregates = heap};
};

DryPlatform::DryPlatform() : parts_(std::make_unique<Parts>()) {
  installPlatform(&parts_->platform);
}
DryPlatform::~DryPlatform() { installPlatform(nullptr); }

DryOutcome DryPlatform::take() {
  std::deque<Work>& waiting = parts_->queues.waiting;
  while (!waiting.empty()) {
    const Work work = std::move(waiting.front());
    waiting.pop_front();
    work();
  }
  return std::exchange(parts_->sinks.outcome, {});
}

}  // namespace vx::report
