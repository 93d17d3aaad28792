#include "platform/linux/execution/Executor.h"

#include <utility>

#include "platform/linux/execution/WorkItem.h"

namespace vx::lnx {

Executor::Executor()
    : interactive_(std::make_shared<Lane>(LaneOptions{"vx-interactive", 0, 0})),
      utility_(std::make_shared<Lane>(LaneOptions{"vx-utility", 5, 1})),
      background_(std::make_shared<Lane>(LaneOptions{"vx-background", 10, 2})),
      prompt_(std::make_shared<Lane>(LaneOptions{"vx-prompt", 0, 1})),
      concurrent_(background_, "com.quorvel.sonik.background") {}

const std::shared_ptr<Lane>& Executor::lane(QualityOfService quality) const {
  switch (quality) {
    case QualityOfService::UserInteractive:
      return interactive_;
    case QualityOfService::Utility:
      return utility_;
    case QualityOfService::Background:
      break;
  }
  return background_;
}

std::shared_ptr<WorkQueue> Executor::makeSerial(std::string_view label, QualityOfService quality) {
  return std::make_shared<SerialQueue>(lane(quality), label);
}

std::unique_ptr<WorkCause> Executor::takeCause() {
  return std::make_unique<HeldCause>(Cause::take());
}

void Executor::withoutCause(const Work& work) {
  const NoCause own;
  work();
}

void Executor::runPromptly(Work work) {
  const NoCause own;
  prompt_->postConcurrent(new WorkItem(std::move(work)));
}

void Executor::setInteractiveWaker(Function<void()> wake) {
  interactive_->setWaker(std::move(wake));
}

void Executor::setUtilityLowWater(std::size_t level, Function<void()> reached) {
  utility_->setLowWater(level, std::move(reached));
}

bool Executor::drain(Monotonic deadline) {
  const bool utility = utility_->drain(deadline);
  return background_->drain(deadline) && utility;
}

void Executor::stop(Monotonic deadline) {
  utility_->stop(deadline);
  background_->stop(deadline);
  interactive_->stop(deadline);
  prompt_->stop(deadline);
}

}  // namespace vx::lnx
