// The journal when a process begins, with what the one before left in it.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "platform/linux/journal/Journal.h"
#include "platform/linux/journal/JournalReader.h"

namespace vx::lnx {

// How many processes may end while they replay a journal, before it is believed to be the cause.
// How far they came is not asked: where one row ends the process, what is committed before it
// differs from one attempt to the next.
inline constexpr uint32_t kMostReplays = 2;

// The store that the calls in a journal belong to, or in one that was moved; none when there are
// none.
std::optional<JournalEpoch> epochOfJournal(const std::string& folder, const std::string& moved);

struct OpenedJournal {
  std::unique_ptr<Journal> journal;
  JournalContents left;                 // to be replayed
  std::vector<std::string> complaints;  // what could not be believed
  bool movedStays = false;              // it could not be taken back: its calls run another time
  uint32_t attempt = 0;                 // to replay `left`; 0 when nothing is left
  // Where journals are now whose replays have all failed, until somebody was told: see told().
  std::vector<std::string> poisoned;
};

// Counts a replay of what is there, and opens the journal behind it. What an ending process moved
// to `moved`, where it had more time, is taken back first. After kMostReplays replays that were
// begun and not ended (endReplay) the journal is moved aside; of those that the service served
// beside (replayServes), four count as one.
Result<OpenedJournal> openJournal(JournalOptions options, const std::string& moved);
// What was left has been replayed, and its rows are committed.
void endReplay(const std::string& folder);
// One that is not ended no longer keeps the service from serving: to be cut short weighs less now.
void replayServes(const std::string& folder);
// It is known that these are poisoned.
void told(const std::vector<std::string>& poisoned);

}  // namespace vx::lnx
