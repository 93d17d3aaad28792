// An exported object whose calls the test sees and answers as it likes, and a loop that runs when
// the test says so.
#pragma once

#include <array>
#include <new>
#include <string>
#include <vector>

#include "platform/ClientConnection.h"
#include "platform/WorkQueue.h"
#include "platform/linux/execution/EventLoop.h"
#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/ipc/ListenerOptions.h"
#include "tests/linux/FolderTest.h"
#include "tests/wire/SocketEnd.h"

namespace vx::lnx {

enum : uint8_t { kEcho = 1, kKeep, kHold, kAcquire, kRelease, kList, kTake, kMessage, kEnd };

struct TestObject final : ExportedObject {
  std::vector<std::string> calls;    // operation and arguments
  std::vector<Reply> kept;           // of kKeep and kHold
  std::vector<int64_t> list;         // what kList answers
  bool hasMemory = true;             // for kKeep
  std::shared_ptr<WorkQueue> later;  // where kEcho and kList answer; at once without one

  void answer(Reply reply, ReplyValue value) const {
    if (later == nullptr) return reply(std::move(value));
    later->async([reply = std::move(reply), value = std::move(value)] { reply(value); });
  }
  static TestObject& note(ExportedObject& object, std::string call) {
    auto& test = static_cast<TestObject&>(object);
    test.calls.push_back(std::move(call));
    return test;
  }
  static void runEcho(ExportedObject& object, CallArguments& arguments, Reply reply) {
    note(object, "echo " + std::to_string(arguments.int64(0))).answer(std::move(reply), true);
  }
  static void runKeep(ExportedObject& object, CallArguments&, Reply reply) {
    if (!note(object, "keep").hasMemory) throw std::bad_alloc();
    static_cast<TestObject&>(object).kept.push_back(std::move(reply));
  }
  static void runList(ExportedObject& object, CallArguments&, Reply reply) {
    const TestObject& test = note(object, "list");
    test.answer(std::move(reply), test.list);
  }
  static void runTake(ExportedObject& object, CallArguments& arguments, Reply reply) {
    std::string text =
        "take " + std::to_string(arguments.uint16(0)) + " " + std::to_string(arguments.uint32(1));
    if (const auto dictionary = arguments.optionalDictionary(2)) text += " " + dictionary->text();
    if (const auto numbers = arguments.optionalInt64Array(3))
      text += " " + testing::PrintToString(*numbers);
    note(object, text);
    reply(std::monostate());
  }
  static void runMessage(ExportedObject&, CallArguments& arguments, Reply reply) {
    reply(arguments.dictionary(0));
  }
};

inline const InterfaceDescription& testInterface() {
  using Object = TestObject;
  using enum ArgumentKind;
  using enum ResourceEffect;
  static constexpr std::array kInteger = {Int64};
  static constexpr std::array kAll = {UInt16, UInt32, OptionalDictionary, OptionalInt64Array};
  static constexpr std::array kDictionary = {Dictionary};
  static constexpr std::array<OperationDescription, 9> kOperations = {{
      {"echo", kInteger, ReplyKind::Boolean, false, None, true, Object::runEcho, nullptr},
      {"keep", kInteger, ReplyKind::Boolean, false, None, true, Object::runKeep, nullptr},
      {"hold", kInteger, ReplyKind::Boolean, true, None, true, Object::runKeep, nullptr},
      {"acquire", kInteger, ReplyKind::Boolean, false, Acquire, true, Object::runEcho, nullptr,
       false, true},
      {"release", kInteger, ReplyKind::Boolean, false, Release, true, Object::runEcho, nullptr},
      {"list",
       {},
       ReplyKind::Int64Array,
       false,
       None,
       true,
       Object::runList,
       [](const CallArguments&) { return true; }},
      {"take", kAll, ReplyKind::OptionalError, false, None, true, Object::runTake, nullptr},
      {"message", kDictionary, ReplyKind::Dictionary, false, None, true, Object::runMessage,
       nullptr},
      {"end", {}, ReplyKind::Boolean, false, None, true, Object::runKeep, nullptr, true},
  }};
  static constexpr InterfaceDescription kInterface{.name = "Test", .operations = kOperations};
  return kInterface;
}

class IpcTest : public FolderTest {
 protected:
  IpcTest() { executor_.adoptInteractiveThread(); }
  ~IpcTest() override { executor_.stop(Monotonic::max()); }
  void pass() { loop_.runOnce(Monotonic{}); }
  void run() {
    for (int i = 0; i < 12; ++i) pass();
  }
  template <class Condition>
  void runUntil(const Condition& met) {
    while (!met()) loop_.runOnce(clock_.monotonic() + std::chrono::milliseconds(5));
  }

  SystemClock clock_;
  UserAccounts accounts_;
  Executor executor_{accounts_};
  EventLoop loop_{executor_, clock_};
  ListenerOptions options;
  bool congested = false;
  std::shared_ptr<TestObject> object = std::make_shared<TestObject>();
};

}  // namespace vx::lnx
