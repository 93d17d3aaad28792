// One client of a kind, for the fault programs: vx_load SOCKET SECONDS KIND [COUNT]
//   probe        one message each millisecond over COUNT connections, each to a session of its own,
//                each once the one before has been answered
//   flood        COUNT connections, each sending to its own session as fast as it is answered
//   sessions     one connection, sending to COUNT started sessions
//   reporters    COUNT connections that ask for all reporters
//   mixed        like flood, and each tenth call starts or stops a session
//   dying        again and again: sends COUNT messages to each of 1024 started sessions, and is
//   gone unknown      COUNT connections that send to identifiers of no session, 4096 in each call
//   large        COUNT connections that configure their session with all that fits into a call
//   idle         COUNT connections with a session each, and nothing more
//   hostile      COUNT frames that are no calls of any operation, on one connection after the other
//   soak         COUNT messages a second over 16 connections, whose sessions come and go, as they
//   do
// The last line: answers=N refused=N p50_us=N p99_us=N max_us=N. Exit status 1 where a connection
// was lost.
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <array>
#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <memory>
#include <random>
#include <string_view>
#include <thread>
#include <vector>

#include "base/UniqueFd.h"
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
constexpr int kLargeWindow = 4;
constexpr int kSessionsOfDying = 1024;
constexpr int kUnknownPerCall = 4096;

const vx::Payload& message() {
  static const vx::Payload payload = vx::PayloadBuilder()
                                         .set("frames_rendered", 48000)
                                         .set("underruns", 3)
                                         .set("latency_ms", 12.5)
                                         .set("route", "speaker and earpiece")
                                         .build();
  return payload;
}

const vx::Payload& largeConfiguration() {
  static const vx::Payload payload =
      vx::PayloadBuilder().set("notes", std::string(std::size_t{1000} << 10, 'x')).build();
  return payload;
}

struct Tally {
  std::vector<float> times;  // of round trips, in microseconds, where they are wanted
  uint64_t answers = 0;
  uint64_t refused = 0;
  uint64_t sends = 0;  // of soak
  uint64_t sessions = 0;
  bool lost = false;
};

// None and a word where that fails.
vx::UniqueFd connectTo(const char* path) {
  vx::UniqueFd fd(socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, path, sizeof address.sun_path - 1);
  if (connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0) return fd;
  std::perror(path);
  return {};
}

class Connection {
 public:
  Connection(const char* path, Tally& tally) : tally_(tally), fd_(connectTo(path)) {
    if (!fd_) std::exit(2);
    fcntl(fd_.get(), F_SETFL, O_NONBLOCK);
    FrameWriter::hello(out_).end();
  }

  int fd() const { return fd_.get(); }
  short interest() const { return static_cast<short>(POLLIN | (out_.empty() ? 0 : POLLOUT)); }
  int unanswered() const { return asked_ - answered_; }
  // From now on each call's round trip is taken, which must be answered in order.
  void takeTimes() { takesTimes_ = true; }

  template <class Write>
  void ask(Operation operation, std::size_t count, const Write& arguments, bool counts = true) {
    FrameWriter frame = FrameWriter::call(out_, counts ? 1 : 2, operation, count);
    arguments(frame.items());
    frame.end();
    asked_ += counts ? 1 : 0;
    if (takesTimes_ && counts) asks_.push_back(Clock::now());
  }
  void about(Operation operation, int64_t reporter) {
    // A start is answered when the session stops.
    ask(
        operation, 1, [&](CborWriter& w) { w.integer(reporter); },
        operation != Operation::StartReportingSessionForID);
  }
  // To all that are started where there is no reporter.
  void send(int64_t reporter, int identifiers = 1) {
    ask(Operation::SendMessage, 4, [&](CborWriter& w) {
      w.encoded(message().encoded());
      w.integer(0x08000003);
      w.integer(0);
      if (reporter == 0) return w.null();
      w.array(static_cast<std::size_t>(identifiers));
      for (int i = 0; i < identifiers; ++i) w.integer(reporter + i);
    });
  }
  void configure(int64_t reporter) {
    ask(Operation::SetConfiguration, 2, [&](CborWriter& w) {
      w.encoded(largeConfiguration().encoded());
      w.integer(reporter);
    });
  }

  // False when the connection is lost.
  bool exchange(short ready) {
    if ((ready & POLLOUT) != 0) {
      const ssize_t sent = ::send(fd_.get(), out_.data(), out_.size(), MSG_NOSIGNAL);
      if (sent > 0) out_.erase(out_.begin(), out_.begin() + sent);
    }
    if ((ready & (POLLIN | POLLHUP | POLLERR)) == 0) return true;
    const std::span<uint8_t> space = reader_.space();
    const ssize_t got = recv(fd_.get(), space.data(), space.size(), 0);
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
      if (asks_.empty()) continue;
      tally_.times.push_back(
          std::chrono::duration<float, std::micro>(Clock::now() - asks_.front()).count());
      asks_.pop_front();
    }
    reader_.keepRest();
    return true;
  }

 private:
  Tally& tally_;
  const vx::UniqueFd fd_;
  int asked_ = 0;
  int answered_ = 0;
  bool takesTimes_ = false;
  std::deque<Clock::time_point> asks_;
  std::vector<uint8_t> out_;
  vx::wire::ReadBuffers buffers_;
  FrameReader reader_{buffers_};
};

using Connections = std::vector<std::unique_ptr<Connection>>;

// Until something has come, or then.
void exchangeAll(const Connections& connections, Tally& tally, Clock::time_point until) {
  std::vector<pollfd> set;
  for (const auto& c : connections) set.push_back({c->fd(), c->interest(), 0});
  const auto left = std::chrono::ceil<std::chrono::milliseconds>(until - Clock::now());
  poll(set.data(), set.size(), static_cast<int>(std::max<int64_t>(left.count(), 0)));
  for (std::size_t i = 0; i < set.size(); ++i) {
    if (set[i].revents != 0 && !connections[i]->exchange(set[i].revents)) tally.lost = true;
  }
}

struct Load {
  const char* path;
  std::string_view kind;
  int count;
  Clock::time_point end;
  int64_t first;  // of the identifiers that are its own
  Tally& tally;

  bool goesOn() const { return !tally.lost && Clock::now() < end; }
  std::unique_ptr<Connection> connected() const {
    return std::make_unique<Connection>(path, tally);
  }
};

void openSession(Connection& connection, int64_t reporter) {
  connection.about(Operation::CreateReportingSession, reporter);
  connection.about(Operation::StartReportingSessionForID, reporter);
}

// Calls `send` so often, with one connection after the other.
template <class Send>
void pace(const Load& load, const Connections& connections, int perSecond, const Send& send) {
  const std::chrono::nanoseconds interval = std::chrono::nanoseconds(1s) / perSecond;
  Clock::time_point due = Clock::now();
  for (std::size_t i = 0; load.goesOn();) {
    for (; due <= Clock::now(); due += interval) send(i++ % connections.size());
    exchangeAll(connections, load.tally, std::min(due, load.end));
  }
}

void probe(const Load& load) {
  Connections connections;
  for (int i = 0; i < load.count; ++i) {
    connections.push_back(load.connected());
    openSession(*connections.back(), load.first + i);
  }
  pace(load, connections, 1000, [&](std::size_t i) {
    Connection& c = *connections[i];
    if (c.unanswered() > 0) return;
    c.takeTimes();
    c.send(load.first + static_cast<int64_t>(i));
    if (!c.exchange(POLLOUT)) load.tally.lost = true;
  });
}

void soak(const Load& load) {
  struct Client {
    int64_t reporter;
    int sent = 0;
  };
  constexpr std::size_t kClients = 16;
  constexpr int kPerSession = 5000;
  constexpr int kPerConnection = 4 * kPerSession;
  Connections connections(kClients);
  std::vector<Client> clients(kClients);
  int64_t next = load.first;
  const auto open = [&](std::size_t i) {
    openSession(*connections[i], clients[i].reporter = next++);
  };
  const auto connect = [&](std::size_t i) {
    connections[i] = load.connected();
    connections[i]->takeTimes();
    clients[i].sent = 0;
    open(i);
  };
  for (std::size_t i = 0; i < kClients; ++i) connect(i);
  pace(load, connections, load.count, [&](std::size_t i) {
    Connection& c = *connections[i];
    Client& client = clients[i];
    if (client.sent == kPerConnection + static_cast<int>(i)) {
      if (c.unanswered() > 0) return;
      return connect(i);  // the session is stopped for it
    }
    load.tally.sessions +=
        client.sent % kPerSession == 0 ? 1 : 0;  // one that has something to sum up
    ++load.tally.sends;
    c.send(client.reporter);
    if (++client.sent % kPerSession != 0) return;
    c.about(Operation::StopReportingSessionForID, client.reporter);
    c.about(Operation::DestroyReportingSession, client.reporter);
    open(i);
  });
  // Whoever is answered is done with what it sent.
  const Clock::time_point patience = Clock::now() + 10s;
  const auto waits = [](const auto& c) { return c->unanswered() > 0; };
  while (!load.tally.lost && std::ranges::any_of(connections, waits) && Clock::now() < patience)
    exchangeAll(connections, load.tally, patience);
}

void die(const Load& load) {
  while (load.goesOn()) {
    Connections alone;
    alone.push_back(load.connected());
    Connection& c = *alone.front();
    for (int i = 0; i < kSessionsOfDying; ++i) openSession(c, load.first + i);
    int sent = 0;
    while (load.goesOn() && (sent < load.count || c.unanswered() > 0)) {
      for (; sent < load.count && c.unanswered() < kSessionsOfDying + kWindow; ++sent)
        c.send(load.first, kSessionsOfDying);
      exchangeAll(alone, load.tally, load.end);
    }
  }
}

// Each with one session; what they are answered stays in their sockets.
void stayIdle(const Load& load) {
  std::vector<vx::UniqueFd> all;
  while (static_cast<int>(all.size()) < load.count && !load.tally.lost) {
    std::vector<uint8_t> bytes;
    FrameWriter::hello(bytes).end();
    FrameWriter create = FrameWriter::call(bytes, 1, Operation::CreateReportingSession, 1);
    create.items().integer(load.first + static_cast<int64_t>(all.size()));
    create.end();
    all.push_back(connectTo(load.path));
    load.tally.lost = !all.back();
    if (send(all.back().get(), bytes.data(), bytes.size(), MSG_NOSIGNAL) > 0) ++load.tally.answers;
  }
  std::this_thread::sleep_until(load.end);
}

// Calls of an operation that there is not, or with arguments of other kinds, are answered each; the
// frame after them ends the connection.
void beHostile(const Load& load) {
  constexpr int kFramesEach = 64;
  std::minstd_rand random(1);
  for (int frames = 0; frames < load.count && load.goesOn(); frames += kFramesEach) {
    std::vector<uint8_t> bytes;
    if (random() % 8 != 0) FrameWriter::hello(bytes).end();
    for (int i = 1; i < kFramesEach; ++i) {
      const auto operation = static_cast<Operation>(random() % 14);
      FrameWriter frame = FrameWriter::call(bytes, static_cast<uint64_t>(i), operation, 5);
      for (int n = 0; n < 5; ++n) frame.items().integer(static_cast<int64_t>(random()));
      frame.end();
    }
    const std::size_t length = random() % 64;
    bytes.insert(bytes.end(),
                 {static_cast<uint8_t>(length), 0, 0, static_cast<uint8_t>(random() % 2)});
    for (std::size_t n = 0; n < length; ++n) bytes.push_back(static_cast<uint8_t>(random()));
    const vx::UniqueFd fd = connectTo(load.path);
    load.tally.lost = !fd;
    if (!fd) return;
    if (send(fd.get(), bytes.data(), bytes.size(), MSG_NOSIGNAL) >= 0) shutdown(fd.get(), SHUT_WR);
    std::array<uint8_t, 4096> answer{};
    while (recv(fd.get(), answer.data(), answer.size(), 0) > 0) {
    }
    load.tally.answers += kFramesEach;
  }
}

// Everything else: as many calls as are answered.
void flood(const Load& load) {
  const bool many = load.kind == "sessions";
  Connections connections;
  for (int i = 0; i < (many ? 1 : load.count); ++i) connections.push_back(load.connected());
  for (int i = 0; i < load.count; ++i)
    openSession(*connections[many ? 0 : static_cast<std::size_t>(i)], load.first + i);
  const int window = load.kind == "unknown" || load.kind == "large" ? kLargeWindow : kWindow;
  uint64_t calls = 0;
  while (load.goesOn()) {
    for (std::size_t i = 0; i < connections.size(); ++i) {
      Connection& c = *connections[i];
      const int64_t own = load.first + static_cast<int64_t>(i);
      while (c.unanswered() < window) {
        ++calls;
        if (load.kind == "reporters") {
          c.ask(Operation::GetAllReporters, 0, [](CborWriter&) {});
        } else if (load.kind == "unknown") {
          c.send(-load.first, kUnknownPerCall);
        } else if (load.kind == "large") {
          c.configure(own);
        } else if (load.kind == "mixed" && calls % 20 == 0) {
          c.about(Operation::StopReportingSessionForID, own);
        } else if (load.kind == "mixed" && calls % 20 == 10) {
          c.about(Operation::StartReportingSessionForID, own);
        } else {
          c.send(many ? 0 : own);
        }
      }
    }
    exchangeAll(connections, load.tally, load.end);
  }
}

struct Kind {
  std::string_view name;
  void (*run)(const Load&);
};
constexpr Kind kKinds[] = {
    {"probe", probe},   {"flood", flood}, {"sessions", flood},    {"reporters", flood},
    {"mixed", flood},   {"large", flood}, {"unknown", flood},     {"dying", die},
    {"idle", stayIdle}, {"soak", soak},   {"hostile", beHostile},
};

int report(Tally& tally) {
  std::ranges::sort(tally.times);
  const auto at = [&](double part) {
    const auto last = static_cast<double>(tally.times.size()) - 1;
    return tally.times.empty() ? 0.0F : tally.times[static_cast<std::size_t>(part * last)];
  };
  std::printf(
      "answers=%llu refused=%llu sends=%llu sessions=%llu p50_us=%.0f p99_us=%.0f max_us=%.0f\n",
      static_cast<unsigned long long>(tally.answers),
      static_cast<unsigned long long>(tally.refused), static_cast<unsigned long long>(tally.sends),
      static_cast<unsigned long long>(tally.sessions), static_cast<double>(at(0.5)),
      static_cast<double>(at(0.99)), static_cast<double>(at(1)));
  return tally.lost ? 1 : 0;
}

}  // namespace

int main(int argc, char** argv) {
  const auto kind =
      std::ranges::find(kKinds, std::string_view(argc > 3 ? argv[3] : ""), &Kind::name);
  if (kind == std::end(kKinds)) {
    std::fputs("usage: vx_load SOCKET SECONDS KIND [COUNT], where KIND is one of\n", stderr);
    for (const Kind& known : kKinds) std::fprintf(stderr, "  %s\n", known.name.data());
    return 2;
  }
  Tally tally;
  kind->run({.path = argv[1],
             .kind = kind->name,
             .count = argc > 4 ? std::atoi(argv[4]) : 1,
             .end = Clock::now() + std::chrono::seconds(std::atoi(argv[2])),
             .first = 1 + int64_t{getpid()} * 10'000'000,
             .tally = tally});
  return report(tally);
}
