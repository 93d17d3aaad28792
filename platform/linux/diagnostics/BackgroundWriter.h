// Writing a large file without keeping its maker waiting.
#pragma once

#include <cstddef>
#include <cstdlib>
#include <deque>
#include <memory>
#include <string>
#include <string_view>
#include <thread>
#include <vector>

#include "base/Mutex.h"
#include "base/Status.h"
#include "base/ThreadChecker.h"

namespace vx::lnx {

// All of it, however many writes that takes.
Status writeAll(int fd, std::string_view text);

// Writes the rest of a large file with a thread of its own while the caller makes it, past the page
// cache where the file system can do that: tens of megabytes that nobody on the device reads would
// only push out what somebody does. Owned by the file, which outlives it; used by one thread. At
// most kMaxPieces wait, then so does the caller.
class BackgroundWriter {
 public:
  // `fd` must outlive it; `offset`: the file's size so far. std::system_error when there is no
  // thread to be had.
  BackgroundWriter(int fd, std::size_t offset);
  ~BackgroundWriter();
  BackgroundWriter(const BackgroundWriter&) = delete;
  BackgroundWriter& operator=(const BackgroundWriter&) = delete;

  // Leaves `text` empty, with the capacity of a piece that is done with. Fails with what an earlier
  // piece met; nothing more is written then. Waits while kMaxPieces wait.
  Status push(std::string& text);
  // Waits until everything is written, or told why it is not.
  Status finish();

 private:
  static constexpr std::size_t kMaxPieces = 16;

  void run();
  Status writeWaiting() REQUIRES(writer_);
  bool next(std::string& piece);
  Status stage(std::string_view text) REQUIRES(writer_);
  Status writeStaged() REQUIRES(writer_);
  bool setDirect(bool direct) const;

  struct Free {
    void operator()(void* memory) const { std::free(memory); }
  };
  const int fd_;
  ThreadChecker writer_;
  std::size_t offset_ GUARDED_BY(writer_);
  std::unique_ptr<char, Free> staging_ GUARDED_BY(writer_);
  std::size_t staged_ GUARDED_BY(writer_) = 0;
  bool isDirect_ GUARDED_BY(writer_) = false;

  Mutex mutex_;
  CondVar changed_;
  std::deque<std::string> waiting_ GUARDED_BY(mutex_);
  std::vector<std::string> done_ GUARDED_BY(mutex_);  // at most as many as may wait, and one
  bool ending_ GUARDED_BY(mutex_) = false;
  Status status_ GUARDED_BY(mutex_);
  std::thread thread_;  // last: it uses the others
};

}  // namespace vx::lnx
