// The end of this process.
#pragma once

#include <cstdlib>

#include "platform/ProcessInfoQuery.h"

namespace vx::lnx {

// Without destructors or exit handlers: nothing that is under way can hold it up.
class ImmediateProcessControl final : public ProcessControl {
 public:
  void exit(int status) override { std::_Exit(status); }
};

}  // namespace vx::lnx
