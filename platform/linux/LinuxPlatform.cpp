#include "platform/linux/LinuxPlatform.h"

#include <fcntl.h>
#include <linux/magic.h>
#include <malloc.h>
#include <signal.h>
#include <sys/mman.h>
#include <sys/resource.h>
#include <sys/signalfd.h>
#include <sys/vfs.h>
#include <systemd/sd-daemon.h>
#include <unistd.h>

#include <cstdlib>
#include <future>
#include <optional>
#include <vector>

#include "base/UniqueFd.h"
#include "platform/Log.h"
#include "platform/linux/PlatformConfiguration.h"
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
#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/ipc/SocketListener.h"
#include "platform/linux/journal/Journal.h"
#include "platform/linux/recovery/JournalMove.h"
#include "platform/linux/recovery/JournalOpening.h"
#include "platform/linux/recovery/JournalRecorder.h"
#include "platform/linux/recovery/JournaledInputs.h"
#include "platform/linux/recovery/Records.h"
#include "platform/linux/recovery/Recovery.h"
#include "platform/linux/recovery/Snapshots.h"
#include "platform/linux/settings/PreferencesWatcher.h"
#include "platform/linux/settings/TomlPreferences.h"
#include "platform/linux/store/LocalStore.h"

namespace vx::lnx {

namespace {

constexpr std::string_view kPreferencesNotification = "com.quorvel.sonik.reporting";
constexpr std::string_view kPreferencesFile = "com.quorvel.sonik.toml";
// Relay work that accepted messages may have caused before reading from clients pauses.
constexpr std::size_t kRelayBacklogHigh = 64 << 10;
constexpr std::size_t kRelayBacklogLow = 32 << 10;
// Of a stop, from the signal on; then of moving what is left (docs/configuration.md).
constexpr StopDeadline::Limits kCommitLimits{.first = std::chrono::seconds(5),
                                             .pause = std::chrono::seconds(5),
                                             .most = std::chrono::seconds(45)};
constexpr StopDeadline::Limits kMoveLimits{.first = std::chrono::seconds(3),
                                           .pause = std::chrono::seconds(3),
                                           .most = std::chrono::seconds(15)};
constexpr std::chrono::milliseconds kThreadTime{200};
// How long clients wait for what was recovered to be committed.
constexpr std::chrono::seconds kReplayCommit{4};
constexpr std::chrono::milliseconds kLookAgain{20};

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
    orientation.interfaceStateFile = directories.runtime + "/interface-orientation";
  }
  return orientation;
}

// More calls than a journal holds: what a store's newest rows may not show of those it has.
constexpr uint64_t kMostCallsUnseen = 1 << 21;

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
        aggregates_({.folder = directories.runtime + "/journal"}),
        loop_(executor_, clock_),
        listener_(loop_, executor_, clock_, configuration.listener),
        preferences_(directories.configuration + "/preferences"),
        channels_(configuration.drivers),
        properties_(configuration.device),
        orientation_(withDefaults(configuration.orientation, directories)),
        diagnosticFiles_(directories.logs) {
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
    journalFolder_ = directories.runtime + "/journal";
    movedFolder_ = directories.state + "/journal";
    // A store that was lost is begun anew and gets what the journal still has.
    Result<std::unique_ptr<LocalStore>> opened =
        LocalStore::open(directories.state, configuration_.store, clock_,
                         epochOfJournal(journalFolder_, movedFolder_));
    if (!opened.ok()) {
      problem = opened.status().text();
      return false;
    }
    store_ = std::move(*opened);
    store_->setEndWord(endWordOf);
    openJournal(directories);
    relay_.emplace(backends(), [this](Function<void()> job) { store_->runSoon(std::move(job)); });
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
        .inputs = *inputs_,
        .aggregates = aggregates_,
    });
    return true;
  }

  Platform& services() override { return *services_; }

  void begin() override {
    reportOnJournal();
    watcher_->start(PreferencesWatcher::openInotify());
    store_->start();
    connect();
  }
  void recover(const Function<std::shared_ptr<ServiceListenerDelegate>()>& makeDelegate) override {
    if (left_.records.empty()) {
      // What could not be taken back is of a process before this one.
      if (movedStays_) (void)journal_->append({static_cast<uint8_t>(RecordKind::ServiceBegan)});
      aggregates_.snapshotBegan();
      aggregates_.snapshotCompleted();
      return endReplay(journalFolder_);
    }
    const Monotonic began = clock_.monotonic();
    executor_.adoptInteractiveThread();
    recovery_.emplace(
        RecoveryMeans{*services_, executor_, *journal_, backendNames(),
                      [this] { return store_->isCongested(); },
                      [this](uint64_t records) { noteReplaySteps(journalFolder_, records); }},
        std::move(left_));
    store_->beginReplay(recovery_->calls(),
                        [folder = journalFolder_] { noteReplayAchieved(folder); });
    const RecoveryOutcome outcome = recovery_->run(makeDelegate);
    commitReplay();
    snapshots_->demand();
    if (outcome.unreadable > 0) {
      store_->note({"recovery_incomplete", "", 0,
                    std::to_string(outcome.unreadable) + " records could not be understood"});
      VX_LOG(nullptr, Error, "%llu records of what an earlier process had accepted were left out",
             static_cast<unsigned long long>(outcome.unreadable));
    }
    VX_LOG(nullptr, Default,
           "finished what an earlier process had accepted: restored=%llu calls=%llu undone=%llu "
           "connections=%llu unreadable=%llu ms=%lld",
           static_cast<unsigned long long>(outcome.restored),
           static_cast<unsigned long long>(outcome.calls),
           static_cast<unsigned long long>(outcome.undone),
           static_cast<unsigned long long>(outcome.ended),
           static_cast<unsigned long long>(outcome.unreadable),
           static_cast<long long>(
               std::chrono::round<std::chrono::milliseconds>(clock_.monotonic() - began).count()));
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
    // Of what was not recorded, an item is a row or two.
    const std::size_t left = drained || isAllRecorded() ? 0 : executor_.utilityBacklog();
    executor_.stop(clock_.monotonic() + kThreadTime);
    Journal::setCallsDoneHandler(nullptr, nullptr);
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
    const bool alone = keepWhatIsLeft();
    const int status = lost == 0 ? 0 : 1;
    // A thread that could not be ended must not find the services destroyed.
    if (!drained || !ended || !alone) std::_Exit(status);
    return status;
  }

 private:
  // Without one the service serves all the same.
  void openJournal(const Directories& directories) {
    Result<OpenedJournal> opened =
        vx::lnx::openJournal({.folder = journalFolder_,
                              .epoch = store_->epoch(),
                              .first = {.call = store_->lastCall() + kMostCallsUnseen}},
                             movedFolder_);
    if (opened.ok()) {
      journal_ = std::move(opened->journal);
      left_ = std::move(opened->left);
      poisoned_ = std::move(opened->poisoned);
      movedStays_ = opened->movedStays;
      journalComplaints_ = std::move(opened->complaints);
      recorder_.emplace(*journal_, clock_);
      recorder_->setUnrecordedHandler([this](const Status& why) {
        if (recorder_->counters().unrecorded == 1) {
          VX_LOG(nullptr, Error, "%s: what is accepted from now on may not survive this process",
                 why.text().c_str());
          store_->note({"journal_full", "", 0, why.text()});
        }
        snapshots_->demand();  // a replay of the calls would not come to the state that there is
      });
      cutJournal();
      listener_.setRecorder(*recorder_);
      if (const Status kept = aggregates_.open(journalComplaints_); !kept.ok())
        journalComplaints_.push_back(kept.text());
      aggregates_.setUnrecordedHandler([](const Status& why) {
        VX_LOG(nullptr, Error,
               "%s: what sessions receive from now on may miss in summaries that a "
               "later process makes",
               why.text().c_str());
      });
    } else {
      noJournal_ = opened.status().text() + ": what is accepted does not survive this process";
    }
    inputs_.emplace(journal_.get());
    struct statfs files {};
    const std::string& folder = journal_ != nullptr ? journalFolder_ : directories.runtime;
    journalInMemory_ = statfs(folder.c_str(), &files) == 0 && files.f_type == TMPFS_MAGIC;
  }

  // ------------------------------------------------------------------------------------------ stop

  static void askForTime(std::chrono::milliseconds time) {
    // With what is needed afterwards.
    const std::chrono::microseconds wanted = time + kMoveLimits.first + std::chrono::seconds(2);
    sd_notifyf(0, "EXTEND_TIMEOUT_USEC=%llu", static_cast<unsigned long long>(wanted.count()));
  }

  bool waitFor(StopDeadline& deadline, const Function<bool(Monotonic until)>& isDone) {
    while (!isDone(deadline.nextLook())) {
      if (!deadline.goOn(store_->progress() - executor_.utilityBacklog())) return false;
    }
    return true;
  }

  bool isAllRecorded() const { return recorder_ && recorder_->counters().unrecorded == 0; }

  // What is not in the store goes to the state folder, which outlives a power cut. By a thread of
  // its own: the disk may be what does not answer. False: that thread still waits for it.
  bool keepWhatIsLeft() {
    if (journal_ == nullptr) return true;
    if (journal_->allDone()) {
      journal_->discard();
      aggregates_.discard();
      return true;
    }
    endReplay(journalFolder_);  // of which this process has not died
    JournalMove move(journalFolder_, movedFolder_);
    StopDeadline deadline(clock_, clock_.monotonic(), kMoveLimits, askForTime);
    std::optional<Status> outcome;
    while (!(outcome = move.waitUntil(deadline.nextLook())) && deadline.goOn(move.progress())) {
    }
    const bool moved = outcome && outcome->ok();
    VX_LOG(nullptr, Error,
           "what was accepted and is not in the store is kept in %s for the next start%s%s",
           moved ? movedFolder_.c_str() : journalFolder_.c_str(), moved ? "" : ": ",
           moved ? "" : (outcome ? outcome->text() : "the disk does not answer").c_str());
    return outcome.has_value();
  }

  // A process that dies of a row does so when it is written: until then the replay is not over.
  void commitReplay() {
    const auto committed = std::make_shared<std::promise<void>>();
    store_->endReplay([committed, folder = journalFolder_] {
      endReplay(folder);
      committed->set_value();
    });
    std::future<void> end = committed->get_future();
    const Monotonic until = clock_.monotonic() + kReplayCommit;
    while (end.wait_for(kLookAgain) != std::future_status::ready && clock_.monotonic() < until) {
      // Nobody dies of a disk that cannot be written.
      if (store_->counters().writeFailures > 0) return endReplay(journalFolder_);
    }
  }

  void cutJournal() {
    snapshots_.emplace(Snapshots::Means{
        .journal = *journal_,
        .clock = clock_,
        .save =
            [this](Function<void(SavedService)> saved) {
              const std::shared_ptr<ServiceListenerDelegate> delegate = listener_.delegate();
              return delegate != nullptr && delegate->saveState(std::move(saved));
            },
        .connections = [this] { return listener_.recordedConnections(); },
        .commitSoon = [this] { store_->commitSoon(); },
        .freed = [this] { listener_.congestionEnded(); },
        .began = [this] { aggregates_.snapshotBegan(); },
        .completed = [this] { aggregates_.snapshotCompleted(); },
    });
    loop_.addPassEndHook([this] { snapshots_->afterPass(); });
    loop_.addDeadline([this] { return snapshots_->nextDue(); }, [this] { snapshots_->onDue(); });
    Journal::setCallsDoneHandler([](void* loop) { static_cast<EventLoop*>(loop)->wake(); }, &loop_);
  }

  void reportOnJournal() {
    for (const std::string& complaint : journalComplaints_) {
      VX_LOG(nullptr, Error, "journal: %s", complaint.c_str());
      store_->noteAtStart({"journal_damaged", "", 0, complaint});
    }
    if (!noJournal_.empty()) {
      VX_LOG(nullptr, Error, "no journal: %s", noJournal_.c_str());
      store_->noteAtStart({"journal_absent", "", 0, noJournal_});
    }
    for (const std::string& poisoned : poisoned_) {
      VX_LOG(nullptr, Error,
             "processes ended again and again while they finished what an earlier one had "
             "accepted; it is now in %s",
             poisoned.c_str());
      store_->noteAtStart(
          {"journal_moved_aside", "", 0, "its replays did not end; now " + poisoned});
    }
    if (!poisoned_.empty()) store_->commitSoon([poisoned = poisoned_] { told(poisoned); });
    if (!journalInMemory_)
      VX_LOG(nullptr, Info, "the runtime folder is not a tmpfs: each call costs writes to a disk");
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

  // Everything that the event loop looks after besides connections.
  void connect() {
    store_->setDrainedHandler([this] { listener_.congestionEnded(); });
    executor_.setUtilityLowWater(kRelayBacklogLow, [this] { listener_.congestionEnded(); });
    listener_.setHooks({
        .congested =
            [this] {
              return store_->isCongested() || executor_.utilityBacklog() > kRelayBacklogHigh ||
                     (journal_ != nullptr && !journal_->hasCapacity());
            },
        .listening = [] { sd_notify(0, "READY=1"); },
        .stopping =
            [this] {
              stopBegan_ = clock_.monotonic();
              sd_notify(0, "STOPPING=1");
            },
    });

    sigset_t signals;
    sigemptyset(&signals);
    for (const int number : {SIGTERM, SIGINT, SIGUSR1}) sigaddset(&signals, number);
    pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    signalFd_.reset(signalfd(-1, &signals, SFD_CLOEXEC | SFD_NONBLOCK));
    watch(signalFd_.get(), signalSource_);

    loop_.addPassEndHook([this] { heapPages_.askForNew(); });
    if (recorder_) {
      loop_.addPassEndHook([this] { recorder_->endPass(); });
      watcher_->setPoster([this](std::string_view name, const PreferencesWatcher::Post& post) {
        const Cause cause{recorder_->preferencesChanged(name), {}};
        const CauseScope scope(cause);
        post();
      });
    }
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

  void onSignal() {
    signalfd_siginfo info{};
    while (read(signalFd_.get(), &info, sizeof info) == static_cast<ssize_t>(sizeof info)) {
      if (info.ssi_signo != SIGUSR1) {
        loop_.stop();
        continue;
      }
      const LocalStore::Counters counters = store_->counters();
      const JournalCounters journal =
          journal_ != nullptr ? journal_->counters() : JournalCounters{};
      const Snapshots::Counters snapshots =
          snapshots_ ? snapshots_->counters() : Snapshots::Counters{};
      VX_LOG(nullptr, Error,
             "counters: %s rows=%llu commits=%llu write_failures=%llu relay_backlog=%zu "
             "journal_entries=%llu journal_bytes=%llu journal_segments=%llu journal_full=%llu "
             "unrecorded=%llu aggregate_bytes=%llu aggregates_unrecorded=%llu snapshots=%llu "
             "snapshot_bytes=%llu snapshot_us=%lld",
             listener_.counters().text().c_str(),
             static_cast<unsigned long long>(counters.rowsCommitted),
             static_cast<unsigned long long>(counters.commits),
             static_cast<unsigned long long>(counters.writeFailures), executor_.utilityBacklog(),
             static_cast<unsigned long long>(journal.appended),
             static_cast<unsigned long long>(journal.bytes),
             static_cast<unsigned long long>(journal.segmentsInUse),
             static_cast<unsigned long long>(journal.full),
             static_cast<unsigned long long>(recorder_ ? recorder_->counters().unrecorded : 0),
             static_cast<unsigned long long>(aggregates_.counters().fileBytes),
             static_cast<unsigned long long>(aggregates_.counters().unrecordedBytes),
             static_cast<unsigned long long>(snapshots.completed),
             static_cast<unsigned long long>(snapshots.bytes),
             static_cast<long long>(
                 std::chrono::round<std::chrono::microseconds>(snapshots.longest).count()));
    }
  }

  const PlatformConfiguration configuration_;
  SystemClock clock_;
  SystemLog log_;
  AggregateSegments aggregates_;  // before the executor, whose work may hold blocks
  Executor executor_;
  SystemThreading threading_{executor_.background()};
  EventLoop loop_;
  SocketListener listener_;
  TomlPreferences preferences_;
  CounterChannels channels_;
  ConfiguredDeviceProperties properties_;
  LinuxOrientation orientation_;
  HeapPages heapPages_;
  LinuxDiagnosticFiles diagnosticFiles_;
  ProcProcessInfo processInfo_;
  ImmediateProcessControl processControl_;
  KernelRandom random_;
  UsdtTracePoint trace_;
  std::optional<PreferencesWatcher> watcher_;
  std::unique_ptr<LocalStore> store_;
  std::optional<Monotonic> stopBegan_;
  std::string journalFolder_;
  std::string movedFolder_;  // of what a stop could not commit
  std::vector<std::string> journalComplaints_;
  std::string noJournal_;  // why there is none
  std::vector<std::string> poisoned_;
  JournalContents left_;
  bool movedStays_ = false;
  bool journalInMemory_ = false;
  std::unique_ptr<Journal> journal_;
  std::optional<JournalRecorder> recorder_;
  std::optional<JournaledInputs> inputs_;
  std::optional<Recovery> recovery_;
  std::optional<Snapshots> snapshots_;
  std::optional<RelayReporting> relay_;
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
