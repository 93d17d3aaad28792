// vxreport: what a shell can ask of the service and of what it has stored. `vxreport help` lists
// the commands.
#include <algorithm>
#include <cstdio>
#include <string>

#include "tools/report/Command.h"

namespace {

using vx::report::Command;
using vx::report::Words;

struct Group {
  const char* title;
  std::span<const Command> commands;
};

const Group kGroups[] = {
    {"The running service", vx::report::inspectCommands()},
    {"The store", vx::report::storeCommands()},
    {"What must not stay", vx::report::eraseCommands()},
    {"To look at", vx::report::pictureCommands()},
    {"Messages", vx::report::messageCommands()},
    {"Configuration", vx::report::configurationCommands()},
    {"Calls of the running service", vx::report::serviceCommands()},
};

void printList(std::FILE* out) {
  std::fputs("usage: vxreport COMMAND [ARGUMENT...]; vxreport COMMAND --help says more\n", out);
  for (const Group& group : kGroups) {
    std::fprintf(out, "\n%s:\n", group.title);
    for (const Command& command : group.commands)
      std::fprintf(out, "  %-12s %s\n", command.name, command.summary);
  }
  std::fputs(
      "\nExit status: 0 done, 1 it could not be done (one sentence says why), 2 not a command.\n",
      out);
}

void printHelp(std::FILE* out, const Command& command) {
  const char* const blank = *command.synopsis != '\0' ? " " : "";
  std::fprintf(out, "usage: vxreport %s%s%s\n\n%s", command.name, blank, command.synopsis,
               command.help);
}

const Command* find(const std::string& name) {
  for (const Group& group : kGroups) {
    const auto found = std::ranges::find(group.commands, name, &Command::name);
    if (found != group.commands.end()) return &*found;
  }
  return nullptr;
}

int run(const Words& words) {
  const bool help = words[0] == "help" || words[0] == "--help" || words[0] == "-h";
  if (help && words.size() < 2) return printList(stdout), 0;
  const Command* const command = find(words[help ? 1 : 0]);
  if (command == nullptr) {
    std::fprintf(stderr, "vxreport: there is no command '%s'; see vxreport help\n",
                 words[help ? 1 : 0].c_str());
    return 2;
  }
  if (help || (words.size() > 1 && (words[1] == "--help" || words[1] == "-h")))
    return printHelp(stdout, *command), 0;
  try {
    return command->run(words);
  } catch (const vx::report::UsageError&) {
    printHelp(stderr, *command);
    return 2;
  } catch (const std::exception& failure) {
    std::fprintf(stderr, "vxreport: %s\n", failure.what());
    return 1;
  }
}

}  // namespace

int main(int argc, char** argv) {
  // A script's answers come one by one, through a pipe too.
  std::setvbuf(stdout, nullptr, _IOLBF, 0);
  if (argc < 2) return printList(stderr), 2;
  const int status = run({argv + 1, argv + argc});
  if (std::fflush(stdout) == 0 && std::ferror(stdout) == 0) return status;
  std::perror("vxreport: cannot write");
  return 1;
}
