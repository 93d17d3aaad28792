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

// Written under a temporary name, renamed by commit(). Owned by who asked for it, confined to the
// thread that uses it. Past kLargeBytes a thread of its own writes.
class RenamedFile final : public AtomicFile {
 public:
  RenamedFile(UniqueFd directory, UniqueFd file, std::string name, std::string temporary,
              std::string where)
      : directory_(std::move(directory)),
        file_(std::move(file)),
        name_(std::move(name)),
        temporary_(std::move(temporary)),
        where_(std::move(where)) {}
  ~RenamedFile() override {
    large_.reset();
    if (!committed_) unlinkat(directory_.get(), temporary_.c_str(), 0);
  }

  std::optional<Error> take(std::string& text) override {
    if (large_ == nullptr && size_ + text.size() >= kLargeBytes) startLarge();
    const std::size_t size = text.size();
    const Status status = large_ != nullptr ? large_->push(text) : writeAll(file_.get(), text);
    size_ += size;
    text.clear();
    return errorOf(status);
  }

  std::optional<Error> commit() override {
    if (large_ != nullptr) {
      if (const Status status = large_->finish(); !status.ok()) return errorOf(status);
    }
    // The data must be on disk before the name says so; a large file would otherwise be found empty
    // after a crash.
    if (fchmod(file_.get(), kFileMode) != 0 || fdatasync(file_.get()) != 0 ||
        renameat(directory_.get(), temporary_.c_str(), directory_.get(), name_.c_str()) != 0) {
      return posixError(errno, where_);
    }
    committed_ = true;
    // EINVAL: a file system that cannot do this for folders.
    if (fsync(directory_.get()) != 0 && errno != EINVAL) return posixError(errno, where_);
    return std::nullopt;
  }

 private:
  static constexpr std::size_t kLargeBytes = 1 << 20;

  std::optional<Error> errorOf(const Status& status) const {
    if (status.ok()) return std::nullopt;
    return posixError(status.code(), where_);
  }
  void startLarge() {
    try {
      large_ = std::make_unique<BackgroundWriter>(file_.get(), size_);
    } catch (const std::system_error&) {
      // No thread to be had: the caller writes, as it does for small files.
    }
  }

  const UniqueFd directory_;
  const UniqueFd file_;
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

// Opens a folder below `at` without following a link. Code ELOOP for a link, for which the kernel
// says ENOTDIR here.
Result<UniqueFd> openFolderAt(int at, const char* name, std::string_view path) {
  UniqueFd folder(openat(at, name, O_RDONLY | O_DIRECTORY | O_CLOEXEC | O_NOFOLLOW));
  if (folder) return folder;
  if (errno != ENOTDIR) return Status::lastError(path);
  struct stat status {};
  const bool link = fstatat(at, name, &status, AT_SYMLINK_NOFOLLOW) == 0 && S_ISLNK(status.st_mode);
  return Status::posix(path, link ? ELOOP : ENOTDIR);
}

// The same, made first when there is nothing of that name. `mode` holds whatever the umask says.
Result<UniqueFd> makeFolderAt(int at, const char* name, mode_t mode, std::string_view path) {
  const bool made = mkdirat(at, name, mode) == 0;
  const int failure = made ? 0 : errno;
  Result<UniqueFd> folder = openFolderAt(at, name, path);
  if (!folder.ok() && !made && failure != EEXIST) return Status::posix(path, failure);
  if (folder.ok() && made && fchmod(folder->get(), mode) != 0) return Status::lastError(path);
  return folder;
}

}  // namespace

Result<UniqueFd> LinuxDiagnosticFiles::openDirectory(const std::string& path,
                                                     std::optional<mode_t> mode) const {
  const std::string& root = logsDirectory_;
  const bool below =
      path.starts_with(root) && (path.size() == root.size() || path[root.size()] == '/');
  if (!below) return Status::posix(path + " is not below " + root, EINVAL);
  // The root itself belongs to whoever configured the service, and may well be a link.
  if (mode) {
    std::error_code failure;
    std::filesystem::create_directories(root, failure);
    if (failure) return Status::posix(root, failure.value());
  }
  UniqueFd at(open(root.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC));
  if (!at) return Status::lastError(root);
  std::string walked = root;
  for (const auto& component : std::filesystem::path(path.substr(root.size())).relative_path()) {
    if (component.empty()) continue;  // a slash at the end
    walked += "/" + component.string();
    if (!isPlainName(component)) return Status::posix(walked, EINVAL);
    Result<UniqueFd> next = mode ? makeFolderAt(at.get(), component.c_str(), *mode, walked)
                                 : openFolderAt(at.get(), component.c_str(), walked);
    if (!next.ok()) return next;
    at = std::move(*next);
  }
  return at;
}

std::optional<Error> LinuxDiagnosticFiles::createDirectory(const std::string& path, unsigned mode) {
  // Where anybody may write, nobody may delete or replace what is another's.
  if ((mode & S_IWOTH) != 0) mode |= S_ISVTX;
  const Result<UniqueFd> directory = openDirectory(path, static_cast<mode_t>(mode));
  if (!directory.ok()) return directory.status().error();
  removeLeftovers(directory->get(), path);
  return std::nullopt;
}

// Before this process has written anything there, so every temporary file is of one that ended.
void LinuxDiagnosticFiles::removeLeftovers(int directoryFd, const std::string& path) {
  constexpr int kMostEntries = 10000;  // anybody may have filled the folder
  {
    MutexLock lock(mutex_);
    if (!tidied_.insert(path).second) return;
  }
  UniqueFd own(fcntl(directoryFd, F_DUPFD_CLOEXEC, 0));
  const std::unique_ptr<DIR, int (*)(DIR*)> directory(fdopendir(own.get()), closedir);
  if (directory == nullptr) return;
  (void)own.release();  // closedir closes it
  for (int i = 0; i < kMostEntries; ++i) {
    const dirent* const entry = readdir(directory.get());
    if (entry == nullptr) break;
    const std::string_view name = entry->d_name;
    if (name.size() == kTemporaryLength && name.starts_with(kTemporaryPrefix) &&
        name.ends_with(kTemporarySuffix))
      unlinkat(directoryFd, entry->d_name, 0);
  }
}

std::unique_ptr<AtomicFile> LinuxDiagnosticFiles::createAtomically(const std::string& directory,
                                                                   const std::string& name,
                                                                   std::optional<Error>& error) {
  const std::string where = directory + "/" + name;
  if (!isPlainName(name)) {
    error = posixError(EINVAL, where);
    return nullptr;
  }
  Result<UniqueFd> folder = openDirectory(directory, std::nullopt);
  if (!folder.ok()) {
    error = folder.status().error();
    return nullptr;
  }
  const std::string temporary = std::string(kTemporaryPrefix) + randomSuffix();
  UniqueFd file(openat(folder->get(), temporary.c_str(),
                       O_WRONLY | O_CREAT | O_EXCL | O_CLOEXEC | O_NOFOLLOW, 0600));
  if (!file) {
    error = posixError(errno, where);
    return nullptr;
  }
  return std::make_unique<RenamedFile>(std::move(*folder), std::move(file), name, temporary, where);
}

}  // namespace vx::lnx
