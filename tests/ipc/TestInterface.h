// An exported object whose calls the test sees and answers as it likes.
#pragma once

#include <array>
#include <string>
#include <vector>

#include "platform/ClientConnection.h"
#include "platform/WorkQueue.h"
#include "wire/FrameWriter.h"

namespace vx::lnx {

enum TestOperation : uint8_t {
  kEcho = 1,
  kKeep,
  kHold,
  kAcquire,
  kRelease,
  kList,
  kTake,
  kMessage
};

struct TestObject final : ExportedObject {
  std::vector<std::string> calls;    // operation and first argument
  std::vector<Reply> kept;           // of kKeep and kHold
  std::vector<int64_t> list;         // what kList answers
  std::shared_ptr<WorkQueue> later;  // where kEcho and kList answer; at once without one

  void answer(Reply reply, ReplyValue value) const {
    if (later == nullptr) return reply(std::move(value));
    later->async([reply = std::move(reply), value = std::move(value)] { reply(value); });
  }
};

inline const InterfaceDescription& testInterface() {
  static constexpr std::array kInteger = {ArgumentKind::Int64};
  static constexpr std::array kAll = {ArgumentKind::UInt16, ArgumentKind::UInt32,
                                      ArgumentKind::OptionalDictionary,
                                      ArgumentKind::OptionalInt64Array};
  static constexpr auto note = [](ExportedObject& object, const char* what,
                                  CallArguments& arguments) -> TestObject& {
    auto& test = static_cast<TestObject&>(object);
    test.calls.push_back(what + std::to_string(arguments.int64(0)));
    return test;
  };
  static constexpr auto echo = [](ExportedObject& object, CallArguments& arguments, Reply reply) {
    note(object, "echo ", arguments).answer(std::move(reply), true);
  };
  static constexpr auto keep = [](ExportedObject& object, CallArguments& arguments, Reply reply) {
    note(object, "keep ", arguments).kept.push_back(std::move(reply));
  };
  static constexpr auto list = [](ExportedObject& object, CallArguments&, Reply reply) {
    auto& test = static_cast<TestObject&>(object);
    test.calls.emplace_back("list");
    test.answer(std::move(reply), test.list);
  };
  static constexpr auto take = [](ExportedObject& object, CallArguments& arguments, Reply reply) {
    std::string text =
        "take " + std::to_string(arguments.uint16(0)) + " " + std::to_string(arguments.uint32(1));
    if (const auto dictionary = arguments.optionalDictionary(2)) text += " " + dictionary->text();
    if (const auto numbers = arguments.optionalInt64Array(3)) {
      text += " [";
      for (const int64_t number : *numbers) text += std::to_string(number) + " ";
      text += "]";
    }
    static_cast<TestObject&>(object).calls.push_back(text);
    reply(std::monostate());
  };
  static constexpr std::array kDictionary = {ArgumentKind::Dictionary};
  static constexpr auto message = [](ExportedObject&, CallArguments& arguments, Reply reply) {
    reply(arguments.dictionary(0));
  };
  static constexpr std::array<OperationDescription, 8> kOperations = {{
      {.name = "echo", .arguments = kInteger, .reply = ReplyKind::Boolean, .invoke = echo},
      {.name = "keep", .arguments = kInteger, .reply = ReplyKind::Boolean, .invoke = keep},
      {.name = "hold",
       .arguments = kInteger,
       .reply = ReplyKind::Boolean,
       .replyMayBeHeld = true,
       .invoke = keep},
      {.name = "acquire",
       .arguments = kInteger,
       .reply = ReplyKind::Boolean,
       .resource = ResourceEffect::Acquire,
       .invoke = echo},
      {.name = "release",
       .arguments = kInteger,
       .reply = ReplyKind::Boolean,
       .resource = ResourceEffect::Release,
       .invoke = echo},
      {.name = "list", .arguments = {}, .reply = ReplyKind::Int64Array, .invoke = list},
      {.name = "take", .arguments = kAll, .reply = ReplyKind::OptionalError, .invoke = take},
      {.name = "message",
       .arguments = kDictionary,
       .reply = ReplyKind::Dictionary,
       .invoke = message},
  }};
  static constexpr InterfaceDescription kInterface{.name = "Test", .operations = kOperations};
  return kInterface;
}

inline std::vector<uint8_t> clientHello() {
  std::vector<uint8_t> out;
  wire::FrameWriter::hello(out).end();
  return out;
}

// `arguments` writes that many items.
template <class Write>
std::vector<uint8_t> callFrame(uint64_t number, int operation, std::size_t count,
                               const Write& arguments) {
  std::vector<uint8_t> out;
  wire::FrameWriter frame =
      wire::FrameWriter::call(out, number, static_cast<wire::Operation>(operation), count);
  arguments(frame.items());
  frame.end();
  return out;
}
inline std::vector<uint8_t> callFrame(uint64_t number, int operation, int64_t argument) {
  return callFrame(number, operation, 1, [&](CborWriter& w) { w.integer(argument); });
}

}  // namespace vx::lnx
