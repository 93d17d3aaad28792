#include "platform/linux/device/OrientationHandlers.h"

#include <algorithm>
#include <utility>

namespace vx::lnx {

OrientationWords::OrientationWords()
    : words_{"unknown",  "undefined", "normal",         "bottom-up",       "left-up",
             "right-up", "portrait",  "landscape-left", "landscape-right", "portrait-upside-down"} {
}

int64_t OrientationWords::valueOf(const std::string& word) {
  MutexLock lock(mutex_);
  const auto found = std::find(words_.begin(), words_.end(), word);
  if (found != words_.end()) return found - words_.begin();
  if (words_.size() >= kMaxWords) return 0;
  words_.push_back(word);
  return static_cast<int64_t>(words_.size()) - 1;
}

std::string OrientationWords::textOf(int64_t value) {
  MutexLock lock(mutex_);
  const auto index = static_cast<std::size_t>(value);
  return index < words_.size() ? words_[index] : "unknown";
}

bool OrientationHandlers::add(std::string_view identifier, const void* registrant,
                              Handler handler) {
  auto added = std::make_shared<Handler>(std::move(handler));  // afterwards the one it replaces
  const std::pair key(std::string(identifier), registrant);
  MutexLock lock(mutex_);
  if (handlers_.size() >= kMaxHandlers && !handlers_.contains(key)) return false;
  handlers_[key].swap(added);
  return true;
}

bool OrientationHandlers::remove(std::string_view identifier, const void* registrant) {
  Handlers::node_type removed;  // destroyed after the lock
  MutexLock lock(mutex_);
  removed = handlers_.extract({std::string(identifier), registrant});
  return !removed.empty();
}

void OrientationHandlers::clear() {
  Handlers removed;  // destroyed after the lock
  MutexLock lock(mutex_);
  removed.swap(handlers_);
}

bool OrientationHandlers::empty() {
  MutexLock lock(mutex_);
  return handlers_.empty();
}

void OrientationHandlers::report(const std::string& word) {
  std::vector<std::shared_ptr<Handler>> called;
  {
    MutexLock lock(mutex_);
    const bool isChange = !last_.empty() && last_ != word;
    last_ = word;
    if (!isChange) return;
    for (const auto& [key, handler] : handlers_) called.push_back(handler);
  }
  const int64_t value = words_.valueOf(word);
  for (const auto& handler : called) (*handler)(value);
}

void OrientationHandlers::forgetLast() {
  MutexLock lock(mutex_);
  last_.clear();
}

}  // namespace vx::lnx
