#include "platform/linux/aggregates/AggregateSegment.h"

#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <bit>
#include <cerrno>
#include <cstdio>
#include <memory>

namespace vx::lnx {

namespace {

Status allocate(const UniqueFd& fd, std::size_t bytes, const std::string& path) {
  int code = 0;
  do {
    code = posix_fallocate(fd.get(), 0, static_cast<off_t>(bytes));
  } while (code == EINTR);
  return code == 0 ? Status() : Status::posix("cannot allocate " + path, code);
}

}  // namespace

Result<std::unique_ptr<AggregateSegment>> AggregateSegment::create(const std::string& path,
                                                                   std::size_t blockBytes,
                                                                   uint32_t blocks) {
  // It gets its name when it is whole: a process may end at any moment.
  const std::string fresh = path + std::string(kNew);
  const UniqueFd fd(
      open(fresh.c_str(), O_RDWR | O_CREAT | O_EXCL | O_NOFOLLOW | O_CLOEXEC, S_IRUSR | S_IWUSR));
  if (!fd) return Status::lastError("cannot create " + path);
  Status status = allocate(fd, fileBytes(blockBytes, blocks), path);
  if (status.ok()) {
    Result<std::unique_ptr<AggregateSegment>> made = map(path, fd, blockBytes, blocks);
    if (made.ok()) {
      *reinterpret_cast<FileHeader*>((*made)->base_) = {FileHeader::kMagic, FileHeader::kVersion,
                                                        blocks, blockBytes};
      for (uint32_t index = blocks; index > 0; --index) (*made)->free_.push_back(index - 1);
      if (renameat2(AT_FDCWD, fresh.c_str(), AT_FDCWD, path.c_str(), RENAME_NOREPLACE) == 0)
        return made;
      status = Status::lastError("cannot create " + path);
    } else {
      status = made.status();
    }
  }
  unlink(fresh.c_str());
  return status;
}

Result<std::unique_ptr<AggregateSegment>> AggregateSegment::adopt(const std::string& path) {
  // Never waits for the other end of a FIFO.
  const UniqueFd fd(open(path.c_str(), O_RDWR | O_NOFOLLOW | O_NONBLOCK | O_CLOEXEC));
  if (!fd) return Status::lastError("cannot open " + path);
  struct stat info {};
  if (fstat(fd.get(), &info) != 0) return Status::lastError("cannot examine " + path);
  if (!S_ISREG(info.st_mode)) return Status::failure(path + " is no file");
  if (info.st_uid != geteuid()) return Status::failure(path + " belongs to another user");
  if ((info.st_mode & 077) != 0) return Status::failure(path + " is open to other users");
  FileHeader header{};
  const ssize_t got = pread(fd.get(), &header, sizeof header, 0);
  if (got < 0) return Status::lastError("cannot read " + path);
  if (got != ssize_t{sizeof header} || header.magic != FileHeader::kMagic)
    return Status::failure(path + " holds no aggregates");
  if (header.version != FileHeader::kVersion)
    return Status::failure(path + " is of version " + std::to_string(header.version));
  const auto size = static_cast<uint64_t>(info.st_size);
  const bool shared = header.blockBytes <= kLargestShared;
  if (header.blockBytes < kSmallest || header.blockBytes % kSmallest != 0 || header.blocks == 0 ||
      (shared && !std::has_single_bit(header.blockBytes)) ||
      header.blocks > size / header.blockBytes ||
      fileBytes(header.blockBytes, header.blocks) != size)
    return Status::failure(path + " has a damaged header");
  const Status whole = allocate(fd, size, path);
  if (!whole.ok()) return whole;
  return map(path, fd, header.blockBytes, header.blocks);
}

Result<std::unique_ptr<AggregateSegment>> AggregateSegment::map(const std::string& path,
                                                                const UniqueFd& fd,
                                                                std::size_t blockBytes,
                                                                uint32_t blocks) {
  void* const base = mmap(nullptr, fileBytes(blockBytes, blocks), PROT_READ | PROT_WRITE,
                          MAP_SHARED | MAP_POPULATE, fd.get(), 0);
  if (base == MAP_FAILED) return Status::lastError("cannot map " + path);
  return std::unique_ptr<AggregateSegment>(
      new AggregateSegment(path, static_cast<uint8_t*>(base), blockBytes, blocks));
}

AggregateSegment::~AggregateSegment() { munmap(base_, bytes()); }

uint32_t AggregateSegment::take() {
  const uint32_t index = free_.back();
  free_.pop_back();
  return index;
}

void AggregateSegment::makeFree(uint32_t index) {
  std::atomic_ref<uint64_t>(header(index).aggregate).store(0, std::memory_order_relaxed);
  free_.push_back(index);
}

}  // namespace vx::lnx
