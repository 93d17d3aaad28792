// The file in which a session agent says how the user interface is oriented.
#pragma once

#include <filesystem>
#include <string>
#include <string_view>

#include "base/Function.h"
#include "base/ThreadChecker.h"
#include "base/UniqueFd.h"
#include "platform/linux/execution/FolderWatch.h"

namespace vx::lnx {

// One word of at most kMaxBytes, for example "portrait" or "landscape-left". The file's folder is
// watched, so it may be written in place or renamed over, and the folder may come and go. Owned by
// the orientation notifier, confined to the thread that uses it between start() and stop().
class InterfaceStateFile {
 public:
  static constexpr std::size_t kMaxBytes = 64;

  // `report` is told the word each time the file may have changed.
  InterfaceStateFile(const std::string& path, Function<void(const std::string& word)> report)
      : path_(path), report_(std::move(report)) {}

  // Begins to watch and reads the file, unless it watches already. A folder that is missing is
  // waited for, and logged once, and again only after it had been there.
  void start();
  void stop();
  int fd() const { return inotify_.get(); }  // to be polled for input; -1 while not watching
  void onReadable();

 private:
  void watch() REQUIRES(thread_);
  void read() REQUIRES(thread_);

  const std::filesystem::path path_;
  const Function<void(const std::string&)> report_;
  ThreadChecker thread_;
  UniqueFd inotify_;
  FolderWatch folder_ GUARDED_BY(thread_){path_.parent_path(), IN_CLOSE_WRITE | IN_MOVED_TO};
  bool saidFolderIsMissing_ GUARDED_BY(thread_) = false;
};

// The file's text without the space around it; empty when there is nothing else.
std::string_view orientationWord(std::string_view text);

}  // namespace vx::lnx
