#include "platform/linux/execution/Executor.h"

#include <utility>

#include "platform/linux/execution/WorkItem.h"

namespace vx::lnx {

Executor::Executor(UserAccounts& accounts)
    : accounts_(accounts),
      interactive_(std::make_shared<Lane>(LaneOptions{"vx-interactive", 0, 0}, accounts)),
      utility_(std::make_shared<Lane>(LaneOptions{"vx-utility", 5, 1}, accounts)),
      background_(std::make_shared<Lane>(LaneOptions{"vx-background", 10, 2}, accounts)),
      prompt_(std::make_shared<Lane>(LaneOptions{"vx-prompt", 0, 1}, accounts)),
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

std::unique_ptr<WorkCause> Executor::takeCause(std::size_t holds) {
  return std::make_unique<HeldCause>(Cause::take(), accounts_, holds);
}

void Executor::withoutCause(const Work& work) {
  const NoCause own;
  work();
}

void Executor::runPromptly(Work work) {
  const NoCause own;
  prompt_->postConcurrent(new WorkItem(std::move(work)), 0);
}

void Executor::setInteractiveWaker(Function<void()> wake) {
  interactive_->setWaker(std::move(wake));
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
