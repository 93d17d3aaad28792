#include "platform/linux/store/StoreBeginning.h"

#include <unistd.h>

#include <utility>

#include "platform/linux/store/Salvage.h"
#include "platform/linux/store/StoreSchema.h"

namespace vx::lnx {

bool StoreBeginning::lock(Status& why) {
  if (lock_) return true;
  StoreLock taken = lockStore(directory_);
  lock_ = std::move(taken.fd);
  why = std::move(taken.status);
  return !taken.heldByAnother;
}

OpenedStore StoreBeginning::open(std::vector<LedgerNote>& notes) {
  Status why;
  if (!lock(why) || !lock_) return {nullptr, why, StoreFault::Unusable, {}};
  path_ = directory_ + "/telemetry.db";
  OpenedStore opened = openStoreDatabase(path_, epoch_);
  if (opened.fault == StoreFault::Newer) {
    path_ = directory_ + "/telemetry-schema" + std::to_string(kStoreSchemaVersion) + ".db";
    notes.push_back({"beside_newer", "", 0, opened.status.text() + "; rows go to " + path_});
    opened = openStoreDatabase(path_, epoch_);
  }
  if (opened.fault == StoreFault::Damaged) opened = beginAfresh(opened.status.text(), notes);
  if (!opened.status.ok()) return opened;
  if (!hasEpoch_) epoch_ = opened.epoch;
  hasEpoch_ = true;
  return opened;
}

OpenedStore StoreBeginning::check(OpenedStore opened, std::vector<LedgerNote>& notes,
                                  Function<bool()> goOn) {
  StoreCheck check = quickCheck(opened.database.get(), std::move(goOn));
  if (check.fault == StoreFault::None) return opened;
  opened.database.reset();
  if (check.fault == StoreFault::Damaged)
    return beginAfresh("failed its check (" + check.status.text() + ")", notes);
  return {nullptr, std::move(check.status), check.fault, {}};
}

Status StoreBeginning::settle(StoreLoss loss, std::vector<LedgerNote>& notes) {
  std::string what = textOf(loss);
  if (loss == StoreLoss::FileGone && access(path_.c_str(), F_OK) == 0) {
    const Result<std::string> aside = moveAside(path_);
    if (!aside.ok()) return aside.status();
    what += "; what lay in its place is now " + *aside;
  }
  // With the whole folder the lock is gone.
  if (access((directory_ + kLockName).c_str(), F_OK) != 0) lock_.reset();
  if (loss != StoreLoss::LogGone) ++stores_;
  notes.push_back({loss == StoreLoss::LogGone ? "log_lost" : "store_lost", "", 0, what});
  return {};
}

OpenedStore StoreBeginning::beginAfresh(const std::string& why, std::vector<LedgerNote>& notes) {
  const Result<std::string> aside = moveAside(path_);
  if (!aside.ok()) return {nullptr, aside.status(), StoreFault::Unusable, {}};
  ++stores_;
  OpenedStore fresh = openStoreDatabase(path_, epoch_);
  if (!fresh.status.ok()) return fresh;
  const int64_t taken = takeOverRows(*aside, fresh.database.get());
  notes.push_back({"moved_aside", "", taken,
                   why + "; now " + *aside + "; rows taken over: " + std::to_string(taken)});
  return fresh;
}

}  // namespace vx::lnx
