#include "platform/linux/diagnostics/LinuxDiagnosticFiles.h"

#include <dirent.h>
#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>
#include <memory>
#include <system_error>

#include "base/Status.h"
#include "platform/linux/diagnostics/BackgroundWriter.h"

namespace vx::lnx {

namespace {

constexpr mode_t kFileMode = 0644;

constexpr std::string_view kTemporaryPrefix = ".vx";
constexpr std::string_view kTemporarySuffix = ".tmp";
constexpr std::size_t kTemporaryLength = 3 + 1 + 16 + 4;

// "." and 16 hexadecimal digits, and kTemporarySuffix.
std::string randomSuffix() {
  uint64_t bits = 0;
  if (getrandom(&bits, sizeof bits, 0) != sizeof bits) bits = static_cast<uint64_t>(getpid());
  char text[24];
  std::snprintf(text, sizeof text, ".%016llx.tmp", static_cast<unsigned long long>(bits));
  return text;
}

class RenamedFile final : public AtomicFile {
 public:
  RenamedFile(int directoryFd, int fd, std::string name, std::string temporary, std::string where)
      : directoryFd_(directoryFd),
        fd_(fd),
        name_(std::move(name)),
        temporary_(std::move(temporary)),
        where_(std::move(where)) {}
  ~RenamedFile() override {
    large_.reset();
    if (!committed_) unlinkat(directoryFd_, temporary_.c_str(), 0);
    close(fd_);
    close(directoryFd_);
  }

  std::optional<Error> take(std::string& text) override {
    int code = 0;
    if (large_ == nullptr && size_ + text.size() >= kLargeBytes) startLarge();
    if (large_ != nullptr) {
      code = large_->push(text);
    } else {
      code = writeAll(fd_, text);
      size_ += text.size();
    }
    text.clear();
    if (code != 0) return posixError(code, where_);
    return std::nullopt;
  }

  std::optional<Error> commit() override {
    if (large_ != nullptr) {
      if (const int code = large_->finish(); code != 0) return posixError(code, where_);
    }
    // The data must be on disk before the name says so; a large file would otherwise be found empty
    // after a crash.
    if (fchmod(fd_, kFileMode) != 0 || fdatasync(fd_) != 0 ||
        renameat(directoryFd_, temporary_.c_str(), directoryFd_, name_.c_str()) != 0) {
      return posixError(errno, where_);
    }
    committed_ = true;
    // EINVAL: a file system that cannot do this for folders.
    if (fsync(directoryFd_) != 0 && errno != EINVAL) return posixError(errno, where_);
    return std::nullopt;
  }

 private:
  static constexpr std::size_t kLargeBytes = 1 << 20;

  void startLarge() {
    try {
      large_ = std::make_unique<BackgroundWriter>(fd_, size_);
    } catch (const std::system_error&) {
      // No thread to be had: the caller writes, as it does for small files.
    }
  }

  const int directoryFd_;
  const int fd_;
  std::size_t size_ = 0;
  std::unique_ptr<BackgroundWriter> large_;
  const std::string name_;
  const std::string temporary_;
  const std::string where_;
  bool committed_ = false;
};

// One name, and neither this folder nor the one above.
bool isPlainName(const std::string& name) {
  return !name.empty() && name != "." && name != ".." && name.find('/') == std::string::npos &&
         name.find('\0') == std::string::npos;
}

// Opens a folder below `at` without following a link. -1 and errno on failure; ELOOP for a link,
// for which the kernel says ENOTDIR here.
int openFolderAt(int at, const char* name) {
  const int fd = openat(at, name, O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW);
  if (fd >= 0 || errno != ENOTDIR) return fd;
  struct stat status {};
  const bool link = fstatat(at, name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISLNK(status.st_mode);
  errno = link ? ELOOP : ENOTDIR;
  return -1;
}

}  // namespace

int LinuxDiagnosticFiles::openDirectory(const std::string& path, const unsigned* mode,
                                        std::optional<Error>& error) const {
  const std::string& root = logsDirectory_;
  const bool below =
      path.rfind(root, 0) == 0 && (path.size() == root.size() || path[root.size()] == '/');
  if (!below) {
    error = posixError(EINVAL, path + " is not below " + root);
    return -1;
  }
  // The root itself belongs to whoever configured the service, and may well be a link.
  if (mode != nullptr) {
    std::error_code failure;
    std::filesystem::create_directories(root, failure);
    if (failure) {
      error = posixError(failure.value(), root);
      return -1;
    }
  }
  int at = open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
  if (at < 0) {
    error = posixError(errno, root);
    return -1;
  }
  std::string walked = root;
  for (const auto& component : std::filesystem::path(path.substr(root.size())).relative_path()) {
    if (component.empty()) continue;  // a slash at the end
    walked += "/" + component.string();
    if (!isPlainName(component)) {
      error = posixError(EINVAL, walked);
      close(at);
      return -1;
    }
    bool made = false;
    if (mode != nullptr) made = mkdirat(at, component.c_str(), static_cast<mode_t>(*mode)) == 0;
    const int mkdirErrno = errno;
    const int next = openFolderAt(at, component.c_str());
    const int failure = errno;
    close(at);
    if (next < 0) {
      error = posixError(mode != nullptr && !made && mkdirErrno != EEXIST ? mkdirErrno : failure,
                         walked);
      return -1;
    }
    at = next;
    // Whatever the umask took away.
    if (made && fchmod(at, static_cast<mode_t>(*mode)) != 0) {
      error = posixError(errno, walked);
      close(at);
      return -1;
    }
  }
  return at;
}

std::optional<Error> LinuxDiagnosticFiles::createDirectory(const std::string& path, unsigned mode) {
  std::optional<Error> error;
  const int fd = openDirectory(path, &mode, error);
  if (fd >= 0) {
    removeLeftovers(fd, path);
    close(fd);
  }
  return error;
}

// Before this process has written anything there, so every temporary file is of one that ended.
void LinuxDiagnosticFiles::removeLeftovers(int directoryFd, const std::string& path) {
  constexpr int kMostEntries = 10000;  // anybody may have filled the folder
  {
    MutexLock lock(mutex_);
    if (!tidied_.insert(path).second) return;
  }
  DIR* const directory = fdopendir(fcntl(directoryFd, F_DUPFD_CLOEXEC, 0));
  if (directory == nullptr) return;
  for (int i = 0; i < kMostEntries; ++i) {
    const dirent* const entry = readdir(directory);
    if (entry == nullptr) break;
    const std::string_view name = entry->d_name;
    if (name.size() == kTemporaryLength && name.starts_with(kTemporaryPrefix) &&
        name.ends_with(kTemporarySuffix))
      unlinkat(directoryFd, entry->d_name, 0);
  }
  closedir(directory);
}

std::unique_ptr<AtomicFile> LinuxDiagnosticFiles::createAtomically(const std::string& directory,
                                                                   const std::string& name,
                                                                   std::optional<Error>& error) {
  const std::string where = directory + "/" + name;
  if (!isPlainName(name)) {
    error = posixError(EINVAL, where);
    return nullptr;
  }
  const int directoryFd = openDirectory(directory, nullptr, error);
  if (directoryFd < 0) return nullptr;
  const std::string temporary = std::string(kTemporaryPrefix) + randomSuffix();
  const int fd = openat(directoryFd, temporary.c_str(),
                        O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600);
  if (fd < 0) {
    error = posixError(errno, where);
    close(directoryFd);
    return nullptr;
  }
  return std::make_unique<RenamedFile>(directoryFd, fd, name, temporary, where);
}

}  // namespace vx::lnx
