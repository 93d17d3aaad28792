#include "platform/linux/store/StoreBeginning.h"

#include <sys/random.h>
#include <unistd.h>

#include <filesystem>
#include <system_error>
#include <utility>

#include "platform/linux/store/KnownRows.h"
#include "platform/linux/store/Salvage.h"
#include "platform/linux/store/StoreSchema.h"

namespace vx::lnx {

namespace {

constexpr uint8_t kPromised = 0x80;  // in the first byte of an epoch

JournalEpoch randomEpoch() {
  JournalEpoch epoch{};
  (void)getrandom(epoch.data(), epoch.size(), 0);  // never short for so few
  epoch[0] &= static_cast<uint8_t>(~kPromised);
  return epoch;
}

}  // namespace

StoreBeginning::StoreBeginning(std::string directory,
                               const std::optional<JournalEpoch>& epochOfJournal)
    : directory_(std::move(directory)),
      epoch_(epochOfJournal.value_or(randomEpoch())),
      hasJournal_(epochOfJournal.has_value()),
      epochStays_((epoch_[0] & kPromised) != 0) {}

bool StoreBeginning::lock(Status& why) {
  if (lock_) return true;
  StoreLock taken = lockStore(directory_);
  lock_ = std::move(taken.fd);
  why = std::move(taken.status);
  return !taken.heldByAnother;
}

OpenedStore StoreBeginning::open(std::vector<LedgerNote>& notes) {
  OpenedStore opened = openFile(notes);
  // Numbers that are not known to be new are of another epoch.
  if (std::exchange(isFirst_, false) && opened.status.ok()) {
    Result<uint64_t> last = KnownRows::lastCall(opened.database.get());
    if (last.ok())
      lastCall_ = *last;
    else
      opened = {nullptr, last.status(), StoreFault::Unusable, {}};
  }
  if (opened.status.ok() && !epochStays_) epoch_ = opened.epoch;
  if (!opened.status.ok() && !epochStays_ && !hasJournal_) epoch_[0] |= kPromised;
  epochStays_ = true;
  return opened;
}

OpenedStore StoreBeginning::openFile(std::vector<LedgerNote>& notes) {
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

uint64_t StoreBeginning::journalBytes() const {
  uint64_t bytes = 0;
  std::error_code error;
  for (std::filesystem::directory_iterator at(directory_ + "/journal", error), end;
       !error && at != end; at.increment(error)) {
    std::error_code unknown;
    const uintmax_t size = at->file_size(unknown);
    bytes += unknown ? 0 : size;
  }
  return bytes;
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
  // With the rows came the epochs of their keys, where those could be read.
  if (epochOf(fresh.database.get()) != epoch_) {
    if (Status adopted = adoptEpoch(fresh.database.get(), epoch_); !adopted.ok())
      return {nullptr, std::move(adopted), StoreFault::Unusable, {}};
  }
  notes.push_back({"moved_aside", "", taken,
                   why + "; now " + *aside + "; rows taken over: " + std::to_string(taken)});
  return fresh;
}

}  // namespace vx::lnx
