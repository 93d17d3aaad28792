// A loop that runs when the test says so, and a folder.
#pragma once

#include <memory>

#include "platform/linux/ipc/ListenerOptions.h"
#include "tests/ipc/TestHost.h"
#include "tests/linux/FolderTest.h"
#include "tests/wire/SocketEnd.h"

namespace vx::lnx {

class IpcTest : public FolderTest, protected TestLoop {
 protected:
  template <class Condition>
  void runUntil(const Condition& met) {
    while (!met()) loop_.runOnce(clock_.monotonic() + std::chrono::milliseconds(5));
  }

  ListenerOptions options;
  bool congested = false;
  std::shared_ptr<TestObject> object = std::make_shared<TestObject>();
};

}  // namespace vx::lnx
