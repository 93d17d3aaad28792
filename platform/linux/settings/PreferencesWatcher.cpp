#include "platform/linux/settings/PreferencesWatcher.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <filesystem>

#include "platform/Log.h"

namespace vx::lnx {

namespace {

constexpr uint32_t kFolderEvents =
    IN_CREATE | IN_MODIFY | IN_CLOSE_WRITE | IN_ATTRIB | IN_MOVED_FROM | IN_MOVED_TO | IN_DELETE;
constexpr uint32_t kPostEvents = IN_CREATE | IN_ATTRIB | IN_CLOSE_WRITE | IN_MOVED_TO;
constexpr std::chrono::seconds kLongestWait{2};  // however long the changes go on

}  // namespace

PreferencesWatcher::PreferencesWatcher(std::string preferencesFolder, std::string postFolder,
                                       std::vector<Notification> notifications,
                                       const PreferencesOptions& options, Clock& clock)
    : folder_(std::move(preferencesFolder)),
      postFolder_(std::move(postFolder)),
      options_(options),
      clock_(clock),
      folderWatch_(folder_, kFolderEvents),
      postWatch_(postFolder_, kPostEvents) {
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
  if (const Status posts = postWatch_.renew(fd_.get()); !posts.ok())
    VX_LOG(nullptr, Error, "notifications cannot be posted: %s", posts.text().c_str());
  watchFolder();
}

void PreferencesWatcher::watchFolder() {
  if (folderWatch_.renew(fd_.get()).code() == ENOSPC)
    startPolling("no more watches allowed (fs.inotify.max_user_watches)");
  for (Watched& watched : watched_) followLink(watched);
}

// The folder came, went or was replaced, perhaps with a file in it.
void PreferencesWatcher::onFolderMoved() {
  watchFolder();
  for (Watched& watched : watched_) {
    if (signatureOf(watched) != watched.signature) changed(watched);
  }
}

// Whoever made the folder anew may have posted there already.
void PreferencesWatcher::onPostFolderMoved() {
  if (!postWatch_.renew(fd_.get()).ok()) return;
  for (Watched& watched : watched_) {
    std::error_code failure;
    if (std::filesystem::exists(postFolder_ + "/" + watched.notification.name, failure))
      changed(watched);
  }
}

// Looks again where the file really is.
void PreferencesWatcher::followLink(Watched& watched) {
  const std::filesystem::path path = folder_ + "/" + watched.notification.fileName;
  std::error_code failure;
  std::filesystem::path real;
  if (std::filesystem::is_symlink(path, failure)) real = std::filesystem::canonical(path, failure);
  int watch = -1;
  if (!real.empty() && !polling_) {
    watch = inotify_add_watch(fd_.get(), real.parent_path().c_str(),
                              kFolderEvents | IN_ONLYDIR | IN_MASK_ADD);
    if (watch == folderWatch_.id()) watch = -1;
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
  bool folderMoved = false;
  bool postFolderMoved = false;
  ssize_t got = 0;
  while ((got = read(fd_.get(), buffer, sizeof buffer)) > 0) {
    for (char* at = buffer; at < buffer + got;) {
      const auto* event = reinterpret_cast<const inotify_event*>(at);
      at += sizeof(inotify_event) + event->len;
      folderMoved = folderMoved || folderWatch_.concerns(*event);
      postFolderMoved = postFolderMoved || postWatch_.concerns(*event);
      onEvent(*event);
    }
  }
  if (postFolderMoved) onPostFolderMoved();
  if (folderMoved && !polling_) onFolderMoved();
}

void PreferencesWatcher::onEvent(const inotify_event& event) {
  const std::string_view name = event.len > 0 ? event.name : "";
  for (Watched& watched : watched_) {
    const bool posted = postWatch_.isOfFolder(event) && name == watched.notification.name;
    const bool edited = folderWatch_.isOfFolder(event) && !name.empty() &&
                        (name == watched.notification.fileName || name == watched.targetName);
    const bool targetEdited =
        event.wd == watched.targetWatch && !name.empty() && name == watched.targetName;
    if (posted || edited || targetEdited || (event.mask & IN_Q_OVERFLOW) != 0) changed(watched);
  }
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
    watched.signature = signatureOf(watched);
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
