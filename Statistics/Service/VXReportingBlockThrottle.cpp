#include "Statistics/Service/VXReportingBlockThrottle.h"

#include <algorithm>
#include <array>
#include <chrono>
#include <map>
#include <utility>

#include "platform/Log.h"

namespace vx {

namespace {

constexpr std::string_view kThrottleSeconds = "_throttle_seconds";
constexpr std::string_view kBlacklist = "_comparison_field_blacklist";
constexpr std::string_view kVolume = "Volume";
constexpr std::string_view kVolumeTime = "VolumeOperationTime";
// Their names take part in a key, their values never do.
constexpr std::array<std::string_view, 5> kExcludedKeys = {
    "systemuptime_sec", "processuptime_ms", "vxreporting_timestamp", kBlacklist, kThrottleSeconds};
constexpr double kDefaultDelay = 0.5;
constexpr int64_t kDelayBound = 5;  // exclusive, of the whole-number part
constexpr std::chrono::milliseconds kWorkerSleep{100};
constexpr std::chrono::milliseconds kCompletionPoll{500};
constexpr int kCompletionPolls = 10;
constexpr unsigned kCompletionSeconds = 5;
constexpr std::size_t kUnscheduledCapacity = 6;

bool isVerbose() { return platform().log.isLogEnabled(5, nullptr); }

// A delay may be any number below 5 that a client wrote down; whatever lies long before now is as
// good as a day ago.
std::chrono::nanoseconds nanoseconds(double seconds) {
  constexpr double kLongAgo = -86400;
  if (!(seconds > kLongAgo)) seconds = kLongAgo;  // not a number included
  return std::chrono::duration_cast<std::chrono::nanoseconds>(
      std::chrono::duration<double>(seconds));
}

// As Value::appendText, but dictionaries in the order of their keys: equal values, equal text.
// Recursion ends with the nesting, which validation bounds.
void appendKeyText(std::string& key, Value value) {
  std::string_view separator;
  if (value.isArray()) {
    key += '(';
    for (const Value element : value.asArray()) {
      key += std::exchange(separator, ",");
      appendKeyText(key, element);
    }
    key += ')';
  } else if (value.isDictionary()) {
    std::map<std::string_view, Value> sorted;
    for (const auto& [name, entry] : value.asDictionary()) sorted.emplace(name, entry);
    key += '{';
    for (const auto& [name, entry] : sorted) {
      ((key += std::exchange(separator, ",")) += name) += '=';
      appendKeyText(key, entry);
    }
    key += '}';
  } else {
    value.appendText(key);
  }
}

}  // namespace

// ---------------------------------------------------------------------------------------------------------------------
// Key and delay

std::string VXReportingBlockThrottle::buildMessageKey(const Payload& message, ReporterID reporter,
                                                      MessageCategory category, MessageType type) {
  std::vector<std::string> excluded(kExcludedKeys.begin(), kExcludedKeys.end());
  if (const std::optional<Value> blacklist = message.find(kBlacklist);
      blacklist && blacklist->isArray()) {
    for (const Value element : blacklist->asArray()) {
      if (element.isString())
        excluded.emplace_back(element.asString());  // nothing else names a key
    }
  }
  if (message.contains(kVolume) && message.contains(kVolumeTime)) {
    excluded.emplace_back(kVolume);
    excluded.emplace_back(kVolumeTime);
  }

  std::vector<std::pair<std::string_view, Value>> entries;
  for (const auto& [name, value] : message) entries.emplace_back(name, value);
  std::sort(entries.begin(), entries.end(),
            [](const auto& a, const auto& b) { return a.first < b.first; });
  std::string key;
  for (const auto& [name, value] : entries) {
    key += name;
    key += '|';
    if (std::find(excluded.begin(), excluded.end(), name) != excluded.end())
      key += '^';
    else
      appendKeyText(key, value);
    key += '|';
  }
  key += "reporterID|" + std::to_string(reporter) + "|" + VXReportingCategoryName(category) + "|";
  key += VXReportingMessageTypeName(type);
  return key;
}

double VXReportingBlockThrottle::determineSleepTime(const Payload& message) {
  const std::optional<Value> value = message.find(kThrottleSeconds);
  if (!value) return kDefaultDelay;
  if (!value->isNumber()) {
    VX_LOG(nullptr, Info, "Rejecting non KFNumber value of throttle time. {time=%s}",
           value->text().c_str());
    return kDefaultDelay;
  }
  if (value->asInt64() >= kDelayBound) {
    VX_LOG(nullptr, Info, "Rejecting large throttle time. {time=%s, max=%f}", value->text().c_str(),
           static_cast<double>(kDelayBound));
    return kDefaultDelay;
  }
  return double{value->asFloat()};
}

// ---------------------------------------------------------------------------------------------------------------------
// One pending delivery

void VXReportingBlockThrottleTimerWrapper::setBlock(std::shared_ptr<Block> block) {
  MutexLock lock(mutex_);
  block_.swap(block);  // the old one is destroyed after the lock
}

void VXReportingBlockThrottleTimerWrapper::setTimer(std::shared_ptr<OneShotTimer> timer) {
  MutexLock lock(mutex_);
  timer_ = std::move(timer);
}

std::shared_ptr<OneShotTimer> VXReportingBlockThrottleTimerWrapper::timer() const {
  MutexLock lock(mutex_);
  return timer_;
}

void VXReportingBlockThrottleTimerWrapper::sleepFor(double seconds) {
  if (const auto current = timer())
    current->setFireTime(platform().clock.monotonic() + nanoseconds(seconds));
}

void VXReportingBlockThrottleTimerWrapper::runBlock() {
  std::shared_ptr<Block> block;
  {
    MutexLock lock(mutex_);
    block = block_;
  }
  if (block != nullptr && *block) (*block)();
}

// ---------------------------------------------------------------------------------------------------------------------
// The throttle

std::shared_ptr<VXReportingBlockThrottle> VXReportingBlockThrottle::create() {
  std::shared_ptr<VXReportingBlockThrottle> throttle(new VXReportingBlockThrottle());
  {
    MutexLock lock(throttle->unscheduledMutex_);
    throttle->unscheduledTimerKeys_.reserve(kUnscheduledCapacity);
  }
  throttle->queueThread_ =
      platform().threading.startThread("vx-throttle", [throttle] { throttle->runThread(); });
  return throttle;
}

VXReportingBlockThrottle::Wrapper VXReportingBlockThrottle::pending(const std::string& key) const {
  MutexLock lock(timersMutex_);
  const auto found = timersInFlight_.find(key);
  return found != timersInFlight_.end() ? found->second : nullptr;
}

std::size_t VXReportingBlockThrottle::timersInFlight() const {
  MutexLock lock(timersMutex_);
  return timersInFlight_.size();
}

std::size_t VXReportingBlockThrottle::unscheduledTimerKeys() const {
  MutexLock lock(unscheduledMutex_);
  return unscheduledTimerKeys_.size();
}

void VXReportingBlockThrottle::addMessageBlock(Block block, ReporterID reporter,
                                               const Payload& message, MessageCategory category,
                                               MessageType type) {
  const std::string key = buildMessageKey(message, reporter, category, type);
  const double delay = determineSleepTime(message);
  auto shared = std::make_shared<Block>(std::move(block));
  Wrapper duplicate = pending(key);
  if (duplicate == nullptr) {
    const auto wrapper = std::make_shared<VXReportingBlockThrottleTimerWrapper>();
    wrapper->setBlock(shared);
    wrapper->setTimer(platform().threading.makeTimer(
        nanoseconds(delay),
        [self = shared_from_this(), wrapper, key] { self->fire(wrapper, key); }));
    duplicate = addIfAbsent(key, wrapper);
    if (duplicate == nullptr) return;
    wrapper->setTimer(nullptr);  // the timer's action holds the wrapper
  }
  if (isVerbose()) VX_LOG(nullptr, Debug, "Dropping duplicate message for %s", key.c_str());
  duplicate->sleepFor(delay);
  duplicate->setBlock(std::move(shared));
}

// The one that another thread has added meanwhile, if one has.
VXReportingBlockThrottle::Wrapper VXReportingBlockThrottle::addIfAbsent(const std::string& key,
                                                                        const Wrapper& wrapper) {
  {
    MutexLock lock(timersMutex_);
    const auto [place, added] = timersInFlight_.emplace(key, wrapper);
    if (!added) return place->second;
  }
  MutexLock lock(unscheduledMutex_);
  unscheduledTimerKeys_.emplace_back(key, wrapper);
  return nullptr;
}

void VXReportingBlockThrottle::fire(const Wrapper& wrapper, const std::string& key) {
  // Caught, not left to a destructor: where nothing above catches it, an exception ends the process
  // without unwinding.
  try {
    wrapper->runBlock();
  } catch (...) {
    removeFired(key);
    throw;
  }
  removeFired(key);
}

// And with it a block that replaced the one that ran meanwhile.
void VXReportingBlockThrottle::removeFired(const std::string& key) {
  Wrapper removed;
  MutexLock lock(timersMutex_);
  const auto found = timersInFlight_.find(key);
  if (found == timersInFlight_.end()) return;
  if (const auto timer = found->second->timer()) timer->invalidate();
  found->second->setTimer(nullptr);  // the timer's action holds the wrapper
  removed = std::move(found->second);
  timersInFlight_.erase(found);
}

void VXReportingBlockThrottle::attachUnscheduled(RunLoop& runLoop) {
  MutexLock lock(unscheduledMutex_);
  for (const auto& [key, wrapper] : unscheduledTimerKeys_) {
    if (auto timer = wrapper->timer()) runLoop.attach(std::move(timer));
  }
  unscheduledTimerKeys_.clear();
}

void VXReportingBlockThrottle::runThread() {
  if (!shouldKeepRunning()) return;
  const std::unique_ptr<RunLoop> runLoop = platform().threading.makeRunLoop();
  do {
    if (unscheduledTimerKeys() != 0) {
      if (isVerbose()) {
        VX_LOG(nullptr, Debug, "calling workingRunLoop run from inside thread block");
      }
      attachUnscheduled(*runLoop);
      runLoop->runUntilEmpty();
    }
    if (isVerbose()) VX_LOG(nullptr, Debug, "sleeping in thread");
    platform().threading.sleepFor(kWorkerSleep);
  } while (shouldKeepRunning());
}

void VXReportingBlockThrottle::waitForCompletion() {
  VX_LOG(nullptr, Info, "waitForCompletion. timersInFlight=%u unscheduledTimerKeys=%u",
         static_cast<unsigned>(timersInFlight()), static_cast<unsigned>(unscheduledTimerKeys()));
  if (timersInFlight() == 0) return;
  if (isVerbose()) {
    VX_LOG(nullptr, Debug, "Waiting up to %u seconds for blockThrottle queue to be empty.",
           kCompletionSeconds);
  }
  for (int i = 0; i < kCompletionPolls && timersInFlight() != 0; ++i)
    platform().threading.sleepFor(kCompletionPoll);
  if (const std::size_t left = timersInFlight()) {
    VX_LOG(nullptr, Default,
           "Giving up on waiting for completion after %u seconds. timersInFlight=%u",
           kCompletionSeconds, static_cast<unsigned>(left));
  }
}

}  // namespace vx
