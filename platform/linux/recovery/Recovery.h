// Runs the calls again that a process had accepted when it ended without a chance to finish them.
#pragma once

#include <chrono>
#include <cstdint>
#include <map>
#include <memory>
#include <set>
#include <string>
#include <utility>
#include <vector>

#include "base/Function.h"
#include "platform/ServiceListener.h"
#include "platform/linux/execution/CauseScope.h"
#include "platform/linux/execution/Executor.h"
#include "platform/linux/journal/Journal.h"
#include "platform/linux/journal/JournalReader.h"
#include "platform/linux/journal/RecordKind.h"
#include "platform/linux/recovery/RecoveredConnection.h"
#include "platform/linux/recovery/ReplayInputs.h"
#include "platform/linux/recovery/ReplayPlatform.h"
#include "platform/linux/store/KnownRows.h"

namespace vx::lnx {

// What the recovery works with. All of it outlives the recovery.
struct RecoveryMeans {
  Platform& live;
  Executor& executor;
  Journal& journal;
  std::vector<std::string> backends;  // the relay's
  Monotonic patience;                 // until then it waits for what the store has to write
};

struct RecoveryOutcome {
  uint64_t calls = 0;       // run again
  uint64_t undone = 0;      // of these, what an earlier process had not finished
  uint64_t ended = 0;       // connections that were open
  uint64_t restored = 0;    // clients and sessions, from the snapshot before the calls
  uint64_t unreadable = 0;  // records that no operation understands, and parts of snapshots
};

// What a snapshot holds is given back to the service. Every call recorded since goes through the
// service's own code once more, in its order, on a platform that stands for the time it was
// accepted at: those that were done for the state they leave, the others for their rows too. Then
// each connection that was open ends, and with it its sessions. Rows of a call keep their names, so
// that whoever writes them finds those that are there already: a recovery that is cut short at any
// point can be begun again.
//
// Owned by the platform, and kept: work that has to wait (a delayed message) goes on after run().
// Used on the interactive thread, before the listener listens.
class Recovery {
 public:
  using MakeDelegate = Function<std::shared_ptr<ServiceListenerDelegate>()>;

  // `contents`: of the files that `journal` found there when it was opened.
  Recovery(RecoveryMeans means, JournalContents contents);
  Recovery(const Recovery&) = delete;
  Recovery& operator=(const Recovery&) = delete;

  // Whose rows may be written, and which relay sessions are gone back to.
  ReplayedCalls calls() const;
  // Makes delegates of its own, on a platform that is installed until it returns.
  RecoveryOutcome run(const MakeDelegate& makeDelegate);

 private:
  using Record = JournalContents::Record;
  void beginService();
  void runRecord(const Record& record);
  void accept(const Record& record);
  void call(const Record& record);
  void end(const Record& record);
  void delayed(const Record& record);
  bool isUndone(uint64_t call) const;

  // Parts of a snapshot.
  void restore(const Record& record);
  bool restorePart(const Record& record);
  bool restoreClient(const Record& record);
  bool restoreSession(const Record& record);
  bool restoreRelay(const Record& record);
  void endOpenConnections();
  Cause append(RecordKind kind, uint64_t connection, uint32_t user = kNoUser);
  void runInteractive();
  void waitForStore();

  RecoveryMeans means_;
  const JournalContents contents_;
  const MakeDelegate* makeDelegate_ = nullptr;
  ReplayInputs inputs_{contents_};
  ReplayPlatform platform_;
  std::shared_ptr<ServiceListenerDelegate> delegate_;
  // In the order in which they were accepted.
  std::map<uint64_t, std::shared_ptr<RecoveredConnection>> connections_;
  // The work that waits by itself: its call and place.
  std::set<std::pair<uint64_t, uint32_t>> delayed_;
  double lastTime_ = 0;  // the latest that was recorded
  RecoveryOutcome outcome_;
};

}  // namespace vx::lnx
