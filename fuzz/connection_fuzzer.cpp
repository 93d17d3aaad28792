// Whatever a peer sends and wherever its stream is cut, whether calls are answered late, twice or
// never and answers are read or not: it reads frames, and its connection ends once and wholly.
#include <sys/socket.h>

#include "tests/fakes/FakePlatform.h"
#include "tests/ipc/TestHost.h"

namespace vx::lnx {

struct World : TestLoop {
  fakes::FakePlatform p;
  const ListenerOptions limits{.maxSessionsPerConnection = 2,
                               .maxIdentifiers = 4,
                               .maxCallsInFlight = 3,
                               .maxFrameBytes = 4096,
                               .maxUnreadReplyBytes = 8192};
  bool congested = false;
  TestHost host{*this, p.clock, limits, congested};
};

static void require(bool holds) {
  if (!holds) __builtin_trap();
}

static void readFrames(int socket, wire::FrameReader& reader) {
  std::span<const uint8_t> body;
  reader.received(static_cast<std::size_t>(
      std::max<ssize_t>(0, recv(socket, reader.space().data(), 1500, MSG_DONTWAIT))));
  while (reader.next(body) == wire::FrameReader::Next::Frame)
    require(Frame::decode(body).has_value());
  reader.keepRest();
}

}  // namespace vx::lnx

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  using namespace vx::lnx;
  static World w;
  int ends[2];
  const int least = 1;
  require(socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, ends) == 0);
  setsockopt(ends[1], SOL_SOCKET, SO_SNDBUF, &least, sizeof least);
  vx::wire::FrameReader reader(w.host.readBuffers());
  auto object = std::make_shared<TestObject>();
  auto connection =
      std::make_shared<SocketConnection>(w.host, vx::UniqueFd(ends[1]), 200, 501, kServiceItself);
  int invalidations = 0;
  connection->setExportedInterface(testInterface());
  connection->setExportedObject(object);
  connection->setInvalidationHandler([&] { ++invalidations; });
  connection->resume();
  w.host.closes = 0;
  for (std::size_t at = 0; at < size; w.pass()) {
    const uint8_t step = data[at++];
    const std::size_t length = std::min<std::size_t>(step & 63, size - at);
    if (step < 128) {  // bytes, or a frame of them
      std::vector<uint8_t> bytes{static_cast<uint8_t>(length), 0, 0, 0};
      if (step < 64) bytes.clear();
      bytes.insert(bytes.end(), data + at, data + at + length);
      (void)send(ends[0], bytes.data(), bytes.size(), MSG_NOSIGNAL | MSG_DONTWAIT);
      at += length;
      continue;
    }
    switch (step & 7) {
      case 0:
        if (!object->kept.empty()) object->kept.front()(true);
        break;
      case 1:
        if (!object->kept.empty()) object->kept.erase(object->kept.begin());
        break;
      case 2:
        readFrames(ends[0], reader);
        break;
      case 3:
        shutdown(ends[0], step & 8 ? SHUT_RD : SHUT_WR);
        break;
      case 4:
        w.congested = !w.congested;
        if (!w.congested) connection->continueReading();
        break;
      case 5:
        object->list.assign((step & 63) * 20, 1);
        break;
      case 6:
        object->later = step & 8
                            ? w.executor_.makeSerial("later", vx::QualityOfService::UserInteractive)
                            : nullptr;
        break;
      case 7:
        if (step == 0xFF) connection->shutDown();
        w.p.clock.advance(std::chrono::seconds(4));
        if (const auto due = connection->stallDeadline(); due && *due <= w.p.clock.monotonic())
          connection->cutStalled();
    }
  }
  w.congested = false;
  object->kept.clear();
  connection->shutDownNow();
  readFrames(ends[0], reader);
  close(ends[0]);
  while (connection.use_count() > 1)
    w.loop_.runOnce(w.clock_.monotonic() + std::chrono::milliseconds(5));
  require(w.host.closes == 1 && invalidations == 1 && !w.host.unreadSays);
  connection.reset();
  require(object.use_count() == 1);
  return 0;
}
