// The real daemon as a child process in a folder of its own, and what the kernel says of it.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <cstdint>
#include <string>

namespace vx::bench {

struct DaemonOptions {
  int cpu = -1;  // pin all its threads; -1: no pinning
  bool internalBuild = false;
  std::string extraConfiguration;
  bool countSyncs = false;
};

class BenchDaemon {
 public:
  explicit BenchDaemon(const DaemonOptions& options = {});
  ~BenchDaemon();
  BenchDaemon(const BenchDaemon&) = delete;
  BenchDaemon& operator=(const BenchDaemon&) = delete;

  const std::string& socketPath() const { return socketPath_; }
  std::string databasePath() const { return folder_ + "/state/telemetry.db"; }
  const std::string& folder() const { return folder_; }
  double startToReadyMs() const { return startToReadyMs_; }

  double cpuSeconds() const;           // all threads, since its start
  uint64_t anonymousBytes() const;     // RssAnon
  uint64_t aggregateBytes() const;     // what sessions received: shared memory
  uint64_t residentBytes() const;      // VmRSS
  uint64_t voluntarySwitches() const;  // all threads
  uint64_t writtenBytes() const;       // that the kernel has for a disk; 0 on a tmpfs
  uint64_t syncs() const;              // fsync and fdatasync, if they are counted
  // Until it has used no more than a few hundred microseconds of CPU for a while.
  void waitUntilIdle() const;
  // SIGTERM; its exit status.
  int stop();

 private:
  std::string folder_;
  std::string runtimeFolder_;  // on a tmpfs, as on a device
  std::string socketPath_;
  pid_t pid_ = -1;
  double startToReadyMs_ = 0;
};

// The file of the daemon's program, from $VXREPORTINGD or beside this program.
std::string daemonProgram();

}  // namespace vx::bench
