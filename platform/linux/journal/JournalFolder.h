// The files of a journal.
#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

#include "base/Function.h"
#include "base/Status.h"
#include "base/UniqueFd.h"
#include "platform/linux/journal/JournalFormat.h"

namespace vx::lnx {

// Whether the system could not do what was tried just now, which says nothing of the file.
bool isOfTheMoment(const Status& failure);

// One folder of segments. Trusts nothing in it that is not a regular file of this user which nobody
// else may open, and follows no links. Immutable, so thread-safe; two processes must not write to
// the same folder. Keeps at most kMaxAside files, and as many journals, that were set aside: the
// oldest goes first.
class JournalFolder {
 public:
  static constexpr std::size_t kMaxAside = 4;

  enum class IfMissing { Create, Fail };
  static Result<JournalFolder> open(const std::string& path, IfMissing ifMissing);

  const std::string& path() const { return path_; }
  // In order; whatever lies behind them.
  std::vector<std::string> segments() const;
  // A name that no file here has, from a number; raises the number past it.
  std::string freshSegment(uint64_t& next) const;

  enum class Access { Read, Write };
  // A file that passes the checks, with its header; all zero when the file is free or was never
  // begun.
  struct Opened {
    UniqueFd fd;
    SegmentHeader header{};
    bool blank = false;  // of no size
  };
  Result<Opened> openSegment(const std::string& name, Access access) const;
  // With its first `bytes` allocated, before it has its name: a hole in a file system that has
  // become full is a SIGBUS, and an empty file of that name would say that somebody emptied it.
  Result<UniqueFd> createSegment(const std::string& name, std::size_t bytes) const;
  void remove(const std::string& name) const;
  // Renames a file to name.aside-N, or copies it; false when it could not.
  bool setAside(const std::string& name) const;
  bool copyAside(const std::string& name) const;

  // Counts an attempt to replay what is here, before it begins: how many there were with this one.
  Result<uint32_t> beginAttempt() const;
  // What was replayed is not committed yet and clients are served all the same: should the process
  // end now, it is likely to be for another reason, and weighs less (kWhileServing).
  void noteServing() const;
  bool hasAttempts() const;
  void clearAttempts() const;

  // Renames a whole journal to path.aside-N, which it returns.
  static Result<std::string> moveAside(const std::string& path);
  // Those that were.
  static std::vector<std::string> movedAside(const std::string& path);
  // Moves the segments in use, and the aggregates' files with them, into another folder (made if
  // missing), also of another file system: they are removed here when all of them are durable
  // there. One that is there already (a move was cut short) is not moved again. `onSegment`: told
  // after each. Nothing is moved when it is more than `mostBytes`.
  static Status moveTo(const std::string& from, const std::string& to,
                       const Function<void()>& onSegment = nullptr,
                       uint64_t mostBytes = UINT64_MAX);

 private:
  JournalFolder(std::string path, UniqueFd fd) : path_(std::move(path)), fd_(std::move(fd)) {}
  std::vector<SegmentHeader> headers() const;
  uint64_t bytesToMove() const;
  Status copyFile(int source, const JournalFolder& to, const std::string& as) const;
  Status copyCompanions(const JournalFolder& to, std::vector<std::string>& copied,
                        const Function<void()>& onFile) const;
  Status copySegment(const std::string& name, const JournalFolder& to, const std::string& as) const;
  std::string path_;
  UniqueFd fd_;
};

}  // namespace vx::lnx
