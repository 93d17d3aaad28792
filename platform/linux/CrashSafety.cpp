#include "platform/linux/CrashSafety.h"

#include <linux/magic.h>
#include <sys/vfs.h>

#include <future>
#include <utility>

#include "platform/Log.h"
#include "platform/linux/execution/CauseScope.h"
#include "platform/linux/recovery/JournalMove.h"
#include "platform/linux/recovery/Records.h"
#include "platform/linux/store/KnownRows.h"

namespace vx::lnx {

namespace {

// Beyond the highest call that a store shows: what its rows may have had, and a whole journal
// whose calls made none.
constexpr uint64_t kMostCallsUnseen = KnownRows::kCallsPerMark + (uint64_t{3} << 20);
// How long clients wait for what was recovered to be committed: by its size, and where a process
// before this one has ended in the recovery, which must not happen once more for the disk's sake.
constexpr std::chrono::seconds kReplayTime{1};
constexpr uint64_t kReplayedInThat = 100'000;  // entries
constexpr std::chrono::seconds kReplayTimeAgain{4};
constexpr std::chrono::milliseconds kLookAgain{20};

bool isInMemory(const std::string& folder) {
  struct statfs files {};
  return statfs(folder.c_str(), &files) == 0 && files.f_type == TMPFS_MAGIC;
}

void aggregateUnrecorded(const Status& why) {
  VX_LOG(nullptr, Error,
         "%s: what sessions receive from now on may miss in summaries that a later process makes",
         why.text().c_str());
}

}  // namespace

CrashSafety::CrashSafety(Means means, Folders folders)
    : means_(means), folders_(std::move(folders)) {
  Result<OpenedJournal> opened =
      openJournal({.folder = folders_.journal,
                   .epoch = means_.store.epoch(),
                   .first = {.call = means_.store.lastCall() + kMostCallsUnseen}},
                  folders_.moved);
  if (opened.ok())
    use(std::move(opened).value());
  else
    noJournal_ = opened.status().text() + ": what is accepted does not survive this process";
  inputs_.emplace(journal_.get());
}

void CrashSafety::use(OpenedJournal opened) {
  journal_ = std::move(opened.journal);
  left_ = std::move(opened.left);
  poisoned_ = std::move(opened.poisoned);
  movedStays_ = opened.movedStays;
  attempt_ = opened.attempt;
  complaints_ = std::move(opened.complaints);
  inMemory_ = isInMemory(folders_.journal);
  recorder_.emplace(*journal_, means_.clock);
  recorder_->setUnrecordedHandler([this](const Status& why) { unrecorded(why); });
  means_.loop.addPassEndHook([this] { recorder_->endPass(); });
  cutJournal();
  means_.listener.setRecorder(*recorder_);
  if (const Status kept = means_.aggregates.open(complaints_); !kept.ok())
    complaints_.push_back(kept.text());
  means_.aggregates.setUnrecordedHandler(aggregateUnrecorded);
}

void CrashSafety::unrecorded(const Status& why) {
  if (recorder_->counters().unrecorded == 1) {
    VX_LOG(nullptr, Error, "%s: what is accepted from now on may not survive this process",
           why.text().c_str());
    means_.store.note({"journal_full", "", 0, why.text()});
  }
  snapshots_->demand();  // a replay of the calls would not come to the state that there is
}

void CrashSafety::cutJournal() {
  snapshots_.emplace(Snapshots::Means{
      .journal = *journal_,
      .clock = means_.clock,
      .save =
          [this](Function<void(SavedService)> saved) {
            const std::shared_ptr<ServiceListenerDelegate> delegate = means_.listener.delegate();
            return delegate != nullptr && delegate->saveState(std::move(saved));
          },
      .connections = [this] { return means_.listener.recordedConnections(); },
      .crowded = [this] { return recorder_->shares().isCrowded(); },
      .commitSoon = [this] { means_.store.commitSoon(); },
      .freed = [this] { means_.listener.congestionEnded(); },
      .began =
          [this] {
            means_.aggregates.snapshotBegan();
            recorder_->shares().generationBegan();
          },
      .taken = [this] { means_.aggregates.snapshotTaken(); },
      .completed =
          [this] {
            means_.aggregates.snapshotCompleted();
            recorder_->shares().snapshotCompleted();
          },
  });
  means_.loop.addPassEndHook([this] { snapshots_->afterPass(); });
  means_.loop.addDeadline([this] { return snapshots_->nextDue(); },
                          [this] { snapshots_->onDue(); });
  Journal::setCallsDoneHandler([](void* loop) { static_cast<EventLoop*>(loop)->wake(); },
                               &means_.loop);
}

void CrashSafety::report() {
  for (const std::string& complaint : complaints_) {
    VX_LOG(nullptr, Error, "journal: %s", complaint.c_str());
    means_.store.noteAtStart({"journal_damaged", "", 0, complaint});
  }
  if (!noJournal_.empty()) {
    VX_LOG(nullptr, Error, "no journal: %s", noJournal_.c_str());
    means_.store.noteAtStart({"journal_absent", "", 0, noJournal_});
  }
  for (const std::string& poisoned : poisoned_) {
    VX_LOG(nullptr, Error,
           "processes ended again and again while they finished what an earlier one had "
           "accepted; it is now in %s",
           poisoned.c_str());
    means_.store.noteAtStart(
        {"journal_moved_aside", "", 0, "its replays did not end; now " + poisoned});
  }
  if (!poisoned_.empty()) means_.store.commitSoon([poisoned = poisoned_] { told(poisoned); });
  if (journal_ != nullptr && !inMemory_)
    VX_LOG(nullptr, Info, "the runtime folder is not a tmpfs: each call costs writes to a disk");
}

void CrashSafety::recover(Platform& live, std::vector<std::string> backends,
                          const Recovery::MakeDelegate& makeDelegate) {
  if (left_.records.empty()) {
    // What could not be taken back is of a process before this one.
    if (movedStays_) (void)journal_->append({static_cast<uint8_t>(RecordKind::ServiceBegan)});
    means_.aggregates.snapshotBegan();
    means_.aggregates.snapshotCompleted();
    means_.store.yieldToOthers();
    return endReplay(folders_.journal);
  }
  const Monotonic began = means_.clock.monotonic();
  const Monotonic until = began + kReplayTime * (1 + left_.entries / kReplayedInThat) +
                          (attempt_ > 1 ? kReplayTimeAgain : std::chrono::seconds(0));
  means_.executor.adoptInteractiveThread();
  recovery_.emplace(RecoveryMeans{live, means_.executor, *journal_, std::move(backends), until},
                    std::move(left_));
  means_.store.beginReplay(recovery_->calls());
  const RecoveryOutcome outcome = recovery_->run(makeDelegate);
  commitReplay(until);
  means_.store.yieldToOthers();
  snapshots_->demand();
  if (outcome.unreadable > 0) {
    means_.store.note({"recovery_incomplete", "", 0,
                       std::to_string(outcome.unreadable) + " records could not be understood"});
    VX_LOG(nullptr, Error, "%llu records of what an earlier process had accepted were left out",
           static_cast<unsigned long long>(outcome.unreadable));
  }
  VX_LOG(
      nullptr, Info,
      "finished what an earlier process had accepted: restored=%llu calls=%llu undone=%llu "
      "connections=%llu unreadable=%llu ms=%lld",
      static_cast<unsigned long long>(outcome.restored),
      static_cast<unsigned long long>(outcome.calls),
      static_cast<unsigned long long>(outcome.undone),
      static_cast<unsigned long long>(outcome.ended),
      static_cast<unsigned long long>(outcome.unreadable),
      static_cast<long long>(
          std::chrono::round<std::chrono::milliseconds>(means_.clock.monotonic() - began).count()));
}

// A process that dies of a row does so when it is written: until then the replay is not over,
// though clients are served when it takes long.
void CrashSafety::commitReplay(Monotonic until) {
  const auto committed = std::make_shared<std::promise<void>>();
  means_.store.endReplay([committed, folder = folders_.journal] {
    endReplay(folder);
    committed->set_value();
  });
  std::future<void> end = committed->get_future();
  while (end.wait_for(kLookAgain) != std::future_status::ready &&
         means_.clock.monotonic() < until) {
    // Nobody dies of a disk that cannot be written.
    if (means_.store.counters().writeFailures > 0) return endReplay(folders_.journal);
  }
  replayServes(folders_.journal);
}

void CrashSafety::recordNotification(std::string_view name, const Function<void()>& post) {
  if (!recorder_) return post();
  const Cause cause{recorder_->preferencesChanged(name), {}};
  const CauseScope scope(cause);
  post();
}

std::vector<CrashSafety::Figure> CrashSafety::figures() const {
  const JournalCounters journal = journal_ != nullptr ? journal_->counters() : JournalCounters{};
  const AggregateCounters aggregates = means_.aggregates.counters();
  const Snapshots::Counters snapshots = snapshots_ ? snapshots_->counters() : Snapshots::Counters{};
  const auto longest = std::chrono::round<std::chrono::microseconds>(snapshots.longest).count();
  return {{"journal_entries", journal.appended},
          {"journal_bytes", journal.bytes},
          {"journal_segments", journal.segmentsInUse},
          {"journal_full", journal.full},
          {"unrecorded", recorder_ ? recorder_->counters().unrecorded : 0},
          {"aggregate_bytes", aggregates.fileBytes},
          {"aggregates_unrecorded", aggregates.unrecordedBytes},
          {"snapshots", snapshots.completed},
          {"snapshot_bytes", snapshots.bytes},
          {"snapshot_us", static_cast<uint64_t>(longest)}};
}

std::string CrashSafety::counters() const {
  std::string text;
  for (const Figure& figure : figures())
    text +=
        (text.empty() ? "" : " ") + std::string(figure.name) + '=' + std::to_string(figure.value);
  return text;
}

void CrashSafety::giveBack() {
  if (journal_ == nullptr) return;
  // What sessions have released a snapshot must make free.
  if (means_.aggregates.counters().waitingBytes >= Snapshots::kWorthwhileBytes)
    snapshots_->demand();
  means_.executor.background().async([this] {
    means_.aggregates.giveBack();
    journal_->giveBack();
  });
}

bool CrashSafety::keepWhatIsLeft(Function<void(std::chrono::milliseconds)> askForTime) {
  if (journal_ == nullptr) return true;
  if (journal_->allDone()) {
    journal_->discard();
    means_.aggregates.discard();
    return true;
  }
  endReplay(folders_.journal);  // of which this process has not died
  JournalMove move(folders_.journal, folders_.moved, means_.store.bytesLeft());
  StopDeadline deadline(means_.clock, means_.clock.monotonic(), kMoveLimits, std::move(askForTime));
  std::optional<Status> outcome;
  while (!(outcome = move.waitUntil(deadline.nextLook())) && deadline.goOn(move.progress())) {
  }
  const bool moved = outcome && outcome->ok();
  VX_LOG(nullptr, Error,
         "what was accepted and is not in the store is kept in %s for the next start%s%s",
         moved ? folders_.moved.c_str() : folders_.journal.c_str(), moved ? "" : ": ",
         moved ? "" : (outcome ? outcome->text() : "the disk does not answer").c_str());
  return outcome.has_value();
}

}  // namespace vx::lnx
