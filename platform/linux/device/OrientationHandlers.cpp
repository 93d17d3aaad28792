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

void OrientationHandlers::add(std::string_view identifier, Handler handler) {
  auto added = std::make_shared<Handler>(std::move(handler));  // afterwards the one it replaces
  MutexLock lock(mutex_);
  handlers_[std::string(identifier)].swap(added);
}

bool OrientationHandlers::remove(std::string_view identifier) {
  Handlers::node_type removed;  // destroyed after the lock
  MutexLock lock(mutex_);
  const auto found = handlers_.find(identifier);
  if (found == handlers_.end()) return false;
  removed = handlers_.extract(found);
  return true;
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
    for (const auto& [identifier, handler] : handlers_) called.push_back(handler);
  }
  const int64_t value = words_.valueOf(word);
  for (const auto& handler : called) (*handler)(value);
}

void OrientationHandlers::forgetLast() {
  MutexLock lock(mutex_);
  last_.clear();
}

}  // namespace vx::lnx
