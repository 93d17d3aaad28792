// What the machine can do at best, measured beside each figure: a bare Unix-stream echo, a bare
// SQLite loop, memcpy.
#pragma once

#include <cstddef>
#include <cstdint>
#include <string>
#include <vector>

struct sqlite3;

namespace vx::bench {

// A child process that reads calls of one size and answers each with a reply of another, one system
// call each way.
class EchoFloor {
 public:
  EchoFloor(std::size_t callBytes, std::size_t replyBytes, int cpu);
  ~EchoFloor();
  EchoFloor(const EchoFloor&) = delete;
  EchoFloor& operator=(const EchoFloor&) = delete;

  // Nanoseconds of each of `count` round trips, one at a time.
  std::vector<double> roundTrips(std::size_t count);
  // Messages per second with `window` calls outstanding.
  double messagesPerSecond(std::size_t count, std::size_t window);

 private:
  std::size_t callBytes_;
  std::size_t replyBytes_;
  int fd_ = -1;
  int child_ = -1;
};

struct SqliteFloorResult {
  double rowsPerSecond = 0;
  double cpuMicrosecondsPerRow = 0;
};

// A prepared statement in a loop into a table like the daemon's: WAL, synchronous=FULL, a commit
// every 1000 rows. Half of the rows are relay messages, half analytics events, of the workload's
// JSON.
class SqliteFloor {
 public:
  explicit SqliteFloor(const std::string& folder);
  ~SqliteFloor();
  SqliteFloor(const SqliteFloor&) = delete;
  SqliteFloor& operator=(const SqliteFloor&) = delete;
  SqliteFloorResult run(std::size_t rows);

 private:
  ::sqlite3* database_ = nullptr;
  std::string path_;
  std::vector<std::string> relayJson_;
  std::vector<std::string> analyticsJson_;
};

// Nanoseconds to copy `bytes` bytes once, cold destinations as messages have them.
double memcpyNanoseconds(std::size_t bytes);

void pinThisThread(int cpu);  // -1: any CPU again
double thisThreadCpuSeconds();

}  // namespace vx::bench
