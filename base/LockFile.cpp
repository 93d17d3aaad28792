#include "base/LockFile.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

namespace vx {

namespace {

constexpr mode_t kModes = S_IRUSR | S_IWUSR;

Status belongsTo(const std::string& path, uid_t owner) {
  return Status::failure(path + " belongs to user " + std::to_string(owner) + ", not to " +
                         std::to_string(geteuid()) + ", as whom this runs; remove it");
}

}  // namespace

Result<UniqueFd> openLockFile(const std::string& path) {
  UniqueFd lock(open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC | O_NOFOLLOW | O_NONBLOCK, kModes));
  struct stat file {};
  if (!lock) {
    const Status failed = Status::lastError("cannot open " + path);
    const bool foreign =
        failed.code() == EACCES && lstat(path.c_str(), &file) == 0 && file.st_uid != geteuid();
    return foreign ? belongsTo(path, file.st_uid) : failed;
  }
  if (fstat(lock.get(), &file) != 0) return Status::lastError("cannot look at " + path);
  if (!S_ISREG(file.st_mode)) return Status::failure(path + " is not a regular file; remove it");
  if (file.st_uid != geteuid()) return belongsTo(path, file.st_uid);
  if ((file.st_mode & 07777) != kModes && fchmod(lock.get(), kModes) != 0)
    return Status::lastError("cannot take " + path + " from others");
  return lock;
}

}  // namespace vx
