// Whatever a settings file holds: what it says is taken within its bounds or complained of with the
// file's name, and every preference can be read.
#include <unistd.h>

#include <cstdlib>
#include <fstream>

#include "platform/linux/PlatformConfiguration.h"
#include "platform/linux/settings/TomlPreferences.h"
#include "tests/fakes/FakePlatform.h"

static void require(bool holds) {
  if (!holds) __builtin_trap();
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size) {
  static vx::fakes::FakePlatform platform;
  static const std::string folder = [] {
    std::string made = "/dev/shm/vxfuzz-XXXXXX";
    if (mkdtemp(made.data()) == nullptr) std::abort();
    return made;
  }();
  platform.journal.silent = true;
  const std::string path = folder + "/platform.toml";
  std::ofstream(path, std::ios::binary)
      .write(reinterpret_cast<const char*>(data), static_cast<std::streamsize>(size));
  std::vector<std::string> complaints;
  const auto read =
      vx::lnx::PlatformConfiguration::load({folder, folder, folder, folder}, complaints);
  for (const std::string& line : complaints) require(line.starts_with(path + ":"));
  require(read.listener.maxConnections >= 1 && read.listener.maxFrameBytes >= 1024 &&
          read.listener.maxFrameBytes <= read.listener.kLargestFrameBytes);
  require(read.store.maxBytes >= 1 << 20 && read.store.commit.bytes > 0 &&
          read.store.commit.interval.count() > 0 && read.log.refillPerSecond > 0);
  for (const auto& source : read.drivers.mapped) require(!source.path.empty());
  const auto domain = vx::lnx::TomlPreferences(folder).open("platform");
  for (const char* key : {"a", "device", "log", "device_name", "enabled"}) {
    const bool there = domain->hasObject(key);
    require(there || (!domain->string(key) && !domain->boolean(key)));
    if (const auto text = domain->string(key); text == "1") require(domain->boolean(key));
  }
  return 0;
}
