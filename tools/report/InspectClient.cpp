#include "tools/report/InspectClient.h"

#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>

#include "tools/report/Command.h"
#include "wire/FrameWriter.h"

namespace vx::report {

namespace {

using wire::FrameKind;
using wire::FrameWriter;

// Either end's bound is smaller; what is larger is no frame of the service.
constexpr std::size_t kMostFrameBytes = wire::kMaxFrameBytes;

std::string socketPath() {
  if (const char* named = std::getenv("VXREPORTING_INSPECT_SOCKET")) return named;
  const char* const service = std::getenv("VXREPORTING_SOCKET");
  const std::string beside = service != nullptr ? service : "/run/vxreporting/service.socket";
  return beside.substr(0, beside.find_last_of('/') + 1) + "inspect.socket";
}

std::string why(const std::string& path) {
  const int code = errno;
  std::string text = "cannot ask the service at " + path + ": " + std::strerror(code);
  if (code == EACCES) text += "; root and members of the group vxreporting-read may";
  if (code == ENOENT || code == ECONNREFUSED) text += "; no service runs there";
  return text;
}

// Not a descriptor: errno says why.
UniqueFd connectTo(const std::string& path) {
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  if (path.size() >= sizeof address.sun_path) throw Failure(path + " is too long for a socket");
  std::memcpy(address.sun_path, path.c_str(), path.size() + 1);
  UniqueFd socket(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  if (!socket ||
      connect(socket.get(), reinterpret_cast<const sockaddr*>(&address), sizeof address) != 0)
    return UniqueFd();
  return socket;
}

}  // namespace

InspectClient::InspectClient() : path_(socketPath()), socket_(connectTo(path_)) {
  if (!socket_) throw Failure(why(path_));
  sayHello();
}

InspectClient::InspectClient(const std::string& path, UniqueFd socket)
    : path_(path), socket_(std::move(socket)) {
  sayHello();
}

std::optional<InspectClient> InspectClient::ifThere() {
  const std::string path = socketPath();
  UniqueFd socket = connectTo(path);
  if (!socket && errno != ENOENT && errno != ECONNREFUSED) throw Failure(why(path));
  if (!socket) return std::nullopt;
  return InspectClient(path, std::move(socket));
}

void InspectClient::sayHello() {
  std::vector<uint8_t> hello;
  FrameWriter::hello(hello).end();
  send(hello);
}

void InspectClient::send(const std::vector<uint8_t>& bytes) {
  // What it turns a caller away with is there to be read even so.
  for (std::size_t sent = 0; sent < bytes.size();) {
    const ssize_t some =
        ::send(socket_.get(), bytes.data() + sent, bytes.size() - sent, MSG_NOSIGNAL);
    if (some < 0 && errno != EINTR) return;
    if (some > 0) sent += static_cast<std::size_t>(some);
  }
}

void InspectClient::read() {
  pollfd ready{.fd = socket_.get(), .events = POLLIN, .revents = 0};
  const int code =
      poll(&ready, 1, static_cast<int>(std::min<int64_t>(patience_.count(), INT32_MAX)));
  if (code == 0) throw Failure("the service does not answer at " + path_);
  uint8_t bytes[16 << 10];
  const ssize_t got = code < 0 ? -1 : recv(socket_.get(), bytes, sizeof bytes, 0);
  if (got < 0 && errno == EINTR) return;
  if (got <= 0) throw Failure("the service at " + path_ + " has ended");
  received_.insert(received_.end(), bytes, bytes + got);
}

Payload InspectClient::receive(uint64_t number) {
  for (;;) {
    while (received_.size() < wire::kLengthBytes) read();
    std::size_t length = 0;
    for (std::size_t i = wire::kLengthBytes; i-- > 0;) length = length << 8 | received_[i];
    if (length > kMostFrameBytes) throw Failure(path_ + " is not a socket of the service");
    while (received_.size() < wire::kLengthBytes + length) read();
    const std::vector<uint8_t> body(
        received_.begin() + wire::kLengthBytes,
        received_.begin() + static_cast<std::ptrdiff_t>(wire::kLengthBytes + length));
    received_.erase(received_.begin(),
                    received_.begin() + static_cast<std::ptrdiff_t>(wire::kLengthBytes + length));
    const std::optional<Frame> frame = Frame::decode(body);
    if (!frame || frame->empty()) throw Failure(path_ + " is not a socket of the service");
    const int64_t kind = (*frame)[0].asInt64();
    if (kind == static_cast<int64_t>(FrameKind::Error) && frame->size() >= 4)
      throw Failure("the service refuses: " + printable((*frame)[3].asString()));
    if (kind == static_cast<int64_t>(FrameKind::Goodbye)) throw Failure("the service has ended");
    if (kind != static_cast<int64_t>(FrameKind::Reply) || frame->size() < 3 ||
        (*frame)[1].asUInt64() != number || !(*frame)[2].isDictionary())
      continue;
    return frame->payload(2);
  }
}

Payload InspectClient::call(wire::InspectOperation operation, std::size_t count,
                            const Arguments& arguments) {
  std::vector<uint8_t> bytes;
  FrameWriter frame(bytes, FrameKind::Call, 2 + count);
  frame.items().unsignedInteger(++calls_);
  frame.items().integer(static_cast<int64_t>(operation));
  if (arguments) arguments(frame.items());
  frame.end();
  send(bytes);
  return receive(calls_);
}

Payload InspectClient::callOn(wire::InspectOperation operation, int64_t number) {
  return call(operation, 1, [number](CborWriter& items) { items.integer(number); });
}

std::vector<Payload> InspectClient::all(wire::InspectOperation operation, const char* key) {
  std::vector<Payload> all;
  for (int64_t first = 0;;) {
    const Payload part = callOn(operation, first);
    const auto listed = part.find(key);
    if (!listed) return all;
    for (const Value& one : listed->asArray()) all.push_back(Payload::copyOf(one));
    const auto next = part.find("next");
    if (!next || next->asInt64() <= first) return all;
    first = next->asInt64();
  }
}

}  // namespace vx::report
