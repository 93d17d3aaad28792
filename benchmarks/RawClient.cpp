#include "benchmarks/RawClient.h"

#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <stdexcept>

#include "propertylist/CborWriter.h"

namespace vx::bench {

namespace {

constexpr uint64_t kCallNumber = 1;       // every ordinary call; answers need not be told apart
constexpr uint64_t kHeldNumber = 900000;  // starts, whose answers come later and do not count

std::vector<uint8_t> frameOf(const std::vector<uint8_t>& body) {
  std::vector<uint8_t> frame;
  frame.reserve(4 + body.size());
  for (int i = 0; i < 4; ++i) frame.push_back(static_cast<uint8_t>(body.size() >> (8 * i)));
  frame.insert(frame.end(), body.begin(), body.end());
  return frame;
}

std::vector<uint8_t> callBody(uint64_t arguments, int64_t operation,
                              uint64_t number = kCallNumber) {
  std::vector<uint8_t> body;
  CborWriter writer(body);
  writer.array(3 + arguments);
  writer.integer(1);
  writer.unsignedInteger(number);
  writer.integer(operation);
  return body;
}

}  // namespace

RawClient::RawClient(const std::string& socketPath)
    : fd_(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0)) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
  if (connect(fd_, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    throw std::runtime_error("cannot connect to " + socketPath + ": " + std::strerror(errno));
  }
  const uint8_t hello[] = {3, 0, 0, 0, 0x82, 0x00, 0x01};
  sendAll(hello, sizeof hello);
  uint8_t buffer[512];
  if (recv(fd_, buffer, sizeof buffer, 0) < 6 || buffer[4] != 0x83 || buffer[5] != 0) {
    throw std::runtime_error("the daemon did not answer the hello");
  }
}

RawClient::~RawClient() {
  if (fd_ >= 0) close(fd_);
}

void RawClient::sendAll(const uint8_t* data, std::size_t size) {
  while (size > 0) {
    const ssize_t sent = send(fd_, data, size, MSG_NOSIGNAL);
    if (sent <= 0) throw std::runtime_error("the daemon closed the connection");
    data += sent;
    size -= static_cast<std::size_t>(sent);
  }
}

std::size_t RawClient::receiveReplies() {
  const std::size_t had = in_.size();
  in_.resize(had + (64 << 10));
  const ssize_t got = recv(fd_, in_.data() + had, 64 << 10, 0);
  if (got <= 0) throw std::runtime_error("the daemon closed the connection");
  in_.resize(had + static_cast<std::size_t>(got));
  std::size_t replies = 0;
  std::size_t at = 0;
  while (in_.size() - at >= 4) {
    const std::size_t length =
        in_[at] | std::size_t{in_[at + 1]} << 8 | std::size_t{in_[at + 2]} << 16;
    if (in_.size() - at - 4 < length) break;
    // [2, number, value]; an error frame starts with 0x84 0x03.
    const uint8_t* body = in_.data() + at + 4;
    if (body[0] != 0x83 || body[1] != 0x02)
      throw std::runtime_error("the daemon answered with an error");
    if (body[2] == kCallNumber) ++replies;
    at += 4 + length;
  }
  in_.erase(in_.begin(), in_.begin() + static_cast<std::ptrdiff_t>(at));
  return replies;
}

void RawClient::call(std::vector<uint8_t> body) {
  const std::vector<uint8_t> frame = frameOf(body);
  sendAll(frame.data(), frame.size());
  while (receiveReplies() == 0) {
  }
}

void RawClient::create(int64_t reporter) {
  std::vector<uint8_t> body = callBody(1, 1);
  CborWriter(body).integer(reporter);
  call(std::move(body));
}

void RawClient::setServiceType(uint16_t type, int64_t reporter) {
  std::vector<uint8_t> body = callBody(2, 2);
  CborWriter(body).integer(type);
  CborWriter(body).integer(reporter);
  call(std::move(body));
}

void RawClient::configure(const Payload& configuration, int64_t reporter) {
  std::vector<uint8_t> body = callBody(2, 4);
  CborWriter(body).encoded(configuration.encoded());
  CborWriter(body).integer(reporter);
  call(std::move(body));
}

void RawClient::start(int64_t reporter) {
  std::vector<uint8_t> body = callBody(1, 5, kHeldNumber);
  CborWriter(body).integer(reporter);
  const std::vector<uint8_t> frame = frameOf(body);
  sendAll(frame.data(), frame.size());
  std::vector<uint8_t> validate = callBody(1, 3);  // answered once the start has run
  CborWriter(validate).integer(reporter);
  call(std::move(validate));
}

void RawClient::stop(int64_t reporter) {
  std::vector<uint8_t> body = callBody(1, 7);
  CborWriter(body).integer(reporter);
  call(std::move(body));
}

void RawClient::sendOnce(const std::vector<uint8_t>& frame) {
  uint8_t buffer[4096];
  if (send(fd_, frame.data(), frame.size(), MSG_NOSIGNAL) != static_cast<ssize_t>(frame.size()) ||
      recv(fd_, buffer, sizeof buffer, 0) < 8 || buffer[4] != 0x83 || buffer[5] != 0x02) {
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
  std::vector<uint8_t> body = callBody(4, 6);
  CborWriter writer(body);
  writer.encoded(payload.encoded());
  writer.unsignedInteger(0x08000003);
  writer.unsignedInteger(0);
  if (reporter == nullptr) {
    writer.null();
  } else {
    writer.array(1);
    writer.integer(*reporter);
  }
  return frameOf(body);
}

}  // namespace vx::bench
