#include "benchmarks/BenchDaemon.h"

#include <fcntl.h>
#include <poll.h>
#include <sched.h>
#include <signal.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <stdexcept>
#include <thread>

namespace vx::bench {

namespace {

namespace fs = std::filesystem;

constexpr const char* kSyncCounter = "libvx-bench-syncs.so";

uint64_t statusField(const std::string& path, const std::string& field) {
  std::ifstream file(path);
  std::string line;
  while (std::getline(file, line)) {
    if (line.rfind(field + ":", 0) == 0)
      return std::strtoull(line.c_str() + field.size() + 1, nullptr, 10);
  }
  return 0;
}

}  // namespace

std::string daemonProgram() {
  if (const char* set = std::getenv("VXREPORTINGD")) return set;
  return (fs::read_symlink("/proc/self/exe").parent_path().parent_path() /
          "Statistics/vxreportingd")
      .string();
}

BenchDaemon::BenchDaemon(const DaemonOptions& options) {
  const char* root = std::getenv("VX_BENCH_DIR");
  std::string pattern = std::string(root != nullptr ? root : "/tmp") + "/vxbench-XXXXXX";
  if (mkdtemp(pattern.data()) == nullptr) throw std::runtime_error("cannot create " + pattern);
  folder_ = pattern;
  for (const char* name : {"run", "state", "etc", "log", "drivers"})
    fs::create_directory(folder_ + "/" + name);
  std::string memory = "/dev/shm/vxbench-XXXXXX";
  runtimeFolder_ = mkdtemp(memory.data()) != nullptr ? memory : folder_ + "/run";
  socketPath_ = runtimeFolder_ + "/service.socket";
  std::ofstream(folder_ + "/etc/platform.toml")
      << "[device]\ninternal_build = " << (options.internalBuild ? "true" : "false")
      << "\n[log]\ndestination = \"stderr\"\n[listener]\nmax_connections = 20000\n"
         "max_connections_per_user = 20000\nmax_sessions_per_connection = 20000\n"
         "[store]\nmax_bytes = 17179869184\n[orientation]\ndevice_sensor = false\n[drivers]\nroot "
         "= \""
      << folder_ << "/drivers\"\n"
      << options.extraConfiguration;

  const std::string notifyPath = folder_ + "/notify";
  const int notify = socket(AF_UNIX, SOCK_DGRAM | SOCK_CLOEXEC, 0);
  sockaddr_un address{};
  address.sun_family = AF_UNIX;
  std::strncpy(address.sun_path, notifyPath.c_str(), sizeof address.sun_path - 1);
  if (bind(notify, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0) {
    throw std::runtime_error("cannot bind " + notifyPath);
  }

  const std::string program = daemonProgram();
  const auto start = std::chrono::steady_clock::now();
  pid_ = fork();
  if (pid_ == 0) {
    if (options.cpu >= 0) {
      cpu_set_t set;
      CPU_ZERO(&set);
      CPU_SET(static_cast<unsigned>(options.cpu), &set);
      sched_setaffinity(0, sizeof set, &set);
    }
    setenv("NOTIFY_SOCKET", notifyPath.c_str(), 1);
    setenv("RUNTIME_DIRECTORY", runtimeFolder_.c_str(), 1);
    if (options.countSyncs) {
      setenv("VX_BENCH_SYNCS", (folder_ + "/syncs").c_str(), 1);
      const fs::path counter = fs::read_symlink("/proc/self/exe").parent_path() / kSyncCounter;
      setenv("LD_PRELOAD", counter.c_str(), 1);
    }
    setenv("STATE_DIRECTORY", (folder_ + "/state").c_str(), 1);
    setenv("CONFIGURATION_DIRECTORY", (folder_ + "/etc").c_str(), 1);
    setenv("LOGS_DIRECTORY", (folder_ + "/log").c_str(), 1);
    const int log = open((folder_ + "/daemon.log").c_str(), O_WRONLY | O_CREAT | O_APPEND, 0644);
    dup2(log, 2);
    execl(program.c_str(), program.c_str(), static_cast<char*>(nullptr));
    _exit(127);
  }
  pollfd wait{notify, POLLIN, 0};
  const bool ready = poll(&wait, 1, 20000) == 1;
  startToReadyMs_ =
      std::chrono::duration<double, std::milli>(std::chrono::steady_clock::now() - start).count();
  close(notify);
  if (!ready)
    throw std::runtime_error(program + " did not become ready; see " + folder_ + "/daemon.log");
}

BenchDaemon::~BenchDaemon() {
  if (pid_ > 0) {
    kill(pid_, SIGKILL);
    waitpid(pid_, nullptr, 0);
  }
  std::error_code ignored;
  fs::remove_all(folder_, ignored);
  fs::remove_all(runtimeFolder_, ignored);
}

int BenchDaemon::stop() {
  kill(pid_, SIGTERM);
  int status = 0;
  waitpid(pid_, &status, 0);
  pid_ = -1;
  return WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

double BenchDaemon::cpuSeconds() const {
  clockid_t clock{};
  timespec now{};
  if (clock_getcpuclockid(pid_, &clock) != 0 || clock_gettime(clock, &now) != 0) {
    throw std::runtime_error("cannot read the daemon's CPU clock");
  }
  return static_cast<double>(now.tv_sec) + static_cast<double>(now.tv_nsec) * 1e-9;
}

uint64_t BenchDaemon::anonymousBytes() const {
  return statusField("/proc/" + std::to_string(pid_) + "/status", "RssAnon") << 10;
}

uint64_t BenchDaemon::aggregateBytes() const {
  uint64_t bytes = 0;
  std::error_code error;
  const fs::path folder = fs::path(socketPath_).parent_path() / "journal";
  for (fs::directory_iterator at(folder, error), end; !error && at != end; at.increment(error)) {
    if (at->path().filename().string().starts_with("aggregate-")) bytes += at->file_size();
  }
  return bytes;
}

uint64_t BenchDaemon::residentBytes() const {
  return statusField("/proc/" + std::to_string(pid_) + "/status", "VmRSS") << 10;
}

uint64_t BenchDaemon::voluntarySwitches() const {
  uint64_t sum = 0;
  for (const auto& task : fs::directory_iterator("/proc/" + std::to_string(pid_) + "/task")) {
    sum += statusField(task.path() / "status", "voluntary_ctxt_switches");
  }
  return sum;
}

uint64_t BenchDaemon::writtenBytes() const {
  return statusField("/proc/" + std::to_string(pid_) + "/io", "write_bytes");
}

uint64_t BenchDaemon::syncs() const {
  std::error_code none;
  const auto count = fs::file_size(folder_ + "/syncs", none);  // a byte each
  return none ? 0 : count;
}

void BenchDaemon::waitUntilIdle() const {
  const auto end = std::chrono::steady_clock::now() + std::chrono::seconds(60);
  int quiet = 0;
  double before = cpuSeconds();
  while (quiet < 3 && std::chrono::steady_clock::now() < end) {
    std::this_thread::sleep_for(std::chrono::milliseconds(100));
    const double now = cpuSeconds();
    quiet = now - before < 0.0005 ? quiet + 1 : 0;
    before = now;
  }
}

}  // namespace vx::bench
