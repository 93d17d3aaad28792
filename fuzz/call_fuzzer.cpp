// Whatever calls the clients of the service make: each is refused, or its arguments are what its
// operation takes, and it is answered, or let go of when its client has gone.
#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "Statistics/VXReportingProcessState.h"
#include "platform/linux/ipc/ArgumentReading.h"
#include "tests/fakes/FakePlatform.h"
#include "wire/FrameReader.h"
#include "wire/Protocol.h"

namespace {

struct Answers final : vx::ReplyTarget {
  void reply(uint64_t, vx::ReplyValue) override {}
  void release(uint64_t) override { --open; }
  int open = 0;
};

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static vx::wire::ReadBuffers buffers;
  vx::wire::FrameReader reader(buffers);
  if (size > reader.space().size()) return 0;
  std::copy_n(data, size, reader.space().begin());
  reader.received(size);
  vx::fakes::FakePlatform p;
  const vx::VXReportingProcessState state;
  const auto answers = std::make_shared<Answers>();
  auto service = vx::VXReportingServiceDelegate::create();
  p.journal.silent = true;
  std::shared_ptr<vx::fakes::FakeConnection> clients[2];
  for (auto& client : clients) {
    client = std::make_shared<vx::fakes::FakeConnection>(200);
    service->listener(p.listener, client);
  }
  std::span<const uint8_t> body;
  while (reader.next(body) == vx::wire::FrameReader::Next::Frame) {
    const auto frame = vx::Frame::decode(body);
    if (!frame || frame->size() < vx::wire::kCallHead) continue;
    const auto& client = *clients[(*frame)[1].asInt64() & 1];
    const auto number = static_cast<uint64_t>((*frame)[2].asInt64()) - 1;
    if (number >= client.interface->operations.size()) continue;
    const vx::OperationDescription& operation = client.interface->operations[number];
    vx::CallArguments arguments;
    if (vx::lnx::longestArray(operation, *frame) > 64) continue;
    if (!vx::lnx::readArguments(operation, *frame, arguments).ok()) continue;
    if (const auto element = vx::lnx::dictionaryElement(operation, *frame))
      arguments.set(*element - vx::wire::kCallHead, frame->payload(*element));
    ++answers->open;
    operation.invoke(*client.object, arguments, vx::Reply(answers, 0));
    if ((*frame)[1].asInt64() % 4 < 2) p.queues.advance(std::chrono::seconds(1));
  }
  for (auto& client : clients) {
    client->invalidation();
    client->object.reset();
  }
  p.queues.advance(std::chrono::seconds(100));
  if (answers->open != 0 || p.queues.waiting() != 0) __builtin_trap();
  return 0;
}
