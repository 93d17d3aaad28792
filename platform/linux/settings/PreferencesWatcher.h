// Named notifications, fired when a preferences file changed or when somebody posts them.
#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "base/Clock.h"
#include "base/Status.h"
#include "base/ThreadChecker.h"
#include "base/UniqueFd.h"
#include "platform/Preferences.h"
#include "platform/linux/execution/FolderWatch.h"
#include "platform/linux/settings/PreferencesOptions.h"

namespace vx::lnx {

// A notification fires when its file in the preferences folder changed, however it was edited, once
// it has been left alone for the settle time (at the latest two seconds after the first change), so
// never on a file that is being written. And it fires when a file of its own name is created or
// touched in <runtime>/notify, which is how a tool posts it: `touch
// /run/vxreporting/notify/com.quorvel.sonik.reporting`. Tools differ in the steps in which they do
// that, so a post settles as well. Either folder may come and go.
//
// Where the file is a symbolic link, the file that it leads to is watched as well.
//
// Owned by LinuxPlatform. Driven by the event loop and confined to its thread: no thread of its
// own, no timer while nothing has changed. Where inotify cannot be had, the file is looked at every
// few seconds, and one log line says so.
class PreferencesWatcher final : public SystemNotify {
 public:
  struct Notification {
    std::string name;
    std::string fileName;  // in the preferences folder
  };

  PreferencesWatcher(std::string preferencesFolder, std::string postFolder,
                     std::vector<Notification> notifications, const PreferencesOptions& options,
                     Clock& clock);
  ~PreferencesWatcher() override = default;
  PreferencesWatcher(const PreferencesWatcher&) = delete;
  PreferencesWatcher& operator=(const PreferencesWatcher&) = delete;

  // Begins to watch with a fresh inotify descriptor, or without one to poll. Logs, so the platform
  // must be installed.
  void start(Result<UniqueFd> inotify);
  static Result<UniqueFd> openInotify();

  uint32_t registerHandler(std::string_view name, int& token, std::shared_ptr<WorkQueue> queue,
                           Function<void(int token)> handler) override;

  // Called before the handlers of a notification are told.
  void setBeforeFire(Function<void(std::string_view name)> hook) { beforeFire_ = std::move(hook); }
  // Runs the posting of a notification to its handlers' queues; for whoever must know of it first.
  using Post = Function<void()>;
  void setPoster(Function<void(std::string_view name, const Post& post)> poster) {
    poster_ = std::move(poster);
  }
  int fd() const { return fd_.get(); }  // -1 when inotify cannot be had
  void onReadable();
  std::optional<Monotonic> nextDue() const;
  void onDue();

 private:
  struct Watched {
    Notification notification;
    std::optional<Monotonic> firstChange;
    Monotonic lastChange{};
    std::string signature;   // what the file looked like
    int targetWatch = -1;    // the folder of the file that a link leads to, when it is another one
    std::string targetName;  // that file's name; empty while the file is no link
  };
  struct Registration {
    std::string name;
    int token;
    std::shared_ptr<WorkQueue> queue;
    std::shared_ptr<Function<void(int)>> handler;
  };

  void watchFolder();
  void onFolderMoved();
  void onPostFolderMoved();
  void followLink(Watched& watched);
  void startPolling(const char* why);
  void onEvent(const inotify_event& event);
  void changed(Watched& watched);
  void fire(const std::string& name);
  std::string signatureOf(const Watched& watched) const;

  const std::string folder_;
  const std::string postFolder_;
  const PreferencesOptions options_;
  Clock& clock_;
  ThreadChecker thread_;
  Function<void(std::string_view)> beforeFire_;
  Function<void(std::string_view, const Post&)> poster_ = [](std::string_view, const Post& post) {
    post();
  };
  std::vector<Watched> watched_;
  std::vector<Registration> registrations_;  // a handful, made at start-up
  int nextToken_ = 1;
  UniqueFd fd_;
  FolderWatch folderWatch_;
  FolderWatch postWatch_;
  bool polling_ = false;
  Monotonic nextPoll_{};
};

}  // namespace vx::lnx
