// An exported object whose calls somebody sees and answers as he likes, and what a connection that
// exports it needs around it.
#pragma once

#include <array>
#include <memory>
#include <new>
#include <string>
#include <utility>
#include <vector>

#include "platform/ClientConnection.h"
#include "platform/WorkQueue.h"
#include "platform/linux/execution/EventLoop.h"
#include "platform/linux/execution/SystemThreading.h"
#include "platform/linux/ipc/SocketConnection.h"

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
      for (const int64_t number : *numbers) text += " " + std::to_string(number);
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

// The interactive thread's.
struct TestLoop {
  TestLoop() { executor_.adoptInteractiveThread(); }
  ~TestLoop() { executor_.stop(Monotonic::max()); }
  void pass() { loop_.runOnce(Monotonic{}); }
  void run() {
    for (int i = 0; i < 12; ++i) pass();
  }

  SystemClock clock_;
  UserAccounts accounts_;
  Executor executor_{accounts_};
  EventLoop loop_{executor_, clock_};
};

// The connections' surroundings, of which a test is the other half.
class TestHost : public ConnectionHost {
 public:
  TestHost(TestLoop& loop, Clock& clock, const ListenerOptions& limits, const bool& congested)
      : on_(loop), time_(clock), limits_(limits), congested_(congested) {
    on_.loop_.addRound([this] { return turns_.runRound(); });
    on_.loop_.addPassEndHook([this] {
      for (const auto& c : std::exchange(toFlush_, {})) c->flush();
    });
  }

  // ConnectionHost
  EventLoop& loop() override { return on_.loop_; }
  Executor& executor() override { return on_.executor_; }
  Clock& clock() override { return time_; }
  const ListenerOptions& limits() const override { return limits_; }
  ListenerCounters& counters() override { return counted; }
  CallRecorder& recorder() override { return records; }
  wire::ReadBuffers& readBuffers() override { return buffers_; }
  bool readingPaused(UserIndex) override { return congested_; }
  UserAccounts& accounts() override { return on_.accounts_; }
  void waitForReading(const std::shared_ptr<SocketConnection>&, std::size_t) override { ++waits; }
  void readInTurn(uid_t user, std::shared_ptr<TurnTaker> reader) override {
    turns_.add(user, std::move(reader));
  }
  void flushAtPassEnd(const std::shared_ptr<SocketConnection>& c) override {
    toFlush_.push_back(c);
  }
  void unreadChanged(SocketConnection&, bool unread) override { unreadSays = unread; }
  void closed(SocketConnection&) override { ++closes; }

  ListenerCounters counted;
  CallRecorder records;
  bool unreadSays = false;
  int waits = 0;
  int closes = 0;

 private:
  TestLoop& on_;
  Clock& time_;
  const ListenerOptions& limits_;
  const bool& congested_;
  ReadTurns turns_{on_.executor_, time_};
  wire::ReadBuffers buffers_;
  std::vector<std::shared_ptr<SocketConnection>> toFlush_;
};

}  // namespace vx::lnx
