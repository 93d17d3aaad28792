// What there is once per process, however many sessions there are.
#pragma once

#include <atomic>
#include <memory>
#include <optional>

#include "Statistics/Service/VXReportingDelayedMessages.h"
#include "base/Mutex.h"
#include "platform/ScopedLog.h"

namespace vx {

// The process makes its own when it is first asked for. Another takes its place for as long as it
// lives: a process that sets up the service anew on another platform owns one for each.
// Thread-safe.
class VXReportingProcessState {
 public:
  VXReportingProcessState();
  ~VXReportingProcessState();
  VXReportingProcessState(const VXReportingProcessState&) = delete;
  VXReportingProcessState& operator=(const VXReportingProcessState&) = delete;
  static VXReportingProcessState& current();

  VXReportingDelayedMessages& delayedMessages() { return *delayedMessages_; }
  // Asks the device the first time.
  bool isInternalBuild();
  // Registers the "vxrr" scope the first time.
  void registerSessionLogScope();
  const LogScope* sessionLogScope() const {
    return sessionLogScope_.load(std::memory_order_acquire);
  }

 private:
  VXReportingProcessState* const replaced_;
  const std::shared_ptr<VXReportingDelayedMessages> delayedMessages_ =
      std::make_shared<VXReportingDelayedMessages>();
  Mutex mutex_;
  std::optional<bool> internalBuild_ GUARDED_BY(mutex_);
  bool sessionScopeRegistered_ GUARDED_BY(mutex_) = false;
  std::atomic<const LogScope*> sessionLogScope_{nullptr};
};

}  // namespace vx
