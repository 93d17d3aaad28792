#include "platform/linux/settings/PreferencesWatcher.h"

#include <sys/inotify.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>

#include "platform/Log.h"

namespace vx::lnx {

namespace {

constexpr uint32_t kFolderEvents = IN_CREATE | IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB |
                                   IN_MOVED_FROM | IN_MOVED_TO | IN_DELETE | IN_DELETE_SELF |
                                   IN_MOVE_SELF | IN_ONLYDIR;
constexpr uint32_t kAncestorEvents =
    IN_CREATE | IN_MOVED_TO | IN_DELETE_SELF | IN_MOVE_SELF | IN_ONLYDIR;
constexpr uint32_t kPostEvents = IN_CREATE | IN_ATTRIB | IN_CLOSE_WRITE | IN_MOVED_TO | IN_ONLYDIR;
constexpr std::chrono::seconds kLongestWait{2};  // however long the changes go on

}  // namespace

PreferencesWatcher::PreferencesWatcher(std::string preferencesFolder, std::string postFolder,
                                       std::vector<Notification> notifications,
                                       const PreferencesOptions& options, Clock& clock)
    : folder_(std::move(preferencesFolder)),
      postFolder_(std::move(postFolder)),
      options_(options),
      clock_(clock) {
  for (Notification& notification : notifications) {
    Watched& watched = watched_.emplace_back();
    watched.notification = std::move(notification);
    watched.signature = signatureOf(watched);
  }
}

Result<UniqueFd> PreferencesWatcher::openInotify() {
  UniqueFd fd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  if (!fd) return Status::lastError("inotify");
  return fd;
}

void PreferencesWatcher::start(Result<UniqueFd> inotify) {
  thread_.assertHere();
  if (!inotify.ok()) return startPolling(std::strerror(inotify.status().code()));
  fd_ = std::move(*inotify);
  mkdir(postFolder_.c_str(), 0755);
  postWatch_ = inotify_add_watch(fd_.get(), postFolder_.c_str(), kPostEvents);
  if (postWatch_ < 0) {
    VX_LOG(nullptr, Error, "notifications cannot be posted in %s: %s", postFolder_.c_str(),
           std::strerror(errno));
  }
  watchFolders();
}

void PreferencesWatcher::watchFolders() {
  watchFolder();
  for (Watched& watched : watched_) followLink(watched);
}

// Watches the preferences folder, or as long as it is not there, the closest folder above it that
// is.
void PreferencesWatcher::watchFolder() {
  folderWatch_ = inotify_add_watch(fd_.get(), folder_.c_str(), kFolderEvents);
  if (folderWatch_ < 0 && errno == ENOSPC)
    return startPolling("no more watches allowed (fs.inotify.max_user_watches)");
  if (folderWatch_ >= 0) {
    if (ancestorWatch_ >= 0) inotify_rm_watch(fd_.get(), ancestorWatch_);
    ancestorWatch_ = -1;
    return;
  }
  std::filesystem::path ancestor = folder_;
  do {
    ancestor = ancestor.parent_path();
    ancestorWatch_ = inotify_add_watch(fd_.get(), ancestor.c_str(), kAncestorEvents);
  } while (ancestorWatch_ < 0 && ancestor.has_relative_path());
  // Made between the two looks.
  folderWatch_ = inotify_add_watch(fd_.get(), folder_.c_str(), kFolderEvents);
}

// Looks again where the file really is.
void PreferencesWatcher::followLink(Watched& watched) {
  const std::filesystem::path path = folder_ + "/" + watched.notification.fileName;
  std::error_code failure;
  std::filesystem::path real;
  if (std::filesystem::is_symlink(path, failure)) real = std::filesystem::canonical(path, failure);
  int watch = -1;
  if (!real.empty() && !polling_) {
    watch = inotify_add_watch(fd_.get(), real.parent_path().c_str(), kFolderEvents);
    if (watch == folderWatch_) watch = -1;
  }
  if (watched.targetWatch >= 0 && watched.targetWatch != watch)
    inotify_rm_watch(fd_.get(), watched.targetWatch);
  watched.targetWatch = watch;
  watched.targetName = real.filename();
}

void PreferencesWatcher::startPolling(const char* why) {
  polling_ = true;
  nextPoll_ = clock_.monotonic() + options_.pollInterval;
  VX_LOG(nullptr, Error,
         "changes of the preferences cannot be watched (%s); looking every %lld ms instead", why,
         static_cast<long long>(options_.pollInterval.count()));
}

uint32_t PreferencesWatcher::registerHandler(std::string_view name, int& token,
                                             std::shared_ptr<WorkQueue> queue,
                                             Function<void(int)> handler) {
  thread_.assertHere();
  if (queue == nullptr || !handler) return EINVAL;
  token = nextToken_++;
  registrations_.push_back({std::string(name), token, std::move(queue),
                            std::make_shared<Function<void(int)>>(std::move(handler))});
  return kStatusOk;
}

void PreferencesWatcher::onReadable() {
  thread_.assertHere();
  alignas(inotify_event) char buffer[4096];
  bool foldersMoved = false;
  ssize_t got = 0;
  while ((got = read(fd_.get(), buffer, sizeof buffer)) > 0) {
    for (char* at = buffer; at < buffer + got;) {
      const auto* event = reinterpret_cast<const inotify_event*>(at);
      at += sizeof(inotify_event) + event->len;
      foldersMoved = onEvent(*event) || foldersMoved;
    }
  }
  if (!foldersMoved || polling_) return;
  // The folder came, went or was replaced: its files may all be others now.
  if (folderWatch_ >= 0) inotify_rm_watch(fd_.get(), folderWatch_);
  folderWatch_ = -1;
  watchFolders();
  for (Watched& watched : watched_) changed(watched);
}

bool PreferencesWatcher::onEvent(const inotify_event& event) {
  const std::string_view name = event.len > 0 ? event.name : "";
  if (event.mask & IN_Q_OVERFLOW) {
    for (Watched& watched : watched_) changed(watched);
  } else if (event.wd == postWatch_) {
    const bool known = std::any_of(registrations_.begin(), registrations_.end(),
                                   [&](const Registration& r) { return r.name == name; });
    if (known) fire(std::string(name));
  } else if (event.mask & (IN_DELETE_SELF | IN_MOVE_SELF | IN_IGNORED)) {
    return event.wd == folderWatch_ || event.wd == ancestorWatch_;
  } else if (event.wd == folderWatch_) {
    for (Watched& watched : watched_) {
      if (name == watched.notification.fileName || (!name.empty() && name == watched.targetName))
        changed(watched);
    }
  } else if (const auto target = std::find_if(
                 watched_.begin(), watched_.end(),
                 [&](const Watched& watched) { return watched.targetWatch == event.wd; });
             target != watched_.end()) {
    if (name == target->targetName) changed(*target);
  } else {
    return event.wd == ancestorWatch_;
  }
  return false;
}

void PreferencesWatcher::changed(Watched& watched) {
  watched.lastChange = clock_.monotonic();
  if (!watched.firstChange) watched.firstChange = watched.lastChange;
}

std::string PreferencesWatcher::signatureOf(const Watched& watched) const {
  struct stat status {};
  const std::string path = folder_ + "/" + watched.notification.fileName;
  if (stat(path.c_str(), &status) != 0) return "";
  return std::to_string(status.st_ino) + ":" + std::to_string(status.st_size) + ":" +
         std::to_string(status.st_mtim.tv_sec) + "." + std::to_string(status.st_mtim.tv_nsec);
}

std::optional<Monotonic> PreferencesWatcher::nextDue() const {
  std::optional<Monotonic> earliest;
  if (polling_) earliest = nextPoll_;
  for (const Watched& watched : watched_) {
    if (!watched.firstChange) continue;
    const Monotonic due = std::min<Monotonic>(watched.lastChange + options_.settle,
                                              *watched.firstChange + kLongestWait);
    if (!earliest || due < *earliest) earliest = due;
  }
  return earliest;
}

void PreferencesWatcher::onDue() {
  thread_.assertHere();
  const Monotonic now = clock_.monotonic();
  if (polling_ && nextPoll_ <= now) {
    nextPoll_ = now + options_.pollInterval;
    for (Watched& watched : watched_) {
      std::string signature = signatureOf(watched);
      if (signature != watched.signature) changed(watched);
      watched.signature = std::move(signature);
    }
  }
  for (Watched& watched : watched_) {
    if (!watched.firstChange) continue;
    if (now < watched.lastChange + options_.settle && now < *watched.firstChange + kLongestWait)
      continue;
    watched.firstChange.reset();
    followLink(watched);
    fire(watched.notification.name);
  }
}

void PreferencesWatcher::fire(const std::string& name) {
  if (beforeFire_) beforeFire_(name);
  poster_(name, [&] {
    for (const Registration& registration : registrations_) {
      if (registration.name != name) continue;
      registration.queue->async(
          [handler = registration.handler, token = registration.token] { (*handler)(token); });
    }
  });
}

}  // namespace vx::lnx
