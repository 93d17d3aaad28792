#include "platform/linux/LinuxDiagnosticFiles.h"

#include <fcntl.h>
#include <sys/random.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdio>
#include <filesystem>

#include "platform/linux/FileReading.h"

namespace vx::lnx {

namespace {

constexpr mode_t kFileMode = 0644;

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
    if (!committed_) unlinkat(directoryFd_, temporary_.c_str(), 0);
    close(fd_);
    close(directoryFd_);
  }

  std::optional<Error> write(std::string_view text) override {
    while (!text.empty()) {
      const ssize_t written = ::write(fd_, text.data(), text.size());
      if (written < 0 && errno == EINTR) continue;
      if (written < 0) return posixError(errno, where_);
      text.remove_prefix(static_cast<std::size_t>(written));
      size_ += written;
    }
    // A large file starts on its way to the disk while it is being written, so that commit() has
    // less to wait for. A hint: what comes of it is commit()'s to find out.
    if (size_ - handedOver_ >= kHandOverBytes) {
      (void)sync_file_range(fd_, handedOver_, size_ - handedOver_, SYNC_FILE_RANGE_WRITE);
      handedOver_ = size_;
    }
    return std::nullopt;
  }

  std::optional<Error> commit() override {
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
  static constexpr off_t kHandOverBytes = 4 << 20;

  const int directoryFd_;
  const int fd_;
  off_t size_ = 0;
  off_t handedOver_ = 0;
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
  if (fd >= 0) close(fd);
  return error;
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
  const std::string temporary = ".vx" + randomSuffix();
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
