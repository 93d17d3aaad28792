#include "platform/linux/execution/FolderWatch.h"

#include <cerrno>
#include <filesystem>
#include <utility>

namespace vx::lnx {

namespace {

constexpr uint32_t kGone = IN_DELETE_SELF | IN_MOVE_SELF;
constexpr uint32_t kComing = IN_CREATE | IN_MOVED_TO;

}  // namespace

Status FolderWatch::renew(int inotify) {
  const int before = std::exchange(watch_, -1);
  Status problem;
  bool cameMeanwhile = false;
  do {
    std::filesystem::path path = folder_;
    awaited_.clear();
    problem = Status();
    int code = 0;
    for (;;) {
      // IN_MASK_ADD: another one may watch this folder for something else.
      const uint32_t wanted = awaited_.empty() ? events_ : kComing;
      watch_ = inotify_add_watch(inotify, path.c_str(), wanted | kGone | IN_ONLYDIR | IN_MASK_ADD);
      if (watch_ >= 0) break;
      code = errno;
      if (awaited_.empty()) problem = Status::posix("cannot watch " + folder_, code);
      if (!path.has_relative_path()) break;
      awaited_ = path.filename();
      path = path.parent_path();
    }
    std::error_code ignored;
    cameMeanwhile = watch_ >= 0 && !awaited_.empty() && code == ENOENT &&
                    std::filesystem::exists(path / awaited_, ignored);
  } while (cameMeanwhile);
  if (before >= 0 && before != watch_) inotify_rm_watch(inotify, before);
  return problem;
}

bool FolderWatch::concerns(const inotify_event& event) const {
  if ((event.mask & IN_Q_OVERFLOW) != 0) return true;
  if (event.wd != watch_) return false;
  return (event.mask & (kGone | IN_IGNORED)) != 0 ||
         (!awaited_.empty() && event.len > 0 && awaited_ == event.name);
}

}  // namespace vx::lnx
