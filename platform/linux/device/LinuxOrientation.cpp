#include "platform/linux/device/LinuxOrientation.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <optional>

#include "base/Mutex.h"
#include "base/UniqueFd.h"
#include "platform/linux/device/InterfaceStateFile.h"
#include "platform/linux/device/OrientationHandlers.h"
#include "platform/linux/device/SensorProxyClient.h"
#include "platform/linux/execution/Threads.h"

namespace vx::lnx {

// What the notifier and its thread share, and what that thread does: it lives while there are
// handlers.
class LinuxOrientation::Worker : public std::enable_shared_from_this<Worker> {
 public:
  explicit Worker(const OrientationOptions& options)
      : sensor_([this](const std::string& word) { device.report(word); }),
        stateFile_(options.interfaceStateFile,
                   [this](const std::string& word) { interface.report(word); }) {}

  // After a handler has come.
  void wakeOrStart();
  // After one has gone.
  void wake() const;
  void end();

  OrientationWords words;
  OrientationHandlers device{words};
  OrientationHandlers interface {
    words
  };

 private:
  void run();
  bool maintain();
  bool mayEnd();
  void waitAndDispatch();

  const UniqueFd wakeFd_{eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)};
  SensorProxyClient sensor_;      // the thread's
  InterfaceStateFile stateFile_;  // the thread's
  Mutex mutex_;
  bool running_ GUARDED_BY(mutex_) = false;
  bool ending_ GUARDED_BY(mutex_) = false;
};

void LinuxOrientation::Worker::wakeOrStart() {
  {
    MutexLock lock(mutex_);
    if (running_) return wake();
    running_ = true;
  }
  startThread("vx-orientation", [self = shared_from_this()] { self->run(); }).detach();
}

void LinuxOrientation::Worker::wake() const {
  const uint64_t one = 1;
  [[maybe_unused]] const ssize_t written = write(wakeFd_.get(), &one, sizeof one);
}

void LinuxOrientation::Worker::end() {
  {
    MutexLock lock(mutex_);
    ending_ = true;
  }
  device.clear();
  interface.clear();
  wake();
}

void LinuxOrientation::Worker::run() {
  do {
    while (maintain()) waitAndDispatch();
  } while (!mayEnd());
}

// Keeps up what the handlers need. False: nothing is needed, and nothing is left.
bool LinuxOrientation::Worker::maintain() {
  const bool deviceWanted = !device.empty();
  const bool interfaceWanted = !interface.empty();
  if (deviceWanted)
    sensor_.maintain();
  else
    sensor_.stop();
  // Tried again whenever a handler comes or goes. Once it is watched, it is until the end: a change
  // while nobody listens must not look like one of later.
  if (interfaceWanted)
    stateFile_.start();
  else if (!deviceWanted)
    stateFile_.stop();
  return deviceWanted || interfaceWanted;
}

// A handler that came since the last look has found the thread running.
bool LinuxOrientation::Worker::mayEnd() {
  MutexLock lock(mutex_);
  if (!ending_ && (!device.empty() || !interface.empty())) return false;
  device.forgetLast();
  interface.forgetLast();
  running_ = false;
  return true;
}

void LinuxOrientation::Worker::waitAndDispatch() {
  pollfd fds[] = {{wakeFd_.get(), POLLIN, 0}, {stateFile_.fd(), POLLIN, 0}, sensor_.pollEntry()};
  int timeout = -1;
  if (const auto until = sensor_.nextDue()) {
    const auto left = std::chrono::ceil<std::chrono::milliseconds>(
        *until - SensorProxyClient::TimePoint::clock::now());
    timeout = static_cast<int>(std::clamp<int64_t>(left.count(), 0, 60000));
  }
  if (poll(fds, std::size(fds), timeout) < 0) return;
  if (fds[0].revents != 0) {
    uint64_t count = 0;
    [[maybe_unused]] const ssize_t got = read(wakeFd_.get(), &count, sizeof count);
  }
  if (fds[1].revents != 0) stateFile_.onReadable();
  sensor_.process();
}

LinuxOrientation::LinuxOrientation(const OrientationOptions& options)
    : options_(options), worker_(std::make_shared<Worker>(options)) {}

LinuxOrientation::~LinuxOrientation() { worker_->end(); }

void LinuxOrientation::registerDeviceOrientationHandler(std::string_view identifier,
                                                        Handler handler) {
  if (!options_.deviceSensor) return;
  worker_->device.add(identifier, std::move(handler));
  worker_->wakeOrStart();
}

void LinuxOrientation::registerInterfaceOrientationHandler(std::string_view identifier,
                                                           Handler handler) {
  if (options_.interfaceStateFile.empty()) return;
  worker_->interface.add(identifier, std::move(handler));
  worker_->wakeOrStart();
}

void LinuxOrientation::unregisterDeviceOrientationHandler(std::string_view identifier) {
  if (worker_->device.remove(identifier)) worker_->wake();
}

void LinuxOrientation::unregisterInterfaceOrientationHandler(std::string_view identifier) {
  if (worker_->interface.remove(identifier)) worker_->wake();
}

std::string LinuxOrientation::orientationText(int64_t orientation) {
  return worker_->words.textOf(orientation);
}

}  // namespace vx::lnx
