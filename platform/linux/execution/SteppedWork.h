// Work that is done in steps, with other work in between.
#pragma once

#include <cstdint>
#include <memory>
#include <new>
#include <stdexcept>
#include <string>
#include <utility>

#include "base/Function.h"
#include "platform/Log.h"
#include "platform/linux/execution/CauseScope.h"
#include "platform/linux/execution/Lane.h"

namespace vx::lnx {

// What is left of it. Whatever a step causes belongs to the item of the queue that did the first
// one, as if that had done them all. A step that fails for lack of memory is not tried again. Owned
// by whoever runs it; belongs to the interactive thread.
class SteppedWork {
 public:
  // Within that item.
  SteppedWork(std::shared_ptr<const WorkQueue> queue, Function<bool()> step)
      : queue_(std::move(queue)),
        cause_(CauseScope::share()),
        taken_(CauseScope::taken()),
        step_(std::move(step)) {}
  // Of work that is dropped, the call is not done.
  ~SteppedWork() {
    if (step_) cause_.ticket.abandon();
  }
  SteppedWork(const SteppedWork&) = delete;
  SteppedWork& operator=(const SteppedWork&) = delete;

  UserIndex user() const { return cause_.user; }
  // False: there was none, or it was the last.
  bool runStep() {
    if (!step_) return false;
    const Lane::Current onQueue(queue_.get());
    const CauseScope scope(cause_, taken_);
    bool more = true;
    try {
      more = step_();
    } catch (const std::bad_alloc&) {
      giveUpStep();
    } catch (const std::length_error&) {
      giveUpStep();
    }
    taken_ = CauseScope::taken();
    if (!more) step_ = nullptr;
    return more;
  }

 private:
  void giveUpStep() {
    VX_LOG(nullptr, Error, "there is no memory for a part of %s; it is left out",
           std::string(queue_->label()).c_str());
  }

  const std::shared_ptr<const WorkQueue> queue_;
  Cause cause_;
  uint32_t taken_;
  Function<bool()> step_;
};

}  // namespace vx::lnx
