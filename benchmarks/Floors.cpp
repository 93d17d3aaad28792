#include "benchmarks/Floors.h"

#include <sched.h>
#include <signal.h>
#include <sqlite3.h>
#include <sys/socket.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <chrono>
#include <cstring>
#include <stdexcept>
#include <thread>

#include "benchmarks/Workload.h"
#include "propertylist/JsonWriter.h"

namespace vx::bench {

namespace {

using SteadyClock = std::chrono::steady_clock;

double since(SteadyClock::time_point start) {
  return std::chrono::duration<double>(SteadyClock::now() - start).count();
}

bool receiveAll(int fd, char* buffer, std::size_t bytes) {
  return recv(fd, buffer, bytes, MSG_WAITALL) == static_cast<ssize_t>(bytes);
}

void execute(sqlite3* database, const char* sql) {
  char* message = nullptr;
  if (sqlite3_exec(database, sql, nullptr, nullptr, &message) != SQLITE_OK) {
    throw std::runtime_error(std::string(sql) + ": " + (message != nullptr ? message : "failed"));
  }
}

}  // namespace

void pinThisThread(int cpu) {
  cpu_set_t set;
  CPU_ZERO(&set);
  if (cpu >= 0) {
    CPU_SET(static_cast<unsigned>(cpu), &set);
  } else {
    for (unsigned i = 0; i < std::thread::hardware_concurrency(); ++i) CPU_SET(i, &set);
  }
  sched_setaffinity(0, sizeof set, &set);
}

double thisThreadCpuSeconds() {
  timespec now{};
  clock_gettime(CLOCK_THREAD_CPUTIME_ID, &now);
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

EchoFloor::EchoFloor(std::size_t callBytes, std::size_t replyBytes, int cpu)
    : callBytes_(callBytes), replyBytes_(replyBytes) {
  int pair[2];
  if (socketpair(AF_UNIX, SOCK_STREAM, 0, pair) != 0) throw std::runtime_error("socketpair failed");
  child_ = fork();
  if (child_ == 0) {
    close(pair[0]);
    if (cpu >= 0) pinThisThread(cpu);
    std::vector<char> buffer(callBytes_ + replyBytes_);
    while (receiveAll(pair[1], buffer.data(), callBytes_)) {
      if (send(pair[1], buffer.data(), replyBytes_, MSG_NOSIGNAL) !=
          static_cast<ssize_t>(replyBytes_))
        break;
    }
    _exit(0);
  }
  close(pair[1]);
  fd_ = pair[0];
}

EchoFloor::~EchoFloor() {
  close(fd_);
  waitpid(child_, nullptr, 0);
}

std::vector<double> EchoFloor::roundTrips(std::size_t count) {
  std::vector<char> buffer(callBytes_ + replyBytes_);
  std::vector<double> times;
  times.reserve(count);
  for (std::size_t i = 0; i < count; ++i) {
    const auto start = SteadyClock::now();
    if (send(fd_, buffer.data(), callBytes_, MSG_NOSIGNAL) < 0) break;
    receiveAll(fd_, buffer.data(), replyBytes_);
    times.push_back(since(start) * 1e9);
  }
  return times;
}

double EchoFloor::messagesPerSecond(std::size_t count, std::size_t window) {
  std::vector<char> buffer(callBytes_ + replyBytes_);
  std::size_t outstanding = 0;
  const auto start = SteadyClock::now();
  for (std::size_t i = 0; i < count; ++i) {
    if (outstanding == window) {
      receiveAll(fd_, buffer.data(), replyBytes_);
      --outstanding;
    }
    if (send(fd_, buffer.data(), callBytes_, MSG_NOSIGNAL) < 0) break;
    ++outstanding;
  }
  while (outstanding-- > 0) receiveAll(fd_, buffer.data(), replyBytes_);
  return static_cast<double>(count) / since(start);
}

SqliteFloor::SqliteFloor(const std::string& folder) : path_(folder + "/floor.db") {
  if (sqlite3_open(path_.c_str(), &database_) != SQLITE_OK)
    throw std::runtime_error("cannot open " + path_);
  execute(database_, "PRAGMA journal_mode=WAL");
  execute(database_, "PRAGMA synchronous=FULL");
  execute(
      database_,
      "CREATE TABLE relay_messages(id INTEGER PRIMARY KEY, time REAL, relay_session INTEGER, "
      "category INTEGER,"
      " type INTEGER, payload TEXT);"
      "CREATE TABLE analytics_events(id INTEGER PRIMARY KEY, time REAL, name TEXT, payload TEXT)");
  for (const Payload& payload : workloadPayloads(64)) {
    appendJson(relayJson_.emplace_back(), payload);
    appendJson(analyticsJson_.emplace_back(),
               PayloadBuilder(payload).set("HostApplicationDisplayID", "Unknown").build());
  }
}

SqliteFloor::~SqliteFloor() { sqlite3_close(database_); }

SqliteFloorResult SqliteFloor::run(std::size_t rows) {
  const double cpuBefore = thisThreadCpuSeconds();
  const auto start = SteadyClock::now();
  sqlite3_stmt* relay = nullptr;
  sqlite3_stmt* analytics = nullptr;
  sqlite3_prepare_v2(
      database_,
      "INSERT INTO relay_messages(time, relay_session, category, type, payload) VALUES(?,?,?,?,?)",
      -1, &relay, nullptr);
  sqlite3_prepare_v2(database_, "INSERT INTO analytics_events(time, name, payload) VALUES(?,?,?)",
                     -1, &analytics, nullptr);
  constexpr std::size_t kRowsPerCommit = 1000;
  const std::string name = "com.quorvel.sonik.Session_Playback.Generic";
  for (std::size_t i = 0; i < rows; ++i) {
    if (i % kRowsPerCommit == 0) execute(database_, "BEGIN");
    const double now = 1.7e9 + static_cast<double>(i) * 1e-3;
    if (i % 2 == 0) {
      const std::string& json = relayJson_[(i / 2) % relayJson_.size()];
      sqlite3_bind_double(relay, 1, now);
      sqlite3_bind_int64(relay, 2, 1);
      sqlite3_bind_int64(relay, 3, 3);
      sqlite3_bind_int64(relay, 4, 0);
      sqlite3_bind_text(relay, 5, json.data(), static_cast<int>(json.size()), SQLITE_STATIC);
      sqlite3_step(relay);
      sqlite3_reset(relay);
    } else {
      const std::string& json = analyticsJson_[(i / 2) % analyticsJson_.size()];
      sqlite3_bind_double(analytics, 1, now);
      sqlite3_bind_text(analytics, 2, name.data(), static_cast<int>(name.size()), SQLITE_STATIC);
      sqlite3_bind_text(analytics, 3, json.data(), static_cast<int>(json.size()), SQLITE_STATIC);
      sqlite3_step(analytics);
      sqlite3_reset(analytics);
    }
    if (i % kRowsPerCommit == kRowsPerCommit - 1 || i + 1 == rows) execute(database_, "COMMIT");
  }
  sqlite3_finalize(relay);
  sqlite3_finalize(analytics);
  SqliteFloorResult result;
  result.rowsPerSecond = static_cast<double>(rows) / since(start);
  result.cpuMicrosecondsPerRow =
      (thisThreadCpuSeconds() - cpuBefore) * 1e6 / static_cast<double>(rows);
  return result;
}

double memcpyNanoseconds(std::size_t bytes) {
  constexpr std::size_t kPlaces = 1 << 14;
  std::vector<char> from(bytes, 'x');
  std::vector<char> to(bytes * kPlaces);
  const auto start = SteadyClock::now();
  for (std::size_t i = 0; i < kPlaces; ++i) {
    std::memcpy(to.data() + i * bytes, from.data(), bytes);
    asm volatile("" : : "r"(to.data()) : "memory");
  }
  return since(start) * 1e9 / static_cast<double>(kPlaces);
}

}  // namespace vx::bench
