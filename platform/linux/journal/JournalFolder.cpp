#include "platform/linux/journal/JournalFolder.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <charconv>
#include <cstdio>
#include <filesystem>
#include <iterator>

namespace vx::lnx {

namespace {

constexpr std::string_view kPrefix = "segment-";
constexpr std::string_view kSuffix = ".vxj";
constexpr std::string_view kAside = ".aside-";
constexpr std::string_view kPart = ".part";      // of a file that is being copied
constexpr std::string_view kNew = ".new";        // that is being allocated
constexpr std::string_view kCompanion = ".vxa";  // memory that the recorded state refers to
constexpr char kAttempts[] = "attempts";         // a file that holds what they weigh, 4 bytes
// Of one attempt that was cut short, and of one that was while clients were served.
constexpr uint32_t kWeight = 4;
constexpr uint32_t kWhileServing = 1;

std::string quoted(std::string_view verb, const std::string& path) {
  return std::string(verb) + " " + path;
}

// The N of every "nameN.aside-N" in a folder whose name begins with `prefix`, with the name.
struct Aside {
  uint64_t number;
  std::string name;
};
std::vector<Aside> asideIn(const std::string& folder, std::string_view prefix) {
  std::vector<Aside> found;
  std::error_code error;
  for (std::filesystem::directory_iterator at(folder, error), end; !error && at != end;
       at.increment(error)) {
    std::string name = at->path().filename();
    const std::size_t mark = name.rfind(kAside);
    if (mark == std::string::npos || !name.starts_with(prefix)) continue;
    uint64_t number = 0;
    const char* const last = name.data() + name.size();
    const auto parsed = std::from_chars(name.data() + mark + kAside.size(), last, number);
    if (parsed.ec == std::errc() && parsed.ptr == last) found.push_back({number, std::move(name)});
  }
  std::ranges::sort(found, {}, &Aside::number);
  return found;
}

// The number for the next one, after the oldest have gone.
uint64_t nextAside(const std::string& folder, std::string_view prefix) {
  const std::vector<Aside> kept = asideIn(folder, prefix);
  std::error_code ignored;
  for (std::size_t i = 0; i + JournalFolder::kMaxAside <= kept.size(); ++i)
    std::filesystem::remove_all(folder + "/" + kept[i].name, ignored);
  return kept.empty() ? 1 : kept.back().number + 1;
}

// Why a file is not to be believed; success when it is this user's alone.
Status checkOwned(int fd, const std::string& path, mode_t kind) {
  struct stat info {};
  if (fstat(fd, &info) != 0) return Status::lastError(quoted("cannot examine", path));
  if ((info.st_mode & S_IFMT) != kind) return Status::failure(path + " is of another kind");
  if (info.st_uid != geteuid()) return Status::failure(path + " belongs to another user");
  if ((info.st_mode & 077) != 0) return Status::failure(path + " is open to other users");
  if (kind == S_IFREG && info.st_size != 0 && info.st_size != off_t{kSegmentBytes})
    return Status::failure(path + " is not of a segment's size");
  return {};
}

Status writeAll(int fd, const uint8_t* bytes, std::size_t size, const std::string& path) {
  while (size > 0) {
    const ssize_t written = write(fd, bytes, size);
    if (written < 0 && errno == EINTR) continue;
    if (written <= 0) return Status::lastError(quoted("cannot write", path));
    bytes += written;
    size -= static_cast<std::size_t>(written);
  }
  return {};
}

}  // namespace

Result<JournalFolder> JournalFolder::open(const std::string& path, IfMissing ifMissing) {
  if (ifMissing == IfMissing::Create && mkdir(path.c_str(), 0700) != 0 && errno != EEXIST)
    return Status::lastError(quoted("cannot create", path));
  UniqueFd fd(::open(path.c_str(), O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC));
  if (!fd) return Status::lastError(quoted("cannot open", path));
  const Status owned = checkOwned(fd.get(), path, S_IFDIR);
  if (!owned.ok()) return owned;
  return JournalFolder(path, std::move(fd));
}

bool isOfTheMoment(const Status& failure) {
  constexpr int kCodes[] = {EIO, EINTR, EAGAIN, ENOMEM, ENOSPC, EMFILE, ENFILE};
  return std::ranges::find(kCodes, failure.code()) != std::end(kCodes);
}

std::vector<std::string> JournalFolder::segments() const {
  std::vector<std::string> names;
  std::error_code error;
  for (std::filesystem::directory_iterator at(path_, error), end; !error && at != end;
       at.increment(error)) {
    std::string name = at->path().filename();
    if (name.starts_with(kPrefix) && name.ends_with(kSuffix)) names.push_back(std::move(name));
  }
  std::ranges::sort(names);
  return names;
}

std::string JournalFolder::freshSegment(uint64_t& next) const {
  for (;;) {
    char number[17];
    std::snprintf(number, sizeof number, "%016llx", static_cast<unsigned long long>(next++));
    std::string name = std::string(kPrefix).append(number).append(kSuffix);
    struct stat info {};
    if (fstatat(fd_.get(), name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) return name;
  }
}

Result<JournalFolder::Opened> JournalFolder::openSegment(const std::string& name,
                                                         Access access) const {
  const std::string path = path_ + "/" + name;
  const int how = access == Access::Write ? O_RDWR : O_RDONLY;
  Opened opened;
  // Never waits for the other end of a FIFO.
  opened.fd = UniqueFd(openat(fd_.get(), name.c_str(), how | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!opened.fd) return Status::lastError(quoted("cannot open", path));
  const Status owned = checkOwned(opened.fd.get(), path, S_IFREG);
  if (!owned.ok()) return owned;
  SegmentHeader& header = opened.header;
  const ssize_t got = pread(opened.fd.get(), &header, sizeof header, 0);
  if (got < 0) return Status::lastError(quoted("cannot read", path));
  const bool known = header.magic == SegmentHeader::kMagic;
  if (header.state == SegmentHeader::kFree && (known || header.magic == 0)) {
    opened.blank = got == 0;  // one that was allocated for later is of full size
    header = {};
    return opened;
  }
  if (!known) return Status::failure(path + " is no journal segment");
  if (header.version != SegmentHeader::kVersion)
    return Status::failure(path + " is of version " + std::to_string(header.version));
  if (header.checksum != checksumOf(header) || header.state != SegmentHeader::kInUse)
    return Status::failure(path + " has a damaged header");
  return opened;
}

Result<UniqueFd> JournalFolder::createSegment(const std::string& name, std::size_t bytes) const {
  const std::string path = path_ + "/" + name;
  const std::string fresh = name + std::string(kNew);
  remove(fresh);
  UniqueFd fd(
      openat(fd_.get(), fresh.c_str(), O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (!fd) return Status::lastError(quoted("cannot create", path));
  int code = ftruncate(fd.get(), off_t{kSegmentBytes}) == 0 ? 0 : errno;
  if (code == 0) code = posix_fallocate(fd.get(), 0, static_cast<off_t>(bytes));
  if (code == 0 && renameat(fd_.get(), fresh.c_str(), fd_.get(), name.c_str()) != 0) code = errno;
  if (code == 0) return fd;
  remove(fresh);
  return Status::posix(quoted("cannot allocate", path), code);
}

void JournalFolder::remove(const std::string& name) const { unlinkat(fd_.get(), name.c_str(), 0); }

bool JournalFolder::setAside(const std::string& name) const {
  const uint64_t number = nextAside(path_, name.substr(0, name.find('-') + 1));
  const std::string as = name + std::string(kAside) + std::to_string(number);
  return renameat(fd_.get(), name.c_str(), fd_.get(), as.c_str()) == 0;
}

bool JournalFolder::copyAside(const std::string& name) const {
  const uint64_t number = nextAside(path_, kPrefix);
  return copySegment(name, *this, name + std::string(kAside) + std::to_string(number)).ok();
}

// -------------------------------------------------------------------------------------- attempts

Result<uint32_t> JournalFolder::beginAttempt() const {
  const std::string path = path_ + "/" + kAttempts;
  constexpr int kHow = O_RDWR | O_CREAT | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC;
  UniqueFd fd(openat(fd_.get(), kAttempts, kHow, 0600));
  if (!fd) return Status::lastError(quoted("cannot open", path));
  uint32_t weight = 0;
  if (pread(fd.get(), &weight, sizeof weight, 0) != ssize_t{sizeof weight}) weight = 0;
  weight = std::min(weight, UINT32_MAX - 2 * kWeight) + kWeight;
  if (pwrite(fd.get(), &weight, sizeof weight, 0) != ssize_t{sizeof weight})
    return Status::lastError(quoted("cannot write", path));
  if (fdatasync(fd.get()) != 0) return Status::lastError(quoted("cannot write", path));
  return weight / kWeight;
}

void JournalFolder::noteServing() const {
  const UniqueFd fd(openat(fd_.get(), kAttempts, O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  uint32_t weight = 0;
  if (!fd || pread(fd.get(), &weight, sizeof weight, 0) != ssize_t{sizeof weight}) return;
  weight -= std::min(weight, kWeight - kWhileServing);
  (void)!pwrite(fd.get(), &weight, sizeof weight, 0);  // then it weighs more
}

bool JournalFolder::hasAttempts() const {
  return faccessat(fd_.get(), kAttempts, F_OK, AT_SYMLINK_NOFOLLOW) == 0;
}

void JournalFolder::clearAttempts() const { remove(kAttempts); }

// ----------------------------------------------------------------------------------------- moving

Result<std::string> JournalFolder::moveAside(const std::string& path) {
  const std::filesystem::path whole(path);
  const std::string folder = whole.parent_path();
  const std::string name = whole.filename();
  const std::string to =
      path + std::string(kAside) + std::to_string(nextAside(folder, name + std::string(kAside)));
  if (renameat2(AT_FDCWD, path.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE) != 0)
    return Status::lastError("cannot rename " + path + " to " + to);
  return to;
}

std::vector<std::string> JournalFolder::movedAside(const std::string& path) {
  const std::filesystem::path whole(path);
  const std::string folder = whole.parent_path();
  std::vector<std::string> paths;
  for (const Aside& aside : asideIn(folder, whole.filename().string() + std::string(kAside)))
    paths.push_back(folder + "/" + aside.name);
  return paths;
}

// Under another name first: what has its name is whole.
Status JournalFolder::copyFile(int source, const JournalFolder& to, const std::string& as) const {
  const std::string part = as + std::string(kPart);
  const std::string path = to.path_ + "/" + part;
  to.remove(part);
  UniqueFd target(openat(to.fd_.get(), part.c_str(),
                         O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, 0600));
  if (!target) return Status::lastError(quoted("cannot create", path));
  std::vector<uint8_t> bytes(std::size_t{256} << 10);
  Status status;
  for (off_t at = 0; status.ok();) {
    const ssize_t got = pread(source, bytes.data(), bytes.size(), at);
    if (got < 0 && errno == EINTR) continue;
    if (got < 0) status = Status::lastError("cannot read what is to become " + path);
    if (got <= 0) break;
    status = writeAll(target.get(), bytes.data(), static_cast<std::size_t>(got), path);
    at += got;
  }
  if (status.ok() && fsync(target.get()) != 0)
    status = Status::lastError(quoted("cannot sync", path));
  if (status.ok() && renameat(to.fd_.get(), part.c_str(), to.fd_.get(), as.c_str()) != 0)
    status = Status::lastError(quoted("cannot rename", path));
  if (!status.ok()) to.remove(part);
  return status;
}

Status JournalFolder::copySegment(const std::string& name, const JournalFolder& to,
                                  const std::string& as) const {
  const Result<Opened> source = openSegment(name, Access::Read);
  return source.ok() ? copyFile(source->fd.get(), to, as) : source.status();
}

// Files of others that lie here, under their names; those that are there are whole.
Status JournalFolder::copyCompanions(const JournalFolder& to, std::vector<std::string>& copied,
                                     const Function<void()>& onFile) const {
  std::error_code error;
  for (const auto& file : std::filesystem::directory_iterator(path_, error)) {
    const std::string name = file.path().filename();
    if (file.path().extension() != kCompanion) continue;
    const UniqueFd source(
        openat(fd_.get(), name.c_str(), O_RDONLY | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
    struct stat info {};
    if (!source || fstat(source.get(), &info) != 0 || !S_ISREG(info.st_mode)) continue;
    if (fstatat(to.fd_.get(), name.c_str(), &info, AT_SYMLINK_NOFOLLOW) != 0) {
      if (Status done = copyFile(source.get(), to, name); !done.ok()) return done;
    }
    copied.push_back(name);
    if (onFile) onFile();
  }
  return {};
}

std::vector<SegmentHeader> JournalFolder::headers() const {
  std::vector<SegmentHeader> headers;
  for (const std::string& name : segments()) {
    const Result<Opened> opened = openSegment(name, Access::Read);
    if (opened.ok() && opened->header.state == SegmentHeader::kInUse)
      headers.push_back(opened->header);
  }
  return headers;
}

uint64_t JournalFolder::bytesToMove() const {
  uint64_t bytes = headers().size() * kSegmentBytes;
  std::error_code error;
  for (const auto& file : std::filesystem::directory_iterator(path_, error)) {
    std::error_code unknown;
    const uintmax_t size = file.path().extension() == kCompanion ? file.file_size(unknown) : 0;
    bytes += unknown ? 0 : size;
  }
  return bytes;
}

Status JournalFolder::moveTo(const std::string& from, const std::string& to,
                             const Function<void()>& onSegment, uint64_t mostBytes) {
  Result<JournalFolder> source = open(from, IfMissing::Fail);
  if (!source.ok()) return source.status();
  if (source->bytesToMove() > mostBytes)
    return Status::failure("there is no space for it in " + to + " below the store's size");
  Result<JournalFolder> target = open(to, IfMissing::Create);
  if (!target.ok()) return target.status();
  const std::vector<SegmentHeader> there = target->headers();
  std::vector<std::string> moved;
  uint64_t next = 1;
  for (const std::string& name : source->segments()) {
    const Result<Opened> opened = source->openSegment(name, Access::Read);
    if (!opened.ok()) continue;
    if (opened->header.state == SegmentHeader::kFree) {
      moved.push_back(name);
      continue;
    }
    const bool copiedBefore = std::ranges::any_of(there, [&](const SegmentHeader& header) {
      return header.epoch == opened->header.epoch && header.sequence == opened->header.sequence;
    });
    if (!copiedBefore) {
      Status copied = source->copySegment(name, *target, target->freshSegment(next));
      if (!copied.ok()) return copied;
    }
    moved.push_back(name);
    if (onSegment) onSegment();
  }
  if (!moved.empty()) {
    Status copied = source->copyCompanions(*target, moved, onSegment);
    if (!copied.ok()) return copied;
  }
  if (fsync(target->fd_.get()) != 0) return Status::lastError(quoted("cannot sync", to));
  for (const std::string& name : moved) source->remove(name);
  // What earlier moves into this folder began.
  std::error_code error;
  for (const auto& file : std::filesystem::directory_iterator(from, error))
    if (file.path().extension() == kPart) source->remove(file.path().filename());
  return {};
}

}  // namespace vx::lnx
