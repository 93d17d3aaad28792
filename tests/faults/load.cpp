// One client of a kind, for the fault programs: vx_load SOCKET SECONDS KIND [COUNT]
//   probe        sends a message each millisecond to a session of its own and waits for the answer
//   flood        COUNT connections, each sending to its own session as fast as it is answered
//   sessions     one connection, sending to COUNT started sessions
//   reporters    COUNT connections that ask for all reporters
//   mixed        like flood, and each tenth call starts or stops a session
//   hostile      connects again and again, COUNT times, each time with bytes that are no call
// The last line: answers=N refused=N p50_us=N p99_us=N max_us=N. Exit status 1 where a connection
// was lost.
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <random>
#include <string_view>
#include <thread>
#include <vector>

#include "propertylist/Payload.h"
#include "wire/FrameReader.h"
#include "wire/FrameWriter.h"

namespace {

using namespace std::chrono_literals;
using vx::CborWriter;
using vx::wire::FrameReader;
using vx::wire::FrameWriter;
using vx::wire::Operation;
using Clock = std::chrono::steady_clock;

constexpr int kWindow = 256;  // calls of one connection that are not answered yet

const vx::Payload& message() {
  static const vx::Payload payload = vx::PayloadBuilder()
                                         .set("frames_rendered", 48000)
                                         .set("underruns", 3)
                                         .set("latency_ms", 12.5)
                                         .set("route", "speaker and earpiece")
                                         .build();
  return payload;
}

struct Tally {
  uint64_t answers = 0;
  uint64_t refused = 0;
  bool lost = false;
};

// -1 and a word where that fails.
int connectTo(const char* path) {
  const int fd = socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path, sizeof address.sun_path - 1);
  if (connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) return fd;
  std::perror(path);
  close(fd);
  return -1;
}

class Connection {
 public:
  Connection(const char* path, Tally& tally) : tally_(tally), fd_(connectTo(path)) {
    if (fd_ < 0) std::exit(2);
    fcntl(fd_, F_SETFL, O_NONBLOCK);
    FrameWriter::hello(out_).end();
  }

  int fd() const { return fd_; }
  short interest() const { return static_cast<short>(POLLIN | (out_.empty() ? 0 : POLLOUT)); }
  int unanswered() const { return asked_ - answered_; }

  template <class Write>
  void ask(Operation operation, std::size_t count, const Write& arguments, bool counts = true) {
    FrameWriter frame = FrameWriter::call(out_, counts ? 1 : 2, operation, count);
    arguments(frame.items());
    frame.end();
    asked_ += counts ? 1 : 0;
  }
  void about(Operation operation, int64_t reporter) {
    // A start is answered when the session stops.
    ask(
        operation, 1, [&](CborWriter& w) { w.integer(reporter); },
        operation != Operation::StartReportingSessionForID);
  }
  // To all that are started where there is no reporter.
  void send(int64_t reporter) {
    ask(Operation::SendMessage, 4, [&](CborWriter& w) {
      w.encoded(message().encoded());
      w.integer(0x08000003);
      w.integer(0);
      if (reporter == 0) return w.null();
      w.array(1);
      w.integer(reporter);
    });
  }

  // False when the connection is lost.
  bool exchange(short ready) {
    if ((ready & POLLOUT) != 0) {
      const ssize_t sent = ::send(fd_, out_.data(), out_.size(), MSG_NOSIGNAL);
      if (sent > 0) out_.erase(out_.begin(), out_.begin() + sent);
    }
    if ((ready & (POLLIN | POLLHUP | POLLERR)) == 0) return true;
    const std::span<uint8_t> space = reader_.space();
    const ssize_t got = recv(fd_, space.data(), space.size(), 0);
    if (got < 0 && errno == EAGAIN) return true;
    if (got <= 0) return false;
    reader_.received(static_cast<std::size_t>(got));
    std::span<const uint8_t> body;
    while (reader_.next(body) == FrameReader::Next::Frame) {
      if (body[1] != 2 && body[1] != 3) continue;  // the hello
      if (body[2] != 1) continue;                  // a start
      ++answered_;
      ++tally_.answers;
      tally_.refused += body[1] == 3 ? 1 : 0;
    }
    reader_.keepRest();
    return true;
  }

 private:
  Tally& tally_;
  const int fd_;
  int asked_ = 0;
  int answered_ = 0;
  std::vector<uint8_t> out_;
  vx::wire::ReadBuffers buffers_;
  FrameReader reader_{buffers_};
};

// Each connection ends with what it was sent: the service's error, or its patience with nothing.
bool beHostile(const char* path, int count, Clock::time_point end, Tally& tally) {
  std::minstd_rand random(1);
  for (int i = 0; i < count && Clock::now() < end; ++i) {
    std::vector<uint8_t> bytes;
    if (i % 4 != 0) FrameWriter::hello(bytes).end();
    const std::size_t length = random() % 64;
    bytes.insert(bytes.end(),
                 {static_cast<uint8_t>(length), 0, 0, static_cast<uint8_t>(i % 64 == 5)});
    for (std::size_t n = 0; n < length; ++n) bytes.push_back(static_cast<uint8_t>(random()));
    const int fd = connectTo(path);
    if (fd < 0) return false;
    shutdown(send(fd, bytes.data(), bytes.size(), MSG_NOSIGNAL) < 0 ? -1 : fd, SHUT_WR);
    uint8_t answer[512];
    while (recv(fd, answer, sizeof answer, 0) > 0) {
    }
    close(fd);
    ++tally.answers;
  }
  return true;
}

void waitAll(std::vector<Connection>& connections, Tally& tally, Clock::time_point end) {
  std::vector<pollfd> set;
  for (const Connection& c : connections) set.push_back({c.fd(), c.interest(), 0});
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(end - Clock::now());
  poll(set.data(), set.size(), static_cast<int>(std::max<int64_t>(left.count(), 0)));
  for (std::size_t i = 0; i < set.size(); ++i) {
    if (set[i].revents != 0 && !connections[i].exchange(set[i].revents)) tally.lost = true;
  }
}

int report(const Tally& tally, std::vector<double> times) {
  std::sort(times.begin(), times.end());
  const auto at = [&](double part) {
    return times.empty()
               ? 0.0
               : times[static_cast<std::size_t>(part * static_cast<double>(times.size() - 1))];
  };
  std::printf("answers=%llu refused=%llu p50_us=%.0f p99_us=%.0f max_us=%.0f\n",
              static_cast<unsigned long long>(tally.answers),
              static_cast<unsigned long long>(tally.refused), at(0.5), at(0.99), at(1));
  return tally.lost ? 1 : 0;
}

}  // namespace

int main(int argc, char** argv) {
  if (argc < 4) {
    std::fprintf(
        stderr,
        "usage: vx_load SOCKET SECONDS probe|flood|sessions|reporters|mixed|hostile [COUNT]\n");
    return 2;
  }
  const std::string_view kind = argv[3];
  const int count = argc > 4 ? std::atoi(argv[4]) : 1;
  const Clock::time_point end = Clock::now() + std::chrono::seconds(std::atoi(argv[2]));
  const bool probe = kind == "probe";
  const bool many = kind == "sessions";
  const int64_t first = 1 + int64_t{getpid()} * 100000;
  Tally tally;
  if (kind == "hostile") {
    tally.lost = !beHostile(argv[1], count, end, tally);
    return report(tally, {});
  }
  std::vector<Connection> connections;
  connections.reserve(static_cast<std::size_t>(count));
  for (int i = 0; i < (probe || many ? 1 : count); ++i) connections.emplace_back(argv[1], tally);
  for (int i = 0; i < (probe ? 1 : count); ++i) {
    Connection& owner = connections[many ? 0 : static_cast<std::size_t>(i)];
    owner.about(Operation::CreateReportingSession, first + i);
    owner.about(Operation::StartReportingSessionForID, first + i);
  }

  std::vector<double> times;
  Clock::time_point asked = Clock::now();
  uint64_t calls = 0;
  while (!tally.lost && Clock::now() < end) {
    for (std::size_t i = 0; i < connections.size(); ++i) {
      Connection& c = connections[i];
      const int64_t own = first + static_cast<int64_t>(i);
      if (probe) {
        if (c.unanswered() > 0) continue;
        if (calls > 2)
          times.push_back(std::chrono::duration<double, std::micro>(Clock::now() - asked).count());
        std::this_thread::sleep_for(1ms);
        asked = Clock::now();
        c.send(own);
        ++calls;
        (void)c.exchange(POLLOUT);
        continue;
      }
      while (c.unanswered() < kWindow) {
        ++calls;
        if (kind == "reporters") {
          c.ask(Operation::GetAllReporters, 0, [](CborWriter&) {});
        } else if (kind == "mixed" && calls % 20 == 0) {
          c.about(Operation::StopReportingSessionForID, own);
        } else if (kind == "mixed" && calls % 20 == 10) {
          c.about(Operation::StartReportingSessionForID, own);
        } else {
          c.send(many ? 0 : own);
        }
      }
    }
    waitAll(connections, tally, end);
  }
  return report(tally, times);
}
