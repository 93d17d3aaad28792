// Who wants to know of one kind of orientation.
#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <string>
#include <string_view>
#include <utility>
#include <vector>

#include "base/Mutex.h"
#include "platform/OrientationNotifier.h"

namespace vx::lnx {

// Orientations are numbers to the service and words to everybody else. Thread-safe; knows at most
// kMaxWords.
class OrientationWords {
 public:
  static constexpr std::size_t kMaxWords = 64;

  OrientationWords();
  // New words get numbers of their own while there is capacity, then that of "unknown".
  int64_t valueOf(const std::string& word);
  std::string textOf(int64_t value);

 private:
  Mutex mutex_;
  std::vector<std::string> words_ GUARDED_BY(mutex_);  // index is the value
};

// The handlers, and the last word they could know. Thread-safe; at most kMaxHandlers. A session
// whose type was changed while it was started leaves its own behind for good.
class OrientationHandlers {
 public:
  using Handler = OrientationNotifier::Handler;
  static constexpr std::size_t kMaxHandlers = 4096;

  explicit OrientationHandlers(OrientationWords& words) : words_(words) {}
  // Replaces the one of that name and registrant. False: there are too many to take another.
  bool add(std::string_view identifier, const void* registrant, Handler handler);
  // False when there is none of that name and registrant.
  bool remove(std::string_view identifier, const void* registrant);
  void clear();
  bool empty();
  // Calls the handlers, on this thread and without a lock, when the word is another than the last
  // one known. The first is not a change.
  void report(const std::string& word);
  // The next word is the first again.
  void forgetLast();

 private:
  using Handlers = std::map<std::pair<std::string, const void*>, std::shared_ptr<Handler>>;

  OrientationWords& words_;
  Mutex mutex_;
  Handlers handlers_ GUARDED_BY(mutex_);
  std::string last_ GUARDED_BY(mutex_);
};

}  // namespace vx::lnx
