#include "platform/linux/device/InterfaceStateFile.h"

#include <sys/inotify.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "base/FileReading.h"
#include "platform/Log.h"

namespace vx::lnx {

void InterfaceStateFile::start() {
  thread_.assertHere();
  if (inotify_) return;
  const std::filesystem::path folder = path_.parent_path();
  UniqueFd fd(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  if (!fd ||
      inotify_add_watch(fd.get(), folder.c_str(), IN_CLOSE_WRITE | IN_MOVED_TO | IN_ONLYDIR) < 0) {
    const int failure = errno;
    if (!std::exchange(saidFolderIsMissing_, true)) {
      VX_LOG(nullptr, Info, "interface orientation is off for now: cannot watch %s (%s)",
             folder.c_str(), std::strerror(failure));
    }
    return;
  }
  saidFolderIsMissing_ = false;
  inotify_ = std::move(fd);
  read();
}

void InterfaceStateFile::stop() {
  thread_.assertHere();
  inotify_.reset();
  thread_.unbind();
}

void InterfaceStateFile::onReadable() {
  thread_.assertHere();
  alignas(inotify_event) char buffer[4096];
  const std::string name = path_.filename();
  bool changed = false;
  ssize_t got = 0;
  while ((got = ::read(inotify_.get(), buffer, sizeof buffer)) > 0) {
    for (char* at = buffer; at < buffer + got;) {
      const auto* event = reinterpret_cast<const inotify_event*>(at);
      at += sizeof(inotify_event) + event->len;
      changed =
          changed || (event->mask & IN_Q_OVERFLOW) != 0 || (event->len > 0 && name == event->name);
    }
  }
  if (changed) read();
}

void InterfaceStateFile::read() {
  const Result<std::string> text = readRegularFile(path_, kMaxBytes);
  if (!text.ok()) return;
  constexpr const char* kSpace = " \t\r\n";
  const std::size_t first = text->find_first_not_of(kSpace);
  if (first == std::string::npos) return;
  report_(text->substr(first, text->find_last_not_of(kSpace) - first + 1));
}

}  // namespace vx::lnx
