// What can be said of the configuration without asking the service.
#include <cstdio>
#include <filesystem>
#include <string>
#include <vector>

#include "platform/linux/ConfigurationCheck.h"
#include "platform/linux/PlatformConfiguration.h"
#include "tools/report/Command.h"

namespace vx::report {

namespace {

// 0: nothing is wrong; 1: something is.
int checkConfig(const Words& words) {
  const Options options(words, {});
  const Words& named = options.words(0, 1);
  const std::string folder =
      named.empty() ? lnx::Directories::fromEnvironment().configuration : named[0];
  std::error_code unknown;
  if (!std::filesystem::is_directory(folder, unknown))
    throw Failure(folder + " is not a folder; every key would have its default");
  const std::vector<std::string> complaints = lnx::checkConfiguration(folder);
  for (const std::string& complaint : complaints) std::fprintf(stderr, "%s\n", complaint.c_str());
  if (complaints.empty()) std::printf("nothing is wrong in %s\n", folder.c_str());
  return complaints.empty() ? 0 : 1;
}

constexpr Command kCommands[] = {
    {"check-config", "[FOLDER]", "what is wrong in platform.toml and the preferences",
     "Prints a line for each mistake, and asks no service. FOLDER: $CONFIGURATION_DIRECTORY, or\n"
     "/etc/vxreporting. Exit status 1 when something is wrong.\n",
     checkConfig},
};

}  // namespace

std::span<const Command> configurationCommands() { return kCommands; }

}  // namespace vx::report
