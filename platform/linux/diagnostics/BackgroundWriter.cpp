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

int writeAll(int fd, std::string_view text) {
  while (!text.empty()) {
    const ssize_t written = write(fd, text.data(), text.size());
    if (written < 0 && errno == EINTR) continue;
    if (written < 0) return errno;
    text.remove_prefix(static_cast<std::size_t>(written));
  }
  return 0;
}

BackgroundWriter::BackgroundWriter(int fd, std::size_t offset)
    : fd_(fd), offset_(offset), thread_(startThread("vx-file", [this] { run(); })) {}

BackgroundWriter::~BackgroundWriter() { (void)finish(); }

int BackgroundWriter::push(std::string& text) {
  MutexLock lock(mutex_);
  while (waiting_.size() >= kMostPieces && code_ == 0) changed_.wait(mutex_);
  if (code_ != 0) return code_;
  waiting_.push_back(std::exchange(text, {}));
  if (!done_.empty()) {
    text.swap(done_.back());
    done_.pop_back();
  }
  changed_.notifyAll();
  return 0;
}

int BackgroundWriter::finish() {
  {
    MutexLock lock(mutex_);
    ending_ = true;
    changed_.notifyAll();
  }
  if (thread_.joinable()) thread_.join();
  MutexLock lock(mutex_);
  return code_;
}

void BackgroundWriter::run() {
  staging_.reset(static_cast<char*>(std::aligned_alloc(kBlock, kStagingBytes)));
  if (staging_ == nullptr) return fail(ENOMEM);
  std::string piece;
  while (next(piece)) {
    if (const int code = stage(piece); code != 0) return fail(code);
  }
  if (const int code = writeStaged(); code != 0) fail(code);
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

int BackgroundWriter::stage(std::string_view text) {
  // Up to the next whole block the file goes on as it began.
  if (const std::size_t odd = offset_ % kBlock; odd != 0 && staged_ == 0) {
    const std::string_view first = text.substr(0, kBlock - odd);
    if (const int code = writeAll(fd_, first); code != 0) return code;
    offset_ += first.size();
    text.remove_prefix(first.size());
  }
  while (!text.empty()) {
    const std::size_t count = std::min(text.size(), kStagingBytes - staged_);
    std::memcpy(staging_.get() + staged_, text.data(), count);
    staged_ += count;
    text.remove_prefix(count);
    if (staged_ < kStagingBytes) continue;
    if (const int code = writeStaged(); code != 0) return code;
  }
  return 0;
}

// Whole blocks directly, the rest (only at the end of the file) through the cache.
int BackgroundWriter::writeStaged() {
  std::size_t direct = offset_ % kBlock == 0 ? staged_ / kBlock * kBlock : 0;
  if (direct > 0 && !isDirect_) isDirect_ = setDirect(true);
  if (!isDirect_) direct = 0;
  if (direct > 0) {
    const ssize_t written = write(fd_, staging_.get(), direct);
    if (written < 0 && errno != EINVAL) return errno;
    // Less than all of it, or a file system that changed its mind: the rest goes the usual way.
    direct = written > 0 ? static_cast<std::size_t>(written) : 0;
  }
  if (direct < staged_) {
    if (isDirect_) isDirect_ = setDirect(false);
    if (const int code = writeAll(fd_, {staging_.get() + direct, staged_ - direct}); code != 0)
      return code;
  }
  offset_ += staged_;
  staged_ = 0;
  return 0;
}

bool BackgroundWriter::setDirect(bool direct) const {
  const int flags = fcntl(fd_, F_GETFL);
  return fcntl(fd_, F_SETFL, direct ? flags | O_DIRECT : flags & ~O_DIRECT) == 0 && direct;
}

void BackgroundWriter::fail(int code) {
  MutexLock lock(mutex_);
  code_ = code;
  waiting_.clear();
  changed_.notifyAll();
}

}  // namespace vx::lnx
