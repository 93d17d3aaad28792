#include "platform/linux/LinuxPlatform.h"

#include <fcntl.h>
#include <malloc.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cstdlib>
#include <optional>
#include <vector>

#include "base/UniqueFd.h"
#include "platform/Log.h"
#include "platform/linux/CrashSafety.h"
#include "platform/linux/Inspection.h"
#include "platform/linux/PlatformConfiguration.h"
#include "platform/linux/QuietMoments.h"
#include "platform/linux/RelayReporting.h"
#include "platform/linux/StopDeadline.h"
#include "platform/linux/aggregates/AggregateSegments.h"
#include "platform/linux/device/ConfiguredDeviceProperties.h"
#include "platform/linux/device/CounterChannels.h"
#include "platform/linux/device/ImmediateProcessControl.h"
#include "platform/linux/device/KernelRandom.h"
#include "platform/linux/device/LinuxOrientation.h"
#include "platform/linux/device/ProcProcessInfo.h"
#include "platform/linux/device/UsdtTracePoint.h"
#include "platform/linux/diagnostics/LinuxDiagnosticFiles.h"
#include "platform/linux/diagnostics/SystemLog.h"
#include "platform/linux/execution/EventLoop.h"
#include "platform/linux/execution/Executor.h"
#include "platform/linux/execution/FreeList.h"
#include "platform/linux/execution/SpareMemory.h"
#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/ipc/InspectEndpoint.h"
#include "platform/linux/ipc/SocketListener.h"
#include "platform/linux/settings/PreferencesWatcher.h"
#include "platform/linux/settings/TomlPreferences.h"
#include "platform/linux/store/LocalStore.h"

namespace vx::lnx {

namespace {

constexpr std::string_view kPreferencesNotification = "com.quorvel.sonik.reporting";
constexpr std::string_view kPreferencesFile = "com.quorvel.sonik.toml";
// Of a stop, from the signal on; CrashSafety::kMoveLimits follow (docs/configuration.md).
constexpr StopDeadline::Limits kCommitLimits{.first = std::chrono::seconds(5),
                                             .pause = std::chrono::seconds(5),
                                             .most = std::chrono::seconds(45)};
constexpr std::chrono::milliseconds kThreadTime{200};

// A descriptor of the loop whose readiness means one call.
class CallOnReady final : public EventLoop::Source {
 public:
  explicit CallOnReady(Function<void()> call) : call_(std::move(call)) {}
  void onReady(uint32_t) override { call_(); }

 private:
  Function<void()> call_;
};

// The store and one descriptor per connection want more than the customary 1024.
void raiseDescriptorLimit() {
  rlimit limit{};
  if (getrlimit(RLIMIT_NOFILE, &limit) != 0 || limit.rlim_cur >= limit.rlim_max) return;
  limit.rlim_cur = limit.rlim_max;
  setrlimit(RLIMIT_NOFILE, &limit);
}

OrientationOptions withDefaults(OrientationOptions orientation, const Directories& directories) {
  if (orientation.interfaceStateFile.empty()) {
    orientation.interfaceStateFile = directories.runtime + "/interface/orientation";
  }
  return orientation;
}

// Messages that sessions keep make the heap grow, and each of its pages is missing when it is first
// touched: one message in sixteen would wait for the kernel to find one. So the heap grows in
// steps, and a step's pages are asked for at once, between two passes of the event loop. Confined
// to the loop's thread, whose allocations the heap is.
class HeapPages {
 public:
  static constexpr int kStep = 512 << 10;

  void askForNew() {
    char* const end = heapEnd();
    if (known_ != nullptr && end > known_) {
      char* const begin = known_ - reinterpret_cast<uintptr_t>(known_) % kPage;
      // A hint: a kernel that does not know it brings the pages one by one, as ever.
      (void)madvise(begin, static_cast<std::size_t>(end - begin), MADV_POPULATE_WRITE);
    }
    known_ = end;
  }

 private:
  static constexpr uintptr_t kPage = 4096;
  static char* heapEnd() { return static_cast<char*>(sbrk(0)); }
  char* known_ = nullptr;  // before the first pass: what the start has left may stay untouched
};

class RunningPlatform final : public LinuxPlatform {
 public:
  RunningPlatform(const Directories& directories, const PlatformConfiguration& configuration)
      : configuration_(configuration),
        accounts_(configuration.memory),
        aggregates_({.folder = CrashSafety::Folders::journalIn(directories.runtime),
                     .runElsewhere =
                         [this](Function<void()> work) {
                           // A call that is run again would not do it: it takes no place in one.
                           executor_.withoutCause(
                               [&] { executor_.background().async(std::move(work)); });
                         },
                     .accounts = &accounts_,
                     .leftOut =
                         [this](int64_t reporterID, uint64_t messages) {
                           store_->note({"aggregate_left_out", "", static_cast<int64_t>(messages),
                                         "reporter " + std::to_string(reporterID) +
                                             (messages == 0 ? ": from here on" : "")});
                         }}),
        loop_(executor_, clock_),
        listener_(loop_, executor_, clock_, configuration.listener),
        inspectEndpoint_(loop_, executor_, clock_, configuration.inspect),
        preferences_(directories.configuration + "/preferences"),
        channels_(configuration.drivers),
        properties_(configuration.device),
        orientation_(withDefaults(configuration.orientation, directories)),
        diagnosticFiles_(directories.logs),
        directories_(directories) {
    log_.configure(configuration.log);
    log_.setPreferences(preferences_);
  }

  bool open(const Directories& directories, std::string& problem) {
    if (const Status opened = listener_.open(directories.runtime); !opened.ok()) {
      problem = opened.text();
      return false;
    }
    watcher_.emplace(directories.configuration + "/preferences", directories.runtime + "/notify",
                     std::vector<PreferencesWatcher::Notification>{
                         {std::string(kPreferencesNotification), std::string(kPreferencesFile)}},
                     configuration_.preferences, clock_);
    const CrashSafety::Folders journals(directories);
    // A store that was lost is begun anew and gets what the journal still has.
    Result<std::unique_ptr<LocalStore>> opened =
        LocalStore::open(directories.state, configuration_.store, clock_,
                         epochOfJournal(journals.journal, journals.moved));
    if (!opened.ok()) {
      problem = opened.status().text();
      return false;
    }
    store_ = std::move(*opened);
    store_->setEndWord(endWordOf);
    store_->setAccounts(accounts_);
    crashSafety_.emplace(
        CrashSafety::Means{clock_, executor_, loop_, listener_, *store_, aggregates_}, journals);
    if (backends().empty()) executor_.setRelayUnrecorded();
    relay_.emplace(backends(),
                   [this](Function<void()> job) { executor_.runPromptly(std::move(job)); });
    services_.emplace(Platform{
        .serviceListener = listener_,
        .workQueues = executor_,
        .clock = clock_,
        .threading = threading_,
        .processInfo = processInfo_,
        .processControl = processControl_,
        .random = random_,
        .preferences = preferences_,
        .systemNotify = *watcher_,
        .vyrReporting = *relay_,
        .analytics = *store_,
        .powerLog = *store_,
        .channelReports = channels_,
        .deviceProperties = properties_,
        .orientation = orientation_,
        .log = log_,
        .trace = trace_,
        .diagnosticFiles = diagnosticFiles_,
        .inputs = crashSafety_->inputs(),
        .aggregates = aggregates_,
    });
    inspection_.emplace(Inspection::Means{clock_, executor_, accounts_, listener_, inspectEndpoint_,
                                          *store_, *crashSafety_, orientation_, log_,
                                          configuration_, directories_.logs});
    return true;
  }

  Platform& services() override { return *services_; }

  void begin() override {
    sd_notify(0, "STATUS=Finishing what an earlier process had accepted");
    crashSafety_->report();
    watcher_->start(PreferencesWatcher::openInotify());
    store_->start();
    connect();
  }
  void recover(const Function<std::shared_ptr<ServiceListenerDelegate>()>& makeDelegate) override {
    crashSafety_->recover(*services_, backendNames(), makeDelegate);
  }
  SystemLog& log() { return log_; }

  int shutDown() override {
    StopDeadline deadline(clock_, stopBegan_.value_or(clock_.monotonic()), kCommitLimits,
                          askForTime);
    const bool drained =
        waitFor(deadline, [this](Monotonic until) { return executor_.drain(until); });
    if (!drained) VX_LOG(nullptr, Error, "relay work was left behind: it did not finish in time");
    store_->stopAccepting();
    bool ended =
        waitFor(deadline, [this](Monotonic until) { return store_->waitUntilEnded(until); });
    if (!ended) {
      store_->giveUp();
      ended = store_->waitUntilEnded(clock_.monotonic() + kThreadTime);
    }
    // What runs only now tells the store, which counts the rows that nobody has recorded. Of what
    // is held up even so, an item is a row or two, unless no back end makes any.
    const bool allRan = drained || executor_.drain(clock_.monotonic() + kThreadTime);
    const bool mayLose = !allRan && !crashSafety_->isAllRecorded() && !backends().empty();
    const std::size_t left = mayLose ? executor_.utilityBacklog() : 0;
    executor_.stop(clock_.monotonic() + kThreadTime);
    const bool oriented = orientation_.stop(clock_.monotonic() + kThreadTime);
    crashSafety_->stop();
    const LocalStore::Counters counters = store_->counters();
    const uint64_t lost = counters.rowsLost + left + (ended ? 0 : counters.unrecordedWaiting);
    VX_LOG(nullptr, Info,
           "stored: rows=%llu commits=%llu write_failures=%llu rows_left=%llu rows_lost=%llu "
           "log_lines_dropped=%llu",
           static_cast<unsigned long long>(counters.rowsCommitted),
           static_cast<unsigned long long>(counters.commits),
           static_cast<unsigned long long>(counters.writeFailures),
           static_cast<unsigned long long>(counters.rowsLeft),
           static_cast<unsigned long long>(lost),
           static_cast<unsigned long long>(log_.droppedLines()));
    const bool alone = crashSafety_->keepWhatIsLeft(askForTime);
    const int status = lost == 0 ? 0 : 1;
    // A thread that could not be ended must not find the services destroyed.
    if (!drained || !ended || !oriented || !alone) std::_Exit(status);
    return status;
  }

 private:
  // ------------------------------------------------------------------------------------------ stop

  static void askForTime(std::chrono::milliseconds time) {
    // With what is needed afterwards.
    const std::chrono::microseconds wanted =
        time + CrashSafety::kMoveLimits.first + std::chrono::seconds(2);
    sd_notifyf(0, "EXTEND_TIMEOUT_USEC=%llu", static_cast<unsigned long long>(wanted.count()));
  }

  bool waitFor(StopDeadline& deadline, const Function<bool(Monotonic until)>& isDone) {
    while (!isDone(deadline.nextLook())) {
      if (!deadline.goOn(store_->progress() - executor_.utilityBacklog())) return false;
    }
    return true;
  }

  void watch(int fd, EventLoop::Source& source) {
    const Status added = loop_.add(fd, EPOLLIN, source);
    if (!added.ok()) VX_LOG(nullptr, Error, "%s", added.text().c_str());
  }
  // Those that the configuration names, in its order.
  std::vector<RelayBackend*> backends() {
    std::vector<RelayBackend*> named;
    for (const std::string& name : configuration_.relay.backends) {
      if (name == store_->relayBackend().name()) named.push_back(&store_->relayBackend());
    }
    return named;
  }

  std::vector<std::string> backendNames() {
    std::vector<std::string> names;
    for (const RelayBackend* backend : backends()) names.emplace_back(backend->name());
    return names;
  }

  // The allocator returns by itself only what lies at the end of its heap.
  void giveBackMemory() {
    FreeList<WorkItem>::clearAll();
    executor_.withoutCause([this] {
      crashSafety_->giveBack();
      store_->giveBackMemory();
      executor_.background().async([] { malloc_trim(0); });
    });
  }

  // Everything that the event loop looks after besides connections.
  void connect() {
    accounts_.setResumedHandler([this] { listener_.congestionEnded(); });
    listener_.setHooks({
        .congested = [this](uid_t user) { return crashSafety_->isFull(user); },
        .listening = [this] { onListening(); },
        .stopping =
            [this] {
              stopBegan_ = clock_.monotonic();
              sd_notify(0, "STOPPING=1\nSTATUS=Closing sessions and committing");
              inspectEndpoint_.stop();
            },
    });

    sigset_t signals;
    sigemptyset(&signals);
    for (const int number : {SIGTERM, SIGINT, SIGUSR1}) sigaddset(&signals, number);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    signalFd_.reset(signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK));
    watch(signalFd_.get(), signalSource_);

    loop_.addPassEndHook([this] { heapPages_.askForNew(); });
    loop_.addPassEndHook([this] {
      SpareMemory::keep();
      quietMoments_.afterPass(listener_.counters().workBegun());
    });
    loop_.addDeadline([this] { return quietMoments_.nextDue(); },
                      [this] { quietMoments_.onDue(); });
    watcher_->setPoster([this](std::string_view name, const PreferencesWatcher::Post& post) {
      crashSafety_->recordNotification(name, post);
    });
    watcher_->setBeforeFire([this](std::string_view) { log_.refreshVerbose(); });
    if (watcher_->fd() >= 0) watch(watcher_->fd(), watcherSource_);
    loop_.addDeadline([this] { return watcher_->nextDue(); }, [this] { watcher_->onDue(); });

    uint64_t microseconds = 0;
    if (sd_watchdog_enabled(1, &microseconds) > 0) {
      watchdogInterval_ = std::chrono::microseconds(microseconds / 2);
      nextPing_ = clock_.monotonic();
      loop_.addDeadline([this]() -> std::optional<Monotonic> { return nextPing_; },
                        [this] {
                          sd_notify(0, "WATCHDOG=1");
                          nextPing_ = clock_.monotonic() + watchdogInterval_;
                        });
    }
  }

  void onListening() {
    // The service does without it.
    if (const Status opened = inspectEndpoint_.open(directories_.runtime); !opened.ok())
      VX_LOG(nullptr, Error, "nobody can look into the service: %s", opened.text().c_str());
    inspectEndpoint_.serve(Inspection::interface(), [this] { return inspection_->makeObject(); });
    sd_notify(0, "READY=1\nSTATUS=Serving; vxreport status says more");
  }

  void onSignal() {
    signalfd_siginfo info{};
    while (read(signalFd_.get(), &info, sizeof info) == static_cast<ssize_t>(sizeof info)) {
      if (info.ssi_signo != SIGUSR1) {
        loop_.stop();
        continue;
      }
      const LocalStore::Counters counters = store_->counters();
      VX_LOG(nullptr, Info,
             "counters: %s rows=%llu commits=%llu write_failures=%llu relay_backlog=%zu "
             "orientation_refused=%llu waiting_bytes=%lld kept_bytes=%lld user_pauses=%llu "
             "work_given_up=%llu %s",
             listener_.counters().text().c_str(),
             static_cast<unsigned long long>(counters.rowsCommitted),
             static_cast<unsigned long long>(counters.commits),
             static_cast<unsigned long long>(counters.writeFailures), executor_.utilityBacklog(),
             static_cast<unsigned long long>(orientation_.refusedHandlers()),
             static_cast<long long>(accounts_.total(MemoryKind::Waiting)),
             static_cast<long long>(accounts_.total(MemoryKind::Kept)),
             static_cast<unsigned long long>(accounts_.pauses()),
             static_cast<unsigned long long>(executor_.itemsGivenUp()),
             crashSafety_->counters().c_str());
    }
  }

  const PlatformConfiguration configuration_;
  SystemClock clock_;
  SystemLog log_;
  UserAccounts accounts_;
  AggregateSegments aggregates_;  // before the executor, whose work may hold blocks
  Executor executor_{accounts_};
  SystemThreading threading_{executor_.background()};
  EventLoop loop_;
  SocketListener listener_;
  InspectEndpoint inspectEndpoint_;
  TomlPreferences preferences_;
  CounterChannels channels_;
  ConfiguredDeviceProperties properties_;
  LinuxOrientation orientation_;
  HeapPages heapPages_;
  QuietMoments quietMoments_{clock_, [this] { giveBackMemory(); }};
  LinuxDiagnosticFiles diagnosticFiles_;
  const Directories directories_;
  ProcProcessInfo processInfo_;
  ImmediateProcessControl processControl_;
  KernelRandom random_;
  UsdtTracePoint trace_;
  std::optional<PreferencesWatcher> watcher_;
  std::unique_ptr<LocalStore> store_;
  std::optional<Monotonic> stopBegan_;
  std::optional<CrashSafety> crashSafety_;
  std::optional<RelayReporting> relay_;
  std::optional<Inspection> inspection_;
  std::optional<Platform> services_;
  UniqueFd signalFd_;
  CallOnReady signalSource_{[this] { onSignal(); }};
  CallOnReady watcherSource_{[this] { watcher_->onReadable(); }};
  std::chrono::nanoseconds watchdogInterval_{0};
  Monotonic nextPing_{};
};

}  // namespace

std::unique_ptr<LinuxPlatform> LinuxPlatform::start(std::string& problem) {
  signal(SIGPIPE, SIG_IGN);
  signal(SIGXFSZ, SIG_IGN);  // a file that may not grow is an error of its write
  raiseDescriptorLimit();
  // Large buffers go back to the system when they are freed, whatever has been allocated since.
  mallopt(M_MMAP_THRESHOLD, 256 << 10);
  mallopt(M_TOP_PAD, HeapPages::kStep);
  SpareMemory::keep();
  const Directories directories = Directories::fromEnvironment();
  std::vector<std::string> complaints;
  const PlatformConfiguration configuration = PlatformConfiguration::load(directories, complaints);
  auto running = std::make_unique<RunningPlatform>(directories, configuration);
  for (const std::string& complaint : complaints) {
    static constexpr LogSite kSite{__FILE_NAME__, __LINE__, "start", 0};
    running->log().write(nullptr, LogLevel::Error, kSite, "configuration: " + complaint, 0);
  }
  if (!running->open(directories, problem)) return nullptr;
  return running;
}

}  // namespace vx::lnx
