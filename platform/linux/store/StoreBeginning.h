// How a store is begun, at start and again: the lock, the file or one beside it, and what is
// damaged out of the way.
#pragma once

#include <cstdint>
#include <optional>
#include <string>
#include <vector>

#include "base/Function.h"
#include "base/Status.h"
#include "base/UniqueFd.h"
#include "platform/linux/journal/JournalFormat.h"
#include "platform/linux/store/StoreFile.h"
#include "platform/linux/store/StoreIdentity.h"
#include "platform/linux/store/StoreRecord.h"

namespace vx::lnx {

// Owned by the store's writer; used by one thread at a time. "Cannot be read" is not "is damaged":
// only a file that is no database, or whose check finds something, is moved aside.
class StoreBeginning {
 public:
  // `epochOfJournal`: of a journal with calls that are not in the store.
  StoreBeginning(std::string directory, const std::optional<JournalEpoch>& epochOfJournal);

  // False when another process has the store. A lock that cannot be had for another reason is tried
  // again by open().
  bool lock(Status& why);

  // Opens the store without checking it. What was found on the way, for the log and the ledger, is
  // added to `notes`.
  OpenedStore open(std::vector<LedgerNote>& notes);
  // Checks what was opened. A damaged one is moved aside and a fresh one begun, with what can be
  // read of it. `goOn`: see quickCheck().
  OpenedStore check(OpenedStore opened, std::vector<LedgerNote>& notes,
                    Function<bool()> goOn = nullptr);
  // After the files were lost that were open, before they are opened again: what lies in the place
  // of a deleted file is moved aside.
  Status settle(StoreLoss loss, std::vector<LedgerNote>& notes);

  const std::string& path() const { return path_; }
  // Of a journal that an earlier process moved into the folder, and that could not be taken back.
  uint64_t journalBytes() const;
  // That of the first store that was opened. While none could be, calls are recorded under one that
  // was promised, which is marked: the store adopts it as soon as it can be opened, in whichever
  // process, and earlier rows keep their own.
  const JournalEpoch& epoch() const { return epoch_; }
  // The highest number that a call has among the newest rows of what was opened first; 0 for none.
  uint64_t lastCall() const { return lastCall_; }
  // Changes when the rows that were written are no longer those of the store.
  uint32_t stores() const { return stores_; }

 private:
  OpenedStore openFile(std::vector<LedgerNote>& notes);
  OpenedStore beginAfresh(const std::string& why, std::vector<LedgerNote>& notes);

  const std::string directory_;
  std::string path_;
  JournalEpoch epoch_;
  const bool hasJournal_;
  bool epochStays_;
  bool isFirst_ = true;
  uint64_t lastCall_ = 0;
  uint32_t stores_ = 1;
  UniqueFd lock_;
};

}  // namespace vx::lnx
