#include "benchmarks/RawClient.h"

#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>

#include "wire/FrameWriter.h"

namespace vx::bench {

namespace {

using wire::FrameReader;
using wire::FrameWriter;
using wire::Operation;

constexpr uint64_t kCallNumber = 1;       // every ordinary call; answers need not be told apart
constexpr uint64_t kHeldNumber = 900000;  // starts, whose answers come later and do not count

// `arguments` writes that many items.
template <class Write>
std::vector<uint8_t> callFrame(wire::Operation operation, std::size_t count, const Write& arguments,
                               uint64_t number = kCallNumber) {
  std::vector<uint8_t> bytes;
  FrameWriter frame = FrameWriter::call(bytes, number, operation, count);
  arguments(frame.items());
  frame.end();
  return bytes;
}

}  // namespace

RawClient::RawClient(const std::string& socketPath)
    : fd_(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
  if (connect(fd_.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    throw std::runtime_error("cannot connect to " + socketPath + ": " + std::strerror(errno));
  }
  std::vector<uint8_t> hello;
  FrameWriter::hello(hello).end();
  sendAll(hello.data(), hello.size());
  uint8_t buffer[512];
  if (recv(fd_.get(), buffer, sizeof buffer, 0) < 6 || buffer[4] != 0x83 || buffer[5] != 0) {
    throw std::runtime_error("the daemon did not answer the hello");
  }
}

void RawClient::sendAll(const uint8_t* data, std::size_t size) {
  while (size > 0) {
    const ssize_t sent = send(fd_.get(), data, size, MSG_NOSIGNAL);
    if (sent <= 0) throw std::runtime_error("the daemon closed the connection");
    data += sent;
    size -= static_cast<std::size_t>(sent);
  }
}

std::size_t RawClient::receiveReplies() {
  const std::span<uint8_t> space = reader_.space();
  const ssize_t got = recv(fd_.get(), space.data(), space.size(), 0);
  if (got <= 0) throw std::runtime_error("the daemon closed the connection");
  reader_.received(static_cast<std::size_t>(got));
  std::size_t replies = 0;
  std::span<const uint8_t> body;
  while (reader_.next(body) == FrameReader::Next::Frame) {
    // [2, number, value]; an error frame starts with 0x84 0x03.
    if (body[0] != 0x83 || body[1] != 0x02)
      throw std::runtime_error("the daemon answered with an error");
    if (body[2] == kCallNumber) ++replies;
  }
  return replies;
}

template <class Write>
void RawClient::call(Operation operation, std::size_t count, const Write& arguments) {
  const std::vector<uint8_t> frame = callFrame(operation, count, arguments);
  sendAll(frame.data(), frame.size());
  while (receiveReplies() == 0) {
  }
}

void RawClient::create(int64_t reporter) {
  call(Operation::CreateReportingSession, 1, [&](CborWriter& w) { w.integer(reporter); });
}

void RawClient::setServiceType(uint16_t type, int64_t reporter) {
  call(Operation::SetServiceType, 2, [&](CborWriter& w) {
    w.integer(type);
    w.integer(reporter);
  });
}

void RawClient::configure(const Payload& configuration, int64_t reporter) {
  call(Operation::SetConfiguration, 2, [&](CborWriter& w) {
    w.encoded(configuration.encoded());
    w.integer(reporter);
  });
}

void RawClient::start(int64_t reporter) {
  const auto argument = [&](CborWriter& w) { w.integer(reporter); };
  const std::vector<uint8_t> frame =
      callFrame(Operation::StartReportingSessionForID, 1, argument, kHeldNumber);
  sendAll(frame.data(), frame.size());
  call(Operation::GetServiceNameForReporterID, 1, argument);  // answered once the start has run
}

void RawClient::stop(int64_t reporter) {
  call(Operation::StopReportingSessionForID, 1, [&](CborWriter& w) { w.integer(reporter); });
}

void RawClient::sendOnce(const std::vector<uint8_t>& frame) {
  uint8_t buffer[4096];
  if (send(fd_.get(), frame.data(), frame.size(), MSG_NOSIGNAL) !=
          static_cast<ssize_t>(frame.size()) ||
      recv(fd_.get(), buffer, sizeof buffer, 0) < 8 || buffer[4] != 0x83 || buffer[5] != 0x02) {
    throw std::runtime_error("a round trip failed");
  }
}

void RawClient::pump(const std::vector<std::vector<uint8_t>>& frames, std::size_t count,
                     std::size_t window) {
  std::vector<uint8_t> batch;
  std::size_t sent = 0;
  std::size_t answered = 0;
  while (answered < count) {
    batch.clear();
    while (sent < count && sent - answered < window && batch.size() < (48u << 10)) {
      const std::vector<uint8_t>& frame = frames[sent++ % frames.size()];
      batch.insert(batch.end(), frame.begin(), frame.end());
    }
    if (!batch.empty()) sendAll(batch.data(), batch.size());
    answered += receiveReplies();
  }
}

std::vector<uint8_t> RawClient::messageFrame(const Payload& payload, const int64_t* reporter) {
  return callFrame(Operation::SendMessage, 4, [&](CborWriter& w) {
    w.encoded(payload.encoded());
    w.unsignedInteger(0x08000003);
    w.unsignedInteger(0);
    if (reporter == nullptr) {
      w.null();
    } else {
      w.array(1);
      w.integer(*reporter);
    }
  });
}

}  // namespace vx::bench
