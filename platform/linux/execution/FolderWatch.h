// A watched folder that may come and go.
#pragma once

#include <sys/inotify.h>

#include <cstdint>
#include <string>

#include "base/Status.h"

namespace vx::lnx {

// Watches a folder, and while it is not there the closest one above it that is, for its coming.
// One watch at a time, on the inotify descriptor of its owner, whose thread it lives on. Several
// may use one descriptor, also where their folders are one.
class FolderWatch {
 public:
  // `events`: those wanted of the folder itself.
  FolderWatch(std::string folder, uint32_t events) : folder_(std::move(folder)), events_(events) {}

  // Looks afresh what there is to watch. Why the folder itself cannot be watched, if it cannot.
  Status renew(int inotify);
  // True: the folder may have come, gone or been replaced, and renew() is due.
  bool concerns(const inotify_event& event) const;
  bool isOfFolder(const inotify_event& event) const { return isThere() && event.wd == watch_; }
  bool isThere() const { return watch_ >= 0 && awaited_.empty(); }
  int id() const { return watch_; }

 private:
  const std::string folder_;
  const uint32_t events_;
  int watch_ = -1;
  std::string awaited_;  // what must come in the folder that is watched; empty: it is the folder
};

}  // namespace vx::lnx
