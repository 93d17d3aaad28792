#include "platform/linux/device/LinuxOrientation.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <optional>
#include <system_error>
#include <utility>

#include "base/Mutex.h"
#include "base/UniqueFd.h"
#include "platform/Log.h"
#include "platform/linux/device/InterfaceStateFile.h"
#include "platform/linux/device/OrientationHandlers.h"
#include "platform/linux/device/SensorProxyClient.h"
#include "platform/linux/execution/Threads.h"

namespace vx::lnx {

// What the notifier and its thread share, and what that thread does: it lives while there are
// handlers.
class LinuxOrientation::Worker : public std::enable_shared_from_this<Worker> {
 public:
  Worker(const OrientationOptions& options, StartThread startThread)
      : startThread_(std::move(startThread)),
        sensor_([this](const std::string& word) { device.report(word); }),
        stateFile_(options.interfaceStateFile,
                   [this](const std::string& word) { interface.report(word); }) {}

  // After a handler has come.
  void wakeOrStart();
  // After one has gone.
  void wake() const;
  void end();
  bool waitUntilEnded(Monotonic until);

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

  const StartThread startThread_;
  const UniqueFd wakeFd_{eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK)};
  SensorProxyClient sensor_;      // the thread's
  InterfaceStateFile stateFile_;  // the thread's
  Mutex mutex_;
  CondVar stopped_;
  bool running_ GUARDED_BY(mutex_) = false;
  bool ending_ GUARDED_BY(mutex_) = false;
};

void LinuxOrientation::Worker::wakeOrStart() {
  MutexLock lock(mutex_);
  if (running_) return wake();
  try {
    startThread_([self = shared_from_this()] { self->run(); }).detach();
    running_ = true;
  } catch (const std::system_error& failure) {
    VX_LOG(nullptr, Error, "orientation is off for now: no thread for it (%s)", failure.what());
  }
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

bool LinuxOrientation::Worker::waitUntilEnded(Monotonic until) {
  MutexLock lock(mutex_);
  while (running_) {
    if (!stopped_.waitUntil(
            mutex_, std::chrono::time_point_cast<std::chrono::steady_clock::duration>(until)))
      return !running_;
  }
  return true;
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
  stopped_.notifyAll();
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
    : LinuxOrientation(options, [](Function<void()> body) {
        return startThread("vx-orientation", std::move(body));
      }) {}

LinuxOrientation::LinuxOrientation(const OrientationOptions& options, StartThread startThread)
    : options_(options), worker_(std::make_shared<Worker>(options, std::move(startThread))) {}

LinuxOrientation::~LinuxOrientation() { worker_->end(); }

bool LinuxOrientation::stop(Monotonic until) {
  worker_->end();
  return worker_->waitUntilEnded(until);
}

void LinuxOrientation::add(OrientationHandlers& handlers, std::string_view identifier,
                           const void* registrant, Handler handler) {
  if (handlers.add(identifier, registrant, std::move(handler))) return worker_->wakeOrStart();
  refused_.fetch_add(1, std::memory_order_relaxed);
  VX_LOG(nullptr, Error,
         "no orientation for %s: %zu handlers are registered, and no more are taken",
         std::string(identifier).c_str(), OrientationHandlers::kMaxHandlers);
}

void LinuxOrientation::registerDeviceOrientationHandler(std::string_view identifier,
                                                        const void* registrant, Handler handler) {
  if (options_.deviceSensor) add(worker_->device, identifier, registrant, std::move(handler));
}

void LinuxOrientation::registerInterfaceOrientationHandler(std::string_view identifier,
                                                           const void* registrant,
                                                           Handler handler) {
  if (!options_.interfaceStateFile.empty())
    add(worker_->interface, identifier, registrant, std::move(handler));
}

void LinuxOrientation::unregisterDeviceOrientationHandler(std::string_view identifier,
                                                          const void* registrant) {
  if (worker_->device.remove(identifier, registrant)) worker_->wake();
}

void LinuxOrientation::unregisterInterfaceOrientationHandler(std::string_view identifier,
                                                             const void* registrant) {
  if (worker_->interface.remove(identifier, registrant)) worker_->wake();
}

std::string LinuxOrientation::orientationText(int64_t orientation) {
  return worker_->words.textOf(orientation);
}

}  // namespace vx::lnx
