#include "Statistics/VXReportingProcessState.h"

#include "platform/Platform.h"

namespace vx {

namespace {

std::atomic<VXReportingProcessState*> currentState{nullptr};

}  // namespace

VXReportingProcessState::VXReportingProcessState() : replaced_(currentState.exchange(this)) {}

VXReportingProcessState::~VXReportingProcessState() { currentState.store(replaced_); }

VXReportingProcessState& VXReportingProcessState::current() {
  if (auto* const state = currentState.load(std::memory_order_acquire)) return *state;
  // Never destroyed: a thread may log until the process ends.
  static auto* const ofTheProcess = new VXReportingProcessState;
  return *ofTheProcess;
}

bool VXReportingProcessState::isInternalBuild() {
  MutexLock lock(mutex_);
  if (!internalBuild_) internalBuild_ = platform().deviceProperties.boolean("InternalBuild");
  return *internalBuild_;
}

void VXReportingProcessState::registerSessionLogScope() {
  MutexLock lock(mutex_);
  if (sessionScopeRegistered_) return;
  sessionScopeRegistered_ = true;
  sessionLogScope_.store(
      platform().log.registerScope(true, fourCharacterCode("vxrr"), "vxrr", "com.quorvel.sonik",
                                   "reporting_session_verbose", 31),
      std::memory_order_release);
}

}  // namespace vx
