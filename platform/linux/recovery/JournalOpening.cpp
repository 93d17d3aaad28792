#include "platform/linux/recovery/JournalOpening.h"

#include <algorithm>
#include <utility>

namespace vx::lnx {

namespace {

using Opened = JournalFolder::Opened;

// The headers of the segments that hold something.
std::vector<SegmentHeader> headersIn(const std::string& path) {
  std::vector<SegmentHeader> headers;
  const Result<JournalFolder> folder = JournalFolder::open(path, JournalFolder::IfMissing::Fail);
  if (!folder.ok()) return headers;
  for (const std::string& name : folder->segments()) {
    const Result<Opened> opened = folder->openSegment(name, JournalFolder::Access::Read);
    if (opened.ok() && opened->header.state == SegmentHeader::kInUse)
      headers.push_back(opened->header);
  }
  return headers;
}

uint32_t countReplay(const std::string& path) {
  const Result<JournalFolder> folder = JournalFolder::open(path, JournalFolder::IfMissing::Fail);
  if (!folder.ok()) return 1;
  const Result<uint32_t> attempt = folder->beginAttempt();
  return attempt.ok() ? *attempt : 1;
}

// The files themselves are used again, some time.
void keepTorn(const std::string& path, const JournalContents& left,
              std::vector<std::string>& complaints) {
  const Result<JournalFolder> folder = JournalFolder::open(path, JournalFolder::IfMissing::Fail);
  for (const std::string& name : left.torn) {
    const bool kept = folder.ok() && folder->copyAside(name);
    complaints.push_back(name + " is damaged: of " + std::to_string(left.tornBytes) +
                         " bytes in all it cannot be said what was accepted" +
                         (kept ? "; a copy is set aside" : "; it could not be copied"));
  }
}

}  // namespace

std::optional<JournalEpoch> epochOfJournal(const std::string& folder, const std::string& moved) {
  std::vector<SegmentHeader> headers = headersIn(folder);
  if (headers.empty()) headers = headersIn(moved);
  if (headers.empty()) return std::nullopt;
  return headers.back().epoch;
}

Result<OpenedJournal> openJournal(JournalOptions options, const std::string& moved) {
  OpenedJournal opened;
  if (!headersIn(moved).empty()) {
    const Status back = JournalFolder::moveTo(moved, options.folder);
    if (!back.ok()) opened.complaints.push_back(back.text());
    opened.movedStays = !back.ok();
  }
  const std::vector<SegmentHeader> headers = headersIn(options.folder);
  // Of another store they say nothing, and harm nothing.
  for (const SegmentHeader& header : headers) options.first.goPast(header);
  for (const SegmentHeader& header : headersIn(moved)) options.first.goPast(header);
  for (const std::string& aside : JournalFolder::movedAside(options.folder))
    for (const SegmentHeader& header : headersIn(aside)) options.first.goPast(header);
  if (!headers.empty()) opened.attempt = countReplay(options.folder);
  if (opened.attempt > kMostReplays) {
    opened.attempt = 0;
    Result<std::string> aside = JournalFolder::moveAside(options.folder);
    if (!aside.ok()) return aside.status();
  } else if (!headers.empty()) {
    // Before the journal is opened: that sets aside what is not its own, and says so.
    Result<JournalContents> left = JournalReader::read(options.folder, options.epoch);
    if (!left.ok()) return left.status();  // it stays for another process
    opened.left = std::move(left).value();
    keepTorn(options.folder, opened.left, opened.complaints);
  }
  // One that an earlier process moved, which ended before it could say so, still has its count.
  for (const std::string& aside : JournalFolder::movedAside(options.folder)) {
    const Result<JournalFolder> folder = JournalFolder::open(aside, JournalFolder::IfMissing::Fail);
    if (folder.ok() && folder->hasAttempts()) opened.poisoned.push_back(aside);
  }
  Result<std::unique_ptr<Journal>> journal = Journal::open(options, &opened.complaints);
  if (!journal.ok()) return journal.status();
  opened.journal = std::move(journal).value();
  return opened;
}

void endReplay(const std::string& path) {
  const Result<JournalFolder> folder = JournalFolder::open(path, JournalFolder::IfMissing::Fail);
  if (folder.ok()) folder->clearAttempts();
}

void replayServes(const std::string& path) {
  const Result<JournalFolder> folder = JournalFolder::open(path, JournalFolder::IfMissing::Fail);
  if (folder.ok()) folder->noteServing();
}

void told(const std::vector<std::string>& poisoned) {
  for (const std::string& path : poisoned) endReplay(path);
}

}  // namespace vx::lnx
