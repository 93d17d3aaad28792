#include "platform/linux/device/InterfaceStateFile.h"

#include <unistd.h>

#include <utility>

#include "base/FileReading.h"
#include "platform/Log.h"

namespace vx::lnx {

void InterfaceStateFile::start() {
  thread_.assertHere();
  if (inotify_ && folder_.isThere()) return;
  watch();
}

void InterfaceStateFile::watch() {
  if (!inotify_) inotify_.reset(inotify_init1(IN_NONBLOCK | IN_CLOEXEC));
  const Status watched = inotify_ ? folder_.renew(inotify_.get()) : Status::lastError("inotify");
  if (watched.ok()) {
    saidFolderIsMissing_ = false;
    read();
  } else if (!std::exchange(saidFolderIsMissing_, true)) {
    VX_LOG(nullptr, Info, "interface orientation is off for now: %s", watched.text().c_str());
  }
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
  bool folderMoved = false;
  ssize_t got = 0;
  while ((got = ::read(inotify_.get(), buffer, sizeof buffer)) > 0) {
    for (char* at = buffer; at < buffer + got;) {
      const auto* event = reinterpret_cast<const inotify_event*>(at);
      at += sizeof(inotify_event) + event->len;
      folderMoved = folderMoved || folder_.concerns(*event);
      changed = changed || (folder_.isOfFolder(*event) && event->len > 0 && name == event->name);
    }
  }
  if (folderMoved)
    watch();  // reads, too
  else if (changed)
    read();
}

void InterfaceStateFile::read() {
  const Result<std::string> text = readRegularFile(path_, kMaxBytes);
  const std::string_view word = text.ok() ? orientationWord(*text) : "";
  if (!word.empty()) report_(std::string(word));
}

std::string_view orientationWord(std::string_view text) {
  constexpr const char* kSpace = " \t\r\n";
  const std::size_t first = text.find_first_not_of(kSpace);
  if (first == std::string_view::npos) return {};
  return text.substr(first, text.find_last_not_of(kSpace) - first + 1);
}

}  // namespace vx::lnx
