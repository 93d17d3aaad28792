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

namespace vx::lnx {

// 0, or the errno that kept some of it from being written.
int writeAll(int fd, std::string_view text);

// Writes the rest of a large file with a thread of its own while the caller makes it, past the page
// cache where the file system can do that: tens of megabytes that nobody on the device reads would
// only push out what somebody does. Owned by the file, which outlives it; used by one thread. At
// most kMostPieces wait, then so does the caller.
class BackgroundWriter {
 public:
  // `offset`: the file's size so far. std::system_error when there is no thread to be had.
  BackgroundWriter(int fd, std::size_t offset);
  ~BackgroundWriter();
  BackgroundWriter(const BackgroundWriter&) = delete;
  BackgroundWriter& operator=(const BackgroundWriter&) = delete;

  // Leaves `text` empty, with the room of a piece that is done with. 0, or the errno that an
  // earlier piece met; nothing more is written then.
  int push(std::string& text);
  // Once everything is written: 0, or the errno that prevented it.
  int finish();

 private:
  static constexpr std::size_t kMostPieces = 16;

  void run();
  bool next(std::string& piece);
  int stage(std::string_view text);
  int writeStaged();
  bool setDirect(bool direct) const;
  void fail(int code);

  struct Free {
    void operator()(void* room) const { std::free(room); }
  };
  const int fd_;
  // The thread's, once it runs.
  std::size_t offset_;
  std::unique_ptr<char, Free> staging_;
  std::size_t staged_ = 0;
  bool isDirect_ = false;

  Mutex mutex_;
  CondVar changed_;
  std::deque<std::string> waiting_ GUARDED_BY(mutex_);
  std::vector<std::string> done_ GUARDED_BY(mutex_);  // at most as many as may wait, and one
  bool ending_ GUARDED_BY(mutex_) = false;
  int code_ GUARDED_BY(mutex_) = 0;
  std::thread thread_;  // last: it uses the others
};

}  // namespace vx::lnx
