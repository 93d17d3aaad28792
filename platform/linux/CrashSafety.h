// What the platform does so that what was accepted survives the process.
#pragma once

#include <chrono>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Clock.h"
#include "base/Function.h"
#include "platform/Platform.h"
#include "platform/linux/PlatformConfiguration.h"
#include "platform/linux/StopDeadline.h"
#include "platform/linux/aggregates/AggregateSegments.h"
#include "platform/linux/execution/EventLoop.h"
#include "platform/linux/execution/Executor.h"
#include "platform/linux/ipc/SocketListener.h"
#include "platform/linux/journal/Journal.h"
#include "platform/linux/recovery/JournalOpening.h"
#include "platform/linux/recovery/JournalRecorder.h"
#include "platform/linux/recovery/JournaledInputs.h"
#include "platform/linux/recovery/Recovery.h"
#include "platform/linux/recovery/Snapshots.h"
#include "platform/linux/store/LocalStore.h"

namespace vx::lnx {

// The journal of this process, what an earlier one left in it, and where it goes with a stop. Owned
// by LinuxPlatform, whose other parts outlive it; lives on the interactive thread. Without a
// journal the service serves all the same.
class CrashSafety {
 public:
  // Of moving what is left (docs/configuration.md).
  static constexpr StopDeadline::Limits kMoveLimits{.first = std::chrono::seconds(3),
                                                    .pause = std::chrono::seconds(3),
                                                    .most = std::chrono::seconds(15)};

  struct Folders {
    explicit Folders(const Directories& directories)
        : journal(journalIn(directories.runtime)), moved(directories.state + "/journal") {}
    // The aggregates lie there too: what is moved with the journal stays together.
    static std::string journalIn(const std::string& runtime) { return runtime + "/journal"; }
    std::string journal;
    std::string moved;  // of what a stop could not commit
  };
  struct Means {
    Clock& clock;
    Executor& executor;
    EventLoop& loop;
    SocketListener& listener;
    LocalStore& store;
    AggregateSegments& aggregates;
  };

  // Opens the journal behind what an earlier process left, and records from now on.
  CrashSafety(Means means, Folders folders);
  CrashSafety(const CrashSafety&) = delete;
  CrashSafety& operator=(const CrashSafety&) = delete;

  JournaledInputs& inputs() { return *inputs_; }
  // What there is to say about how it began. Once the store takes notes and the log is set up.
  void report();
  // LinuxPlatform::recover.
  void recover(Platform& live, std::vector<std::string> backends,
               const Recovery::MakeDelegate& makeDelegate);
  // Posts a change of the preferences to its handlers, as work that is recorded.
  void recordNotification(std::string_view name, const Function<void()>& post);

  // The user's calls have to wait until some of those before are done.
  bool isFull(uid_t user) const {
    if (journal_ == nullptr) return false;
    if (!journal_->hasCapacity()) return !snapshots_->cannotCut();
    return snapshots_->isUnderWay() && recorder_->shares().isOver(user);
  }
  bool isAllRecorded() const { return recorder_ && recorder_->counters().unrecorded == 0; }
  struct Figure {
    const char* name;
    uint64_t value;
  };
  std::vector<Figure> figures() const;
  std::string counters() const;
  // Load is over: what it has left free goes back to the system, on the background queue.
  void giveBack();
  bool hasJournal() const { return journal_ != nullptr; }
  // Where the journal lies survives the process alone, as intended, and costs no disk a write.
  bool journalIsInMemory() const { return inMemory_; }

  // No thread is left that works on calls.
  void stop() { Journal::setCallsDoneHandler(nullptr, nullptr); }
  // Afterwards. What is not in the store goes to the state folder, which outlives a power cut. By a
  // thread of its own: the disk may be what does not answer. False: that thread still waits for it.
  bool keepWhatIsLeft(Function<void(std::chrono::milliseconds)> askForTime);

 private:
  void use(OpenedJournal opened);
  void unrecorded(const Status& why);
  void commitReplay(Monotonic until);
  void cutJournal();

  Means means_;
  const Folders folders_;
  std::vector<std::string> complaints_;
  std::string noJournal_;  // why there is none
  std::vector<std::string> poisoned_;
  JournalContents left_;
  bool movedStays_ = false;
  uint32_t attempt_ = 0;  // to replay what is left
  bool inMemory_ = false;
  std::unique_ptr<Journal> journal_;
  std::optional<JournalRecorder> recorder_;
  std::optional<JournaledInputs> inputs_;
  std::optional<Recovery> recovery_;
  std::optional<Snapshots> snapshots_;
};

}  // namespace vx::lnx
