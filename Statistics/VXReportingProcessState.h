// What is asked or registered once per process, however many sessions there are.
#pragma once

#include <atomic>
#include <optional>

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

  // Asks the device the first time.
  bool isInternalBuild();
  // Registers the "vxrr" scope the first time.
  void registerSessionLogScope();
  const LogScope* sessionLogScope() const {
    return sessionLogScope_.load(std::memory_order_acquire);
  }

 private:
  VXReportingProcessState* const replaced_;
  Mutex mutex_;
  std::optional<bool> internalBuild_ GUARDED_BY(mutex_);
  bool sessionScopeRegistered_ GUARDED_BY(mutex_) = false;
  std::atomic<const LogScope*> sessionLogScope_{nullptr};
};

}  // namespace vx
