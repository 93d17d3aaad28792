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

}  // namespace

std::optional<JournalEpoch> epochOfJournal(const std::string& folder) {
  const std::vector<SegmentHeader> headers = headersIn(folder);
  if (headers.empty()) return std::nullopt;
  return headers.back().epoch;
}

Result<OpenedJournal> openJournal(JournalOptions options, const std::string& moved) {
  OpenedJournal opened;
  if (!headersIn(moved).empty()) {
    if (const Status back = JournalFolder::moveTo(moved, options.folder); !back.ok())
      opened.complaints.push_back(back.text());
  }
  const std::vector<SegmentHeader> headers = headersIn(options.folder);
  for (const SegmentHeader& header : headers) {
    // Of another store they say nothing, and harm nothing.
    options.first.call = std::max(options.first.call, header.firstCall + kMaxEntriesPerSegment);
  }
  if (!headers.empty() && countReplay(options.folder) > kMostReplays) {
    Result<std::string> aside = JournalFolder::moveAside(options.folder);
    if (!aside.ok()) return aside.status();
    opened.poisoned = std::move(aside).value();
  } else if (!headers.empty()) {
    // Before the journal is opened: that sets aside what is not its own, and says so.
    Result<JournalContents> left = JournalReader::read(options.folder, options.epoch);
    if (left.ok()) opened.left = std::move(left).value();
    if (opened.left.tornBytes > 0)
      opened.complaints.push_back(std::to_string(opened.left.tornBytes) +
                                  " bytes cannot be believed");
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

}  // namespace vx::lnx
