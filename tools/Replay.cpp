// vx-replay: runs what a journal has recorded into a store of its own, for developers.
#include <sys/stat.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <iterator>
#include <stdexcept>
#include <string>
#include <vector>

#include "Statistics/Service/VXReportingServiceDelegate.h"
#include "Statistics/VXReportingProcessState.h"
#include "platform/linux/LinuxPlatform.h"
#include "platform/linux/journal/JournalReader.h"
#include "platform/linux/recovery/JournalOpening.h"

namespace {

namespace fs = std::filesystem;
using Bytes = std::vector<char>;
using namespace vx::lnx;

constexpr const char* kHelp =
    "vx-replay --journal DIR --into DIR\n"
    "Runs the calls that are recorded in a journal (a copy of <runtime directory>/journal, or of\n"
    "<state directory>/journal) once more, at the times they were accepted at, as the service "
    "does\n"
    "after a crash, but for all of them. Nobody is served meanwhile. --into is made, and gets\n"
    "state/telemetry.db, the summary files below log/, and etc/platform.toml, which says how.\n";

constexpr const char* kConfiguration =
    "[device]\ninternal_build = true\n[log]\ndestination = \"stderr\"\n"
    "[store]\nmax_bytes = \"64GiB\"\nmax_age_days = 0\n";

void copyJournal(const fs::path& from, const fs::path& to) {
  fs::create_directories(to);
  fs::permissions(to, fs::perms::owner_all);
  for (const auto& file : fs::directory_iterator(from)) {
    if (!file.is_regular_file() ||
        (file.path().extension() != ".vxj" && file.path().extension() != ".vxa"))
      continue;
    const fs::path copy = to / file.path().filename();
    fs::copy_file(file, copy);
    fs::permissions(copy, fs::perms::owner_read | fs::perms::owner_write);
  }
}

// A call that was done has its rows elsewhere. From the newest state that was recorded on.
void makeAllUndone(const fs::path& folder) {
  const auto epoch = epochOfJournal(folder, "");
  if (!epoch) throw std::runtime_error("there are no recorded calls");
  const auto contents = JournalReader::read(folder, *epoch);
  if (!contents.ok()) throw std::runtime_error(contents.status().text());
  for (const auto& file : fs::directory_iterator(folder)) {
    if (file.path().extension() != ".vxj") continue;
    std::fstream stream(file.path(), std::ios::binary | std::ios::in | std::ios::out);
    Bytes bytes((std::istreambuf_iterator<char>(stream)), {});
    SegmentHeader header;
    if (bytes.size() < kFirstEntry) continue;
    std::memcpy(&header, bytes.data(), sizeof header);
    if (header.generation < contents->base) continue;
    stream.clear();
    const std::span all(reinterpret_cast<const uint8_t*>(bytes.data()), bytes.size());
    for (const JournalReader::Entry& entry : JournalReader::readSegment(all).entries) {
      if (entry.header.type != EntryType::Call) continue;
      constexpr uint32_t kOne = 1;
      stream.seekp(static_cast<std::streamoff>(entry.offset + offsetof(EntryHeader, waiting)));
      stream.write(reinterpret_cast<const char*>(&kOne), sizeof kOne);
    }
  }
}

int replay(const fs::path& journal, const fs::path& into) {
  if (!fs::create_directories(into)) throw std::runtime_error(into.string() + " is there already");
  copyJournal(journal, into / "run/journal");
  makeAllUndone(into / "run/journal");
  for (const auto& [variable, name] : {std::pair{"RUNTIME_DIRECTORY", "run"},
                                       {"STATE_DIRECTORY", "state"},
                                       {"CONFIGURATION_DIRECTORY", "etc"},
                                       {"LOGS_DIRECTORY", "log"}}) {
    fs::create_directories(into / name);
    setenv(variable, fs::absolute(into / name).c_str(), 1);
  }
  for (const char* variable : {"NOTIFY_SOCKET", "WATCHDOG_USEC", "LISTEN_FDS"}) unsetenv(variable);
  std::ofstream(into / "etc/platform.toml") << kConfiguration;
  std::string problem;
  const auto platform = LinuxPlatform::start(problem);
  if (platform == nullptr) throw std::runtime_error(problem);
  vx::installPlatform(&platform->services());
  platform->begin();
  platform->recover([] { return vx::VXReportingServiceDelegate::create(); });
  vx::VXReportingProcessState::current().delayedMessages().sendAllFromNow();
  return platform->shutDown();
}

}  // namespace

int main(int argc, char** argv) {
  const std::vector<std::string> words(argv + 1, argv + argc);
  if (words.size() == 4 && words[0] == "--journal" && words[2] == "--into") {
    try {
      return replay(words[1], words[3]);
    } catch (const std::exception& failure) {
      std::fprintf(stderr, "vx-replay: %s\n", failure.what());
      return 1;
    }
  }
  const bool asked = words.size() == 1 && words[0] == "--help";
  std::fputs(kHelp, asked ? stdout : stderr);
  return asked ? 0 : 2;
}
