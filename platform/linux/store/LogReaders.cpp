#include "platform/linux/store/LogReaders.h"

#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <fstream>
#include <sstream>

namespace vx::lnx {

namespace {

constexpr long kFirstReadLock = 123;
constexpr long kLastReadLock = 127;
constexpr std::size_t kMostLines = 4096;
constexpr std::size_t kMostReaders = 4;

}  // namespace

// 3: POSIX  ADVISORY  READ 4711 fe:01:393222 124 124
std::vector<pid_t> readersIn(std::istream& locks, ino_t index) {
  std::vector<pid_t> readers;
  const std::string file = ":" + std::to_string(index);
  std::string line;
  for (std::size_t i = 0; i < kMostLines && std::getline(locks, line); ++i) {
    std::istringstream words(line);
    std::string number, type, mode, access, where;
    pid_t pid = 0;
    long first = 0, last = 0;
    if (!(words >> number >> type >> mode >> access >> pid >> where >> first >> last)) continue;
    if (access != "READ" || !where.ends_with(file) || first > kLastReadLock ||
        last < kFirstReadLock || pid <= 0 || pid == getpid())
      continue;
    if (std::ranges::find(readers, pid) == readers.end()) readers.push_back(pid);
    if (readers.size() == kMostReaders) break;
  }
  return readers;
}

std::string readersOf(const std::string& path) {
  struct stat index {};
  if (stat((path + "-shm").c_str(), &index) != 0) return "";
  std::ifstream locks("/proc/locks");
  std::string text;
  for (const pid_t pid : readersIn(locks, index.st_ino)) {
    std::string name;
    std::getline(std::ifstream("/proc/" + std::to_string(pid) + "/comm"), name);
    text += (text.empty() ? "" : ", ") + name + " (pid " + std::to_string(pid) + ")";
  }
  return text;
}

}  // namespace vx::lnx
