// Loaded into the daemon with LD_PRELOAD by the fault programs: makes calls on chosen files fail,
// slow or fatal, and records what reaches them. The environment says what it does:
//
//   VX_SHIM_MATCH=P[:P..]   the files whose paths begin so
//   VX_SHIM_FAULT=K,E,F,N   calls of kinds K (their letters below) fail with errno E (0: only half
//   is written)
//                           from the F-th on (1 is the first), N times (0: for ever)
//   VX_SHIM_WHILE=PATH      they fail, or are slow, only while this file is there
//   VX_SHIM_SYNC_MS=A,B     every sync takes A to B ms longer
//   VX_SHIM_ABORT=TEXT      a write that holds this text ends the process
//   VX_SHIM_RECORD=PATH     what was done, in order: RecordHeader, then the bytes or the path
//
// Made of system calls, so that it calls nothing that it replaces.
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <sys/uio.h>
#include <unistd.h>

#include <atomic>
#include <cerrno>
#include <cstdarg>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <mutex>
#include <random>
#include <string>
#include <string_view>

namespace {

constexpr int kMostFiles = 1 << 16;

struct RecordHeader {
  // open, read, write, sync, truncate, allocate, map, rename (n), unlink; t: its length has become
  // offset
  uint32_t kind;
  uint32_t fd;    // of o, w, s and t
  uint64_t size;  // of what follows
  uint64_t offset;
  uint64_t seconds;  // CLOCK_MONOTONIC
  uint64_t nanoseconds;
};

const char* setting(const char* name) {
  const char* value = std::getenv(name);
  return value == nullptr ? "" : value;
}
int openFile(const char* path, int flags) {
  return static_cast<int>(syscall(SYS_openat, AT_FDCWD, path, flags | O_CREAT | O_CLOEXEC, 0600));
}

struct Shim {
  const std::string match = setting("VX_SHIM_MATCH");
  const std::string whilePath = setting("VX_SHIM_WHILE");
  const std::string abortText = setting("VX_SHIM_ABORT");
  const int record = openFile(setting("VX_SHIM_RECORD"), O_WRONLY | O_APPEND);
  char faultKinds[16] = "";
  int faultErrno = 0;
  unsigned long faultFirst = 0, faultTimes = 0;
  long fastest = 0, slowest = 0;
  std::atomic<uint64_t> candidates{0};
  std::mutex order;  // one call at a time: the record has their order
  std::atomic<bool> files[kMostFiles] = {};

  Shim() {
    std::sscanf(setting("VX_SHIM_FAULT"), "%15[^,],%d,%lu,%lu", faultKinds, &faultErrno,
                &faultFirst, &faultTimes);
    std::sscanf(setting("VX_SHIM_SYNC_MS"), "%ld,%ld", &fastest, &slowest);
  }
  bool matches(std::string_view path) const {
    for (std::string_view rest = match; !rest.empty();) {
      const std::string_view one = rest.substr(0, rest.find(':'));
      if (path.starts_with(one)) return true;
      rest.remove_prefix(std::min(rest.size(), one.size() + 1));
    }
    return false;
  }
  bool isMeantNow() const {
    return whilePath.empty() || syscall(SYS_faccessat, AT_FDCWD, whilePath.c_str(), F_OK) == 0;
  }
  bool has(int fd) const { return fd >= 0 && fd < kMostFiles && files[fd].load(); }

  // Counts a call and sets errno if it is to fail; to 0 if half of it is to be done.
  bool fails(char kind, bool watched) {
    if (!watched) return false;
    const bool meant = std::string_view(faultKinds).find(kind) != std::string_view::npos;
    if (!meant || (faultErrno == 0 && kind != 'w')) return false;
    const uint64_t number = ++candidates;
    if (number < faultFirst || (faultTimes != 0 && number >= faultFirst + faultTimes)) return false;
    if (!isMeantNow()) return false;
    errno = faultErrno;
    return true;
  }
  void note(char kind, int fd, off_t offset, std::string_view bytes) const {
    if (record < 0) return;
    timespec now{};
    clock_gettime(CLOCK_MONOTONIC, &now);
    RecordHeader header{static_cast<uint32_t>(kind),
                        static_cast<uint32_t>(fd),
                        bytes.size(),
                        static_cast<uint64_t>(offset),
                        static_cast<uint64_t>(now.tv_sec),
                        static_cast<uint64_t>(now.tv_nsec)};
    const iovec parts[] = {{&header, sizeof header},
                           {const_cast<char*>(bytes.data()), bytes.size()}};
    if (syscall(SYS_writev, record, parts, 2) < 0) std::abort();
  }
};

Shim& shim() {
  static Shim* const only = new Shim;  // for as long as the process runs
  return *only;
}

std::string pathIn(int folder, const char* path) {
  if (path[0] == '/' || folder == AT_FDCWD) return path;
  char text[4096];
  const std::string link = "/proc/self/fd/" + std::to_string(folder);
  const long size = syscall(SYS_readlinkat, AT_FDCWD, link.c_str(), text, sizeof text);
  return size < 0 ? path : std::string(text, static_cast<std::size_t>(size)) + "/" + path;
}

int openIn(int folder, const char* path, int flags, va_list rest) {
  const mode_t mode = (flags & O_CREAT) != 0 ? va_arg(rest, mode_t) : 0;
  const std::string whole = pathIn(folder, path);
  const bool watched = shim().matches(whole);
  const bool onlyReads = (flags & (O_ACCMODE | O_CREAT)) == O_RDONLY;
  if (!(onlyReads && shim().faultErrno == EROFS) && shim().fails('o', watched)) return -1;
  const std::lock_guard lock(shim().order);
  const int fd = static_cast<int>(syscall(SYS_openat, folder, path, flags, mode));
  if (fd >= 0 && fd < kMostFiles) shim().files[fd] = watched;
  if (shim().has(fd)) shim().note('o', fd, 0, whole);
  return fd;
}

int syncWith(long call, int fd) {
  if (shim().has(fd) && shim().slowest != 0 && shim().isMeantNow()) {
    thread_local std::minstd_rand random{std::random_device{}()};
    const long ms = std::uniform_int_distribution(shim().fastest, shim().slowest)(random);
    const timespec time{ms / 1000, ms % 1000 * 1000000};
    nanosleep(&time, nullptr);
  }
  if (shim().fails('s', shim().has(fd))) return -1;
  const std::lock_guard lock(shim().order);
  if (shim().has(fd)) shim().note('s', fd, 0, {});
  return static_cast<int>(syscall(call, fd));
}

// What changes a file's length.
int resize(char kind, int fd, long call, off_t first, off_t second, off_t third) {
  if (shim().fails(kind, shim().has(fd))) return -1;
  const std::lock_guard lock(shim().order);
  const int code = static_cast<int>(syscall(call, fd, first, second, third));
  struct stat status {};
  if (code == 0 && shim().has(fd) && fstat(fd, &status) == 0)
    shim().note('t', fd, status.st_size, {});
  return code;
}

}  // namespace

extern "C" {

int open(const char* path, int flags, ...) {
  va_list rest;
  va_start(rest, flags);
  const int fd = openIn(AT_FDCWD, path, flags, rest);
  va_end(rest);
  return fd;
}
int openat(int folder, const char* path, int flags, ...) {
  va_list rest;
  va_start(rest, flags);
  const int fd = openIn(folder, path, flags, rest);
  va_end(rest);
  return fd;
}
ssize_t read(int fd, void* data, std::size_t size) {
  return shim().fails('r', shim().has(fd)) ? -1 : syscall(SYS_read, fd, data, size);
}
ssize_t pread(int fd, void* data, std::size_t size, off_t offset) {
  return shim().fails('r', shim().has(fd)) ? -1 : syscall(SYS_pread64, fd, data, size, offset);
}
ssize_t pwrite(int fd, const void* data, std::size_t size, off_t offset) {
  if (!shim().has(fd)) return syscall(SYS_pwrite64, fd, data, size, offset);
  const std::string_view bytes(static_cast<const char*>(data), size);
  const std::string& fatal = shim().abortText;
  if (!fatal.empty() && bytes.find(fatal) != std::string_view::npos) std::abort();
  if (shim().fails('w', true)) {
    if (errno != 0) return -1;
    size = (size + 1) / 2;
  }
  const std::lock_guard lock(shim().order);
  const long wrote = syscall(SYS_pwrite64, fd, data, size, offset);
  if (wrote > 0) shim().note('w', fd, offset, bytes.substr(0, static_cast<std::size_t>(wrote)));
  return wrote;
}
ssize_t write(int fd, const void* data, std::size_t size) {
  if (!shim().has(fd)) return syscall(SYS_write, fd, data, size);
  const ssize_t wrote = pwrite(fd, data, size, syscall(SYS_lseek, fd, 0, SEEK_CUR));
  if (wrote > 0) (void)syscall(SYS_lseek, fd, wrote, SEEK_CUR);
  return wrote;
}
int fsync(int fd) { return syncWith(SYS_fsync, fd); }
int fdatasync(int fd) { return syncWith(SYS_fdatasync, fd); }
int ftruncate(int fd, off_t size) noexcept { return resize('t', fd, SYS_ftruncate, size, 0, 0); }
int posix_fallocate(int fd, off_t offset, off_t size) {
  return resize('a', fd, SYS_fallocate, 0, offset, size) == 0 ? 0 : errno;
}
void* mmap(void* at, std::size_t size, int protection, int flags, int fd, off_t offset) noexcept {
  if (shim().fails('m', shim().has(fd))) return MAP_FAILED;
  return reinterpret_cast<void*>(syscall(SYS_mmap, at, size, protection, flags, fd, offset));
}
int close(int fd) {
  if (shim().has(fd)) shim().files[fd] = false;
  return static_cast<int>(syscall(SYS_close, fd));
}
int renameat(int fromFolder, const char* from, int toFolder, const char* to) noexcept {
  const std::string both = pathIn(fromFolder, from) + '\n' + pathIn(toFolder, to);
  if (shim().fails('n', shim().matches(both))) return -1;
  const std::lock_guard lock(shim().order);
  const int code = static_cast<int>(syscall(SYS_renameat2, fromFolder, from, toFolder, to, 0));
  if (code == 0 && shim().matches(both)) shim().note('n', 0, 0, both);
  return code;
}
int unlinkat(int folder, const char* path, int flags) noexcept {
  const std::string whole = pathIn(folder, path);
  if (shim().fails('u', shim().matches(whole))) return -1;
  const std::lock_guard lock(shim().order);
  const int code = static_cast<int>(syscall(SYS_unlinkat, folder, path, flags));
  if (code == 0 && shim().matches(whole)) shim().note('u', 0, 0, whole);
  return code;
}
int rename(const char* from, const char* to) noexcept {
  return renameat(AT_FDCWD, from, AT_FDCWD, to);
}
int unlink(const char* path) noexcept { return unlinkat(AT_FDCWD, path, 0); }

// The same functions by their other names.
decltype(open) open64 __attribute__((alias("open")));
decltype(openat) openat64 __attribute__((alias("openat")));
decltype(pread) pread64 __attribute__((alias("pread")));
decltype(pwrite) pwrite64 __attribute__((alias("pwrite")));
decltype(ftruncate) ftruncate64 __attribute__((alias("ftruncate")));
decltype(posix_fallocate) posix_fallocate64 __attribute__((alias("posix_fallocate")));
decltype(mmap) mmap64 __attribute__((alias("mmap")));

}  // extern "C"
