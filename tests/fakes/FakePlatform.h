// Every platform interface in memory. Tests own time, and queues run only when a test says so.
// Everything that reaches a fake leaves a line in one journal, so that orders of steps can be
// asserted across services.
#pragma once

#include <deque>
#include <functional>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/Platform.h"

namespace vx::fakes {

using Journal = std::vector<std::string>;

class FakeClock final : public Clock {
 public:
  Date now() override { return wall; }
  Monotonic monotonic() override { return steady; }
  std::string formatLocal(Date, const char*) override { return "20261116-061530+0000"; }
  void advance(std::chrono::nanoseconds by) {
    wall += by;
    steady += by;
  }
  Date wall{std::chrono::hours(24 * 365 * 50)};
  Monotonic steady{std::chrono::hours(1)};
};

// Queues of one thread: the test's. Work runs in order of submission, over all queues.
class FakeWorkQueues final : public WorkQueues {
 public:
  explicit FakeWorkQueues(FakeClock& clock) : clock_(clock) {}
  std::shared_ptr<WorkQueue> makeSerial(std::string_view label, QualityOfService quality) override;
  WorkQueue& background() override;
  void beginBlocking() override { ++blockingScopes; }
  void endBlocking() override {}

  // Runs what is due, and what that queues. `skip`: a label whose work stays where it is.
  void runAll(std::string_view skip = "");
  // Runs one due item; false when there is none.
  bool runOne(std::string_view skip = "");
  // Moves time, running what falls due on the way.
  void advance(std::chrono::nanoseconds by);
  std::optional<Monotonic> nextDue() const;
  void post(std::string_view label, std::chrono::nanoseconds delay, const WorkQueue* queue,
            Work work);

  int blockingScopes = 0;
  std::vector<std::pair<std::string, QualityOfService>> made;
  const WorkQueue* current = nullptr;

 private:
  struct Item {
    Monotonic due;
    std::string label;
    const WorkQueue* queue;
    Work work;
  };
  FakeClock& clock_;
  std::deque<Item> items_;
  std::shared_ptr<WorkQueue> background_;
};

// Waits let the other queues' work happen meanwhile. Threads are bodies that the test steps
// through: sleepFor and runUntilEmpty move the fake clock, and a thread's body runs inside
// runThread() until `stop` says so.
class FakeThreading final : public Threading {
 public:
  explicit FakeThreading(FakeClock& clock) : clock_(clock) {}
  std::unique_ptr<Condition> makeCondition() override;
  std::shared_ptr<OneShotTimer> makeTimer(std::chrono::nanoseconds delay,
                                          Function<void()> action) override;
  std::unique_ptr<RunLoop> makeRunLoop() override;
  std::unique_ptr<Thread> startThread(std::string_view name, Function<void()> body) override;
  void sleepFor(std::chrono::nanoseconds duration) override;
  void memoryWasFreed(std::size_t approximateBytes) override { freedBytes += approximateBytes; }

  // Something that happens at a time, seen by sleeps, run loops and waits as they pass it.
  void at(std::chrono::nanoseconds fromNow, std::function<void()> event);
  Function<void()> threadBody;    // of the last thread started
  std::function<void()> onSleep;  // before each sleep of a thread
  std::vector<std::chrono::nanoseconds> sleeps;
  std::size_t freedBytes = 0;
  // Moves time to `when`, running events on the way.
  void passTimeUntil(Monotonic when);
  std::optional<Monotonic> nextEvent() const;

 private:
  friend class FakeCondition;
  FakeClock& clock_;
  std::multimap<Monotonic, std::function<void()>> events_;
};

struct FakeScope final : LogScope {
  std::string name;
  std::string verboseKey;
  bool verbose = false;
};

class FakeLog final : public ScopedLog {
 public:
  explicit FakeLog(Journal& journal) : journal_(journal) {}
  const LogScope* registerScope(bool enabled, uint32_t code, std::string_view name,
                                std::string_view domain, std::string_view verboseKey,
                                uint32_t level) override;
  bool isLogEnabled(int level, const LogScope* scope) override {
    return level < 5 || verbose ||
           (scope != nullptr && static_cast<const FakeScope*>(scope)->verbose);
  }
  bool wantsLine(const LogScope*, LogLevel, const LogSite&) override { return true; }
  void write(const LogScope* scope, LogLevel level, const LogSite& site, std::string_view text,
             std::size_t prefixLength) override;
  // Lines as "scope level text", for example "vxrs default DESTROYING SERVICE".
  std::vector<std::string> lines;
  std::vector<std::string> functions;  // of each line
  std::vector<std::string> registrations;
  bool verbose = false;
  bool refuseScopes = false;

 private:
  Journal& journal_;
  std::deque<FakeScope> scopes_;
};

class FakeRelaySession final : public VyrReportingSession {
 public:
  FakeRelaySession(class FakeVyrReporting& service, VyrSessionInfo sessionInfo,
                   Payload userInformation)
      : info(std::move(sessionInfo)), userInfo(std::move(userInformation)), service_(service) {}
  std::string description() const override { return "<relay>"; }
  void startConfigurationWithCompletionHandler(
      Function<void(std::optional<BackendList>)> handler) override;
  bool sendMessageWithCategory(uint16_t category, uint16_t type, const Payload& payload,
                               std::optional<Error>& error) override;
  void flushMessagesWithCompletion(Function<void(std::optional<Error>)> handler) override;
  const VyrSessionInfo info;
  const Payload userInfo;

 private:
  FakeVyrReporting& service_;
};

class FakeVyrReporting final : public VyrReporting {
 public:
  struct OneOff {
    VyrSessionInfo info;
    Payload userInfo;
    uint16_t category;
    uint16_t type;
    Payload payload;
  };
  struct Sent {
    uint16_t category;
    uint16_t type;
    Payload payload;
  };
  FakeVyrReporting(Journal& journal, FakeThreading& threading)
      : journal_(journal), threading_(threading) {}
  std::shared_ptr<const VyrSecureHierarchyToken> newSecureHierarchyTokenFromParentToken(
      const VyrSecureHierarchyToken* parent) override;
  std::shared_ptr<VyrReportingSession> initWithSessionInfo(
      const VyrSessionInfo& sessionInfo, const Payload& userInfo,
      const std::vector<std::string>& frameworks) override;
  bool sendOneMessageWithSessionInfo(const VyrSessionInfo& sessionInfo, const Payload& userInfo,
                                     uint16_t category, uint16_t type, const Payload& payload,
                                     std::optional<Error>& error) override;

  std::optional<std::chrono::nanoseconds> configurationAfter{0};  // none: never answers
  std::optional<VyrReportingSession::BackendList> backends{{"store"}};
  std::optional<Error> sendError;
  std::optional<Error> flushError;
  std::vector<std::shared_ptr<FakeRelaySession>> sessions;
  std::vector<Sent> sent;
  std::vector<OneOff> oneOffs;
  int tokens = 0;

 private:
  friend class FakeRelaySession;
  Journal& journal_;
  FakeThreading& threading_;
};

// The small ones: analytics, power, trace, process, random, device, preferences, notify,
// orientation, files.
class FakeServices final : public AnalyticsEventService,
                           public PowerEventLog,
                           public TracePoint,
                           public ProcessInfoQuery,
                           public ProcessControl,
                           public RandomSource,
                           public DevicePropertyQuery,
                           public Preferences,
                           public SystemNotify,
                           public OrientationNotifier,
                           public DiagnosticFiles {
 public:
  explicit FakeServices(Journal& journal) : journal_(journal) {}

  struct Event {
    std::string name;
    std::shared_ptr<Function<Payload()>> builder;
  };
  struct Power {
    int64_t client;
    std::string name;
    Payload record;
  };

  void sendEventLazy(std::string_view name, Function<Payload()> builder,
                     const Payload& message) override;
  void logRegisteredEvent(int64_t client, std::string_view name, const Payload& record,
                          const Payload*) override;
  void emit(uint32_t code, uint64_t, uint64_t, uint64_t, uint64_t) override;
  int32_t ownProcessIdentifier() override { return 1000; }
  std::string ownProcessName() override { return "vxreportingd"; }
  std::optional<std::string> shortCommandName(int32_t pid) override;
  void exit(int status) override { journal_.push_back("exit " + std::to_string(status)); }
  uint32_t below(uint32_t bound) override { return randomBound = bound, random; }
  bool boolean(std::string_view name) override;
  int32_t integer(std::string_view name, int32_t defaultValue) override;
  std::unique_ptr<PreferencesDomain> open(std::string_view domain) override;
  uint32_t registerHandler(std::string_view name, int& token, std::shared_ptr<WorkQueue> queue,
                           Function<void(int token)> handler) override;
  void registerDeviceOrientationHandler(std::string_view identifier, Handler handler) override;
  void registerInterfaceOrientationHandler(std::string_view identifier, Handler handler) override;
  void unregisterDeviceOrientationHandler(std::string_view identifier) override;
  void unregisterInterfaceOrientationHandler(std::string_view identifier) override;
  std::string orientationText(int64_t orientation) override {
    return "o" + std::to_string(orientation);
  }
  std::string logsDirectory() override { return "/logs"; }
  std::optional<Error> createDirectory(const std::string& path, unsigned mode) override;
  std::unique_ptr<AtomicFile> createAtomically(const std::string& directory,
                                               const std::string& name,
                                               std::optional<Error>& error) override;

  std::vector<Event> events;
  std::vector<Power> powers;
  std::vector<uint32_t> traces;
  std::map<int32_t, std::string> processNames;
  uint32_t random = 0;
  uint32_t randomBound = 0;
  bool internalBuild = false;
  int internalBuildQuestions = 0;
  int32_t deviceClass = 0;
  std::map<std::string, std::string> preferences;  // "true" and "false" read as booleans too
  int preferenceReads = 0;
  uint32_t notifyStatus = 0;
  std::shared_ptr<WorkQueue> notifyQueue;
  std::shared_ptr<Function<void(int)>> notifyHandler;
  static constexpr int kToken = 77;
  std::map<std::string, std::shared_ptr<Handler>> deviceHandlers;
  std::map<std::string, std::shared_ptr<Handler>> interfaceHandlers;
  std::map<std::string, std::string> files;
  std::optional<Error> directoryError;
  std::optional<Error> fileError;
  std::optional<Error> writeError;  // of the next piece written, and of no other

 private:
  Journal& journal_;
};

class FakeConnection final : public ClientConnection {
 public:
  explicit FakeConnection(int32_t pid) : pid_(pid) {}
  int32_t processIdentifier() const override { return pid_; }
  std::string description() const override { return "<connection>"; }
  void setExportedInterface(const InterfaceDescription& description) override {
    interface = &description;
  }
  void setExportedObject(std::shared_ptr<ExportedObject> exported) override {
    object = std::move(exported);
  }
  std::shared_ptr<ExportedObject> exportedObject() const override { return object; }
  void setInterruptionHandler(Function<void()> handler) override {
    interruption = std::move(handler);
  }
  void setInvalidationHandler(Function<void()> handler) override {
    invalidation = std::move(handler);
  }
  void resume() override { resumed = true; }
  const InterfaceDescription* interface = nullptr;
  std::shared_ptr<ExportedObject> object;
  Function<void()> interruption;
  Function<void()> invalidation;
  bool resumed = false;

 private:
  const int32_t pid_;
};

class FakeListener final : public ServiceListener {
 public:
  void setDelegate(std::weak_ptr<ServiceListenerDelegate> listenerDelegate) override {
    delegate = std::move(listenerDelegate);
  }
  void resume() override {}
  std::weak_ptr<ServiceListenerDelegate> delegate;
};

// A device without driver statistics.
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

// All of them, installed for as long as it lives. Driver channels come from outside, where there
// are any.
class FakePlatform {
 public:
  FakePlatform() : FakePlatform(noChannels()) {}
  explicit FakePlatform(ChannelReportService& channels);
  ~FakePlatform();
  FakePlatform(const FakePlatform&) = delete;
  FakePlatform& operator=(const FakePlatform&) = delete;

  Journal journal;
  FakeClock clock;
  FakeWorkQueues queues{clock};
  FakeThreading threading{clock};
  FakeLog log{journal};
  FakeVyrReporting vyr{journal, threading};
  FakeServices services{journal};
  FakeListener listener;

 private:
  static ChannelReportService& noChannels() {
    static NoChannels none;
    return none;
  }
  Platform platform_;
};

}  // namespace vx::fakes
