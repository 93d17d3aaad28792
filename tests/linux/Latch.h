// Something another thread does, waited for.
#pragma once

#include <chrono>
#include <future>

namespace vx::lnx {

class Latch {
 public:
  void open() { promise_.set_value(); }
  // False when it has taken too long for any machine.
  bool wait() const {
    return opened_.wait_for(std::chrono::seconds(30)) == std::future_status::ready;
  }

 private:
  std::promise<void> promise_;
  const std::shared_future<void> opened_ = promise_.get_future().share();
};

}  // namespace vx::lnx
