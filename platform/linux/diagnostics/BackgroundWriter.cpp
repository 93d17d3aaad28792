#include "platform/linux/diagnostics/BackgroundWriter.h"

#include <fcntl.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstring>
#include <utility>

#include "platform/linux/execution/Threads.h"

namespace vx::lnx {

namespace {

constexpr std::size_t kBlock = 4096;  // direct writing wants multiples of it
constexpr std::size_t kStagingBytes = 1 << 20;

}  // namespace

Status writeAll(int fd, std::string_view text) {
  while (!text.empty()) {
    const ssize_t written = write(fd, text.data(), text.size());
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return Status::lastError("write");
    text.remove_prefix(static_cast<std::size_t>(written));
  }
  return {};
}

BackgroundWriter::BackgroundWriter(int fd, std::size_t offset)
    : fd_(fd), offset_(offset), thread_(startThread("vx-file", [this] { run(); })) {}

BackgroundWriter::~BackgroundWriter() { (void)finish(); }

Status BackgroundWriter::push(std::string& text) {
  MutexLock lock(mutex_);
  while (waiting_.size() >= kMaxPieces && status_.ok()) changed_.wait(mutex_);
  if (!status_.ok()) return status_;
  waiting_.push_back(std::exchange(text, {}));
  if (!done_.empty()) {
    text.swap(done_.back());
    done_.pop_back();
  }
  changed_.notifyAll();
  return {};
}

Status BackgroundWriter::finish() {
  {
    MutexLock lock(mutex_);
    ending_ = true;
    changed_.notifyAll();
  }
  if (thread_.joinable()) thread_.join();
  MutexLock lock(mutex_);
  return status_;
}

void BackgroundWriter::run() {
  writer_.assertHere();
  Status status = writeWaiting();
  if (status.ok()) return;
  MutexLock lock(mutex_);
  status_ = std::move(status);
  waiting_.clear();
  changed_.notifyAll();
}

Status BackgroundWriter::writeWaiting() {
  staging_.reset(static_cast<char*>(std::aligned_alloc(kBlock, kStagingBytes)));
  if (staging_ == nullptr) return Status::posix("staging buffer", ENOMEM);
  std::string piece;
  while (next(piece)) {
    if (Status status = stage(piece); !status.ok()) return status;
  }
  return writeStaged();
}

bool BackgroundWriter::next(std::string& piece) {
  MutexLock lock(mutex_);
  piece.clear();
  if (piece.capacity() != 0) done_.push_back(std::move(piece));
  while (waiting_.empty() && !ending_) changed_.wait(mutex_);
  if (waiting_.empty()) return false;
  piece = std::move(waiting_.front());
  waiting_.pop_front();
  changed_.notifyAll();
  return true;
}

Status BackgroundWriter::stage(std::string_view text) {
  // Up to the next whole block the file goes on as it began.
  if (const std::size_t odd = offset_ % kBlock; odd != 0 && staged_ == 0) {
    const std::string_view first = text.substr(0, kBlock - odd);
    if (Status status = writeAll(fd_, first); !status.ok()) return status;
    offset_ += first.size();
    text.remove_prefix(first.size());
  }
  while (!text.empty()) {
    const std::size_t count = std::min(text.size(), kStagingBytes - staged_);
    std::memcpy(staging_.get() + staged_, text.data(), count);
    staged_ += count;
    text.remove_prefix(count);
    if (staged_ < kStagingBytes) continue;
    if (Status status = writeStaged(); !status.ok()) return status;
  }
  return {};
}

// Whole blocks directly, the rest (only at the end of the file) through the cache.
Status BackgroundWriter::writeStaged() {
  std::size_t direct = offset_ % kBlock == 0 ? staged_ / kBlock * kBlock : 0;
  if (direct > 0 && !isDirect_) isDirect_ = setDirect(true);
  if (!isDirect_) direct = 0;
  if (direct > 0) {
    const ssize_t written = write(fd_, staging_.get(), direct);
    if (written < 0 && errno != EINVAL) return Status::lastError("write");
    // Less than all of it, or a file system that changed its mind: the rest goes the usual way.
    direct = written > 0 ? static_cast<std::size_t>(written) : 0;
  }
  if (direct < staged_) {
    if (isDirect_) isDirect_ = setDirect(false);
    Status status = writeAll(fd_, {staging_.get() + direct, staged_ - direct});
    if (!status.ok()) return status;
  }
  offset_ += staged_;
  staged_ = 0;
  return {};
}

bool BackgroundWriter::setDirect(bool direct) const {
  const int flags = fcntl(fd_, F_GETFL);
  return fcntl(fd_, F_SETFL, direct ? flags | O_DIRECT : flags & ~O_DIRECT) == 0 && direct;
}

}  // namespace vx::lnx
