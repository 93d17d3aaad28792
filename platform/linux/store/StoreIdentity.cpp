#include "platform/linux/store/StoreIdentity.h"

#include <algorithm>
#include <cerrno>
#include <utility>

namespace vx::lnx {

const char* textOf(StoreLoss loss) {
  switch (loss) {
    case StoreLoss::None:
      break;
    case StoreLoss::FileGone:
      return "the store was deleted or replaced under the service";
    case StoreLoss::FileShorter:
      return "the store has lost its end under the service";
    case StoreLoss::LogGone:
      return "the store's log was deleted under the service; what it held is written back";
  }
  return "";
}

StoreIdentity::File::File(const std::string& path) {
  struct stat found {};
  known = stat(path.c_str(), &found) == 0;
  gone = !known && errno == ENOENT;
  if (!known) return;
  device = found.st_dev;
  number = found.st_ino;
  bytes = found.st_size;
}

StoreIdentity::StoreIdentity(std::string path, sqlite3* database)
    : path_(std::move(path)),
      logPath_(path_ + "-wal"),
      database_(database),
      file_(path_),
      log_(logPath_) {}

void StoreIdentity::remember(Shrunk shrunk) {
  File file(path_);
  const File log(logPath_);
  if (compare(file, log) != StoreLoss::None) return;  // said by the next look
  if (shrunk == Shrunk::No) file.bytes = std::max(file.bytes, file_.bytes);
  file_ = file;
  log_ = log;
}

StoreLoss StoreIdentity::compare(const File& file, const File& log) const {
  if (file_.isOther(file)) return StoreLoss::FileGone;
  return log_.isOther(log) ? StoreLoss::LogGone : StoreLoss::None;
}

StoreLoss StoreIdentity::look() const {
  const File file(path_);
  const File log(logPath_);
  const StoreLoss other = compare(file, log);
  if (other != StoreLoss::None) return other;
  if (file.known && file.bytes < file_.bytes) return StoreLoss::FileShorter;
  if (!log.known || log.bytes >= log_.bytes) return StoreLoss::None;
  // Somebody else may have emptied it in order: then all of it is in the file.
  const int code =
      sqlite3_wal_checkpoint_v2(database_, nullptr, SQLITE_CHECKPOINT_PASSIVE, nullptr, nullptr);
  return code == SQLITE_OK || (code & 0xFF) == SQLITE_BUSY ? StoreLoss::None
                                                           : StoreLoss::FileShorter;
}

StoreLoss StoreIdentity::lookForOthers() const { return compare(File(path_), File(logPath_)); }

}  // namespace vx::lnx
